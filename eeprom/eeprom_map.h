// The one map of the EEPROM: every region the system reads or writes, for
// the product, its tools and its tests.
#pragma once

#include <cstdint>

namespace keymgr::eeprom {

// The first argument of every EEPROM call: the device's EEPROM.
inline constexpr int kDevice = 0;
// The I2C part, 32 KiB, as the image file holds it.
inline constexpr std::uint32_t kSize = 32768;

// The section of configuration and keys. The system writes only the store
// key into it, naming the section as it does.
inline constexpr std::uint32_t kSectionStart = 3072;
inline constexpr std::uint32_t kSectionLength = 2048;

// The store key in its sealed form.
inline constexpr std::uint32_t kStoreKeyOffset = 4244;
inline constexpr std::uint32_t kStoreKeyLength = 48;

// The security-feature configuration word ("SFE CONF"), least significant
// byte first; bit 2 is SFE_003.
inline constexpr std::uint32_t kSfeConfOffset = 4958;
inline constexpr std::uint32_t kSfeConfLength = 4;
inline constexpr std::uint32_t kSfe003Mask = 0x4;

// The integrity-check control byte: mode field (bits 0-1) 2 together with
// the enable bit (bit 6) turns the boot verification on.
inline constexpr std::uint32_t kControlByteOffset = 5049;
inline constexpr std::uint8_t kControlModeMask = 0x03;
inline constexpr std::uint8_t kControlModeVerify = 0x02;
inline constexpr std::uint8_t kControlEnableBit = 0x40;

// The SC message digest.
inline constexpr std::uint32_t kScDigestOffset = 32256;
inline constexpr std::uint32_t kScDigestLength = 32;

// The pin of the TPM's storage key in measured and sealed builds: the
// SHA-256 part of its name, which sessions that carry secrets or record the
// verdict are salted to. Written when a regeneration creates a key under it,
// or by the first boot that finds it blank. Off the disk, so that someone
// who rewrites the disk cannot pin a key of his own.
inline constexpr std::uint32_t kStorageKeyPinOffset = 32288;
inline constexpr std::uint32_t kStorageKeyPinLength = 32;

// Region is one region of the map by name, for tools and tests that read
// or write it.
struct Region {
  const char* name;
  std::uint32_t offset;
  std::uint32_t length;
};
inline constexpr Region kRegions[] = {
    {"store-key", kStoreKeyOffset, kStoreKeyLength},
    {"sfe-conf", kSfeConfOffset, kSfeConfLength},
    {"control", kControlByteOffset, 1},
    {"sc-digest", kScDigestOffset, kScDigestLength},
    {"storage-key-pin", kStorageKeyPinOffset, kStorageKeyPinLength},
};

static_assert(kStoreKeyOffset >= kSectionStart &&
              kStoreKeyOffset + kStoreKeyLength <= kSectionStart + kSectionLength);
static_assert(kScDigestOffset + kScDigestLength <= kStorageKeyPinOffset &&
              kStorageKeyPinOffset + kStorageKeyPinLength <= kSize);

}  // namespace keymgr::eeprom
