// The protected key records of the crypto services and their built-in
// constants. A sized record holds its key bytes masked in the caller's array
// (see mask.h); the nonce travels inside the record, so a bitwise copy reads
// the same bytes and the record owns nothing that needs releasing.
#include <openssl/crypto.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <optional>

#include "crypto/internal.h"
#include "crypto/mask.h"
#include "keymgr_build_config.h"
#include "util/hex.h"
#include "util/secure.h"

namespace keymgr::crypto {

namespace {

// Record states. Distinct magic values, so that a record of stack garbage is
// not taken for an attached one.
constexpr std::uint32_t kStateAttached = 0x504B4101u;
constexpr std::uint32_t kStateSized = 0x504B5302u;

// The initial vector of the AES mode (constant 2). Sealing and unsealing must
// use the same value, so it is fixed in the library.
constexpr std::array<std::uint8_t, kIvSize> kAesIv = {
    0x34, 0x05, 0x5A, 0xBA, 0x75, 0x72, 0xC4, 0x61, 0x31, 0x8B, 0x84, 0xE9, 0x20, 0x61, 0x48, 0xC7};

// The expected digest of the disk-mapper tool (constant 3), taken from the
// build option at compile time; configure has already checked its form.
constexpr std::optional<std::array<std::uint8_t, kSha256Size>> kParsedDmsetupDigest =
    HexBytes<kSha256Size>(KEYMGR_DMSETUP_SHA256);
static_assert(kParsedDmsetupDigest.has_value(), "KEYMGR_DMSETUP_SHA256 must be 64 hex digits");
constexpr std::array<std::uint8_t, kSha256Size> kDmsetupDigest = *kParsedDmsetupDigest;

// The library's process-wide state: the mask key, the nonce counter and the
// records of the three constants. Constant 1 starts bound to nothing; the
// callers bind it to their one-off key before each AES job. Constants 2 and
// 3 are held masked like any other record.
struct Library {
  MaskKey mask;
  std::uint64_t lastNonce;
  ProtectedKey aesKey;
  std::array<std::uint8_t, kIvSize> ivBytes;
  ProtectedKey iv;
  std::array<std::uint8_t, kSha256Size> dmsetupBytes;
  ProtectedKey dmsetup;
};

void SealConstant(Library& lib, ProtectedKey& record, const std::uint8_t* plain,
                  std::uint8_t* store, std::uint32_t length) {
  record.bytes = store;
  record.nonce = ++lib.lastNonce;
  record.length = length;
  record.state = kStateSized;
  XorMask(lib.mask, record.nonce, plain, store, length);
}

bool InitLibrary(Library& lib) {
  lib.mask = DrawMaskKey();
  lib.lastNonce = 0;
  lib.aesKey = ProtectedKey{};
  SealConstant(lib, lib.iv, kAesIv.data(), lib.ivBytes.data(), kIvSize);
  SealConstant(lib, lib.dmsetup, kDmsetupDigest.data(), lib.dmsetupBytes.data(), kSha256Size);
  return true;
}

Library& Lib() {
  static Library lib{};
  static const bool ready = InitLibrary(lib);
  (void)ready;
  return lib;
}

}  // namespace

bool IsAttached(const ProtectedKey* key) {
  return key != nullptr && key->bytes != nullptr &&
         (key->state == kStateAttached || key->state == kStateSized);
}

bool IsSized(const ProtectedKey* key) {
  return key != nullptr && key->bytes != nullptr && key->state == kStateSized;
}

// Constants 2 and 3 are the library's fixed values: one caller must not
// change them for the whole process.
bool IsFixedConstant(const ProtectedKey* key) {
  const Library& lib = Lib();
  return key == &lib.iv || key == &lib.dmsetup;
}

void ReadPlain(const ProtectedKey& key, std::uint8_t* out, std::uint32_t count) {
  const std::uint32_t masked =
      key.state == kStateSized ? (key.length < count ? key.length : count) : 0;
  XorMask(Lib().mask, key.nonce, key.bytes, out, masked);
  std::memcpy(out + masked, key.bytes + masked, count - masked);
}

// Bytes of a longer previous sizing are no longer key bytes and are wiped.
void Store(ProtectedKey* key, const std::uint8_t* plain, std::uint32_t count) {
  Library& lib = Lib();
  const std::uint32_t previous = key->state == kStateSized ? key->length : 0;
  key->nonce = ++lib.lastNonce;
  XorMask(lib.mask, key->nonce, plain, key->bytes, count);
  if (previous > count) {
    OPENSSL_cleanse(key->bytes + count, previous - count);
  }
  key->length = count;
  key->state = kStateSized;
}

}  // namespace keymgr::crypto

using keymgr::Secret;
using namespace keymgr::crypto;

uint32_t VKT_DTC_GetConstant(uint32_t index, ProtectedKey** ref, uint32_t* length) {
  if (ref == nullptr || length == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  Library& lib = Lib();
  switch (index) {
    case DTC_CONST_AES_KEY:
      *ref = &lib.aesKey;
      *length = kAesKeySize;
      return 0;
    case DTC_CONST_AES_PARAM:
      *ref = &lib.iv;
      *length = kIvSize;
      return 0;
    case DTC_CONST_DMSETUP_DIGEST:
      *ref = &lib.dmsetup;
      *length = kSha256Size;
      return 0;
    default:
      *ref = nullptr;
      *length = 0;
      return DTC_E_BAD_SELECTOR;
  }
}

uint32_t ProtectedKey_Attach(ProtectedKey* key, uint32_t option, uint8_t* bytes) {
  if (key == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  if (IsFixedConstant(key)) {
    return DTC_E_BAD_STATE;
  }
  // Any earlier binding is forgotten first, so a refused attachment leaves a
  // record that every operation rejects rather than one bound elsewhere.
  *key = ProtectedKey{};
  if (option != 0) {
    return DTC_E_BAD_SELECTOR;
  }
  if (bytes == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  key->bytes = bytes;
  key->state = kStateAttached;
  return 0;
}

uint32_t ProtectedKey_SetLength(ProtectedKey* key, uint32_t length) {
  if (key == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  if (!IsAttached(key) || IsFixedConstant(key)) {
    return DTC_E_BAD_STATE;
  }
  if (length > kMaxLength) {
    return DTC_E_BAD_LENGTH;
  }
  // A fresh record takes its bytes in from the array; a sized one keeps its
  // key bytes, takes in raw bytes past its old length, and is re-masked.
  Secret<kMaxLength> plain;
  ReadPlain(*key, plain.data(), length);
  Store(key, plain.data(), length);
  return 0;
}

uint8_t ProtectedKey_ByteAt(const ProtectedKey* key, uint32_t index) {
  if (!IsAttached(key)) {
    return 0;
  }
  std::uint8_t value = key->bytes[index];
  if (key->state == kStateSized && index < key->length) {
    const std::uint64_t word = MaskWord(Lib().mask, key->nonce, index / 8);
    value = static_cast<std::uint8_t>(value ^ (word >> (8 * (index % 8))));
  }
  return value;
}
