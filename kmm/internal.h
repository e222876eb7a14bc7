// Operations of the key-management module behind KeyManage. Private to the
// module and its tests; hosts use include/kmm/kmm.h.
#pragma once

#include <kmm/kmm.h>

#include <array>
#include <cstddef>
#include <cstdint>

#include "crypto/dtc.h"
#include "crypto/hash.h"
#include "eeprom/eeprom_map.h"
#include "util/owned.h"

namespace keymgr::kmm {

// Sizes of the module's key material and of the records it stores.
inline constexpr std::size_t kOneOffKeySize = 32;
inline constexpr std::size_t kSeedKeySize = 44;
inline constexpr std::size_t kSecretKeySize = 32;  // hash output kept in the 48-byte area
inline constexpr std::size_t kSealedKeySize = 48;  // secret-key area and store key
inline constexpr std::size_t kScDigestSize = crypto::kSha256Size;  // SC digest
inline constexpr std::size_t kTpmSecretSize = 20;                  // TPM key identity and password
inline constexpr std::size_t kTpmSecretHexSize = 41;               // their hex text with the NUL
inline constexpr std::size_t kStoredOokSize = 284;                 // "keymgr.ook" on disk
inline constexpr std::uint32_t kStoredOokPassed = 268;  // the part handed back to the TPM
inline constexpr std::uint32_t kTpmKeyBits = 2048;

static_assert(kSealedKeySize == eeprom::kStoreKeyLength &&
              kScDigestSize == eeprom::kScDigestLength);

// The one-off key buffer starts out with this value before the TPM draw
// overwrites it. It never seals a store key (a regeneration whose draw fails
// stops); unsealing starts from it, so that a failed unseal gives a key that
// the digest check rejects.
inline constexpr std::array<std::uint8_t, kOneOffKeySize> kInitialOneOffKey = {
    0x6B, 0x6D, 0x6D, 0x2E, 0x6F, 0x6F, 0x6B, 0x2E, 0xA5, 0x3C, 0x96, 0x0F, 0x5A, 0xC3, 0x69, 0xF0,
    0x1E, 0xE1, 0x2D, 0xD2, 0x4B, 0xB4, 0x78, 0x87, 0x0F, 0xF0, 0x33, 0xCC, 0x55, 0xAA, 0x00, 0xFF};

// The crypto services give the calls below no failure path in any caller:
// the callers go on as if they had succeeded. Their codes are dropped here,
// in one place each.

inline void DestroyContainer(CryptoContainer container) {
  (void)VKT_DTC_DestroyCryptoContainer(container);
}

// Container owns one crypto container and destroys it exactly once: at
// reset(), or when the scope ends on an early return.
using Container = Owned<CryptoContainer, DestroyContainer>;

// FetchConstant sets |*ref| and |*length| to the services' constant |index|.
inline void FetchConstant(std::uint32_t index, ProtectedKey** ref, std::uint32_t* length) {
  (void)VKT_DTC_GetConstant(index, ref, length);
}

// Attach binds |record| to |bytes| (a plain attachment, option 0).
inline void Attach(ProtectedKey* record, std::uint8_t* bytes) {
  (void)ProtectedKey_Attach(record, 0, bytes);
}

// Bind attaches |record| to |bytes| and sizes it to |length|, which takes the
// bytes in, masked.
inline void Bind(ProtectedKey* record, std::uint8_t* bytes, std::uint32_t length) {
  Attach(record, bytes);
  (void)ProtectedKey_SetLength(record, length);
}

}  // namespace keymgr::kmm

// ReadStoreKey reads the 48-byte store key from EEPROM into |dst| and sets
// |*length| to 48. Returns 0, or 1 with a message when |dst| is null or the
// read fails; then |dst| and |*length| are untouched. The caller judges the
// bytes.
[[nodiscard]] int ReadStoreKey(std::uint32_t* length, std::uint8_t* dst);

// WriteStoreKey writes exactly 48 bytes of |src| to the store-key region,
// whatever |length| says. Returns 0, or 1 with a message when |src| is null or
// the write fails. Nothing is rolled back.
[[nodiscard]] int WriteStoreKey(std::uint32_t length, const std::uint8_t* src);

// ReadDigestEEPROM reads the 32-byte SC digest from EEPROM into |dst|, which
// must not be null. Returns 0, or 1 with a message.
[[nodiscard]] int ReadDigestEEPROM(std::uint8_t* dst);

// WriteDigestHDD writes the 32 bytes of |digest| to "keymgr.cs". Returns 0
// when the file was opened (the write itself is not checked), 1 with a
// message when it was not.
[[nodiscard]] int WriteDigestHDD(const std::uint8_t* digest);

// ReadDigestHDD reads up to 32 bytes of "keymgr.cs" into |dst|. Returns 0
// when the file was opened, 1 with a message otherwise. A short file leaves
// the rest of |dst| as it was, so the caller must zero it first.
[[nodiscard]] int ReadDigestHDD(std::uint8_t* dst);

// RegenerateKey replaces all key material: seed key, secret key, SC digest
// (stored in EEPROM and on disk), then the sealed store key (key files and
// EEPROM), in that order. The caller must pass a zeroed context. Returns 0,
// or 1 after the failing step's lines; nothing already stored is undone.
[[nodiscard]] int RegenerateKey(KeyContext* context);

// SeedRandomOnce fills the C library generator's state through
// KmmSeedRandom unless this process has done so already. Returns false when
// no source of randomness answered.
[[nodiscard]] bool SeedRandomOnce();

// GenerateSeedKey fills the context's seed key from the local date, the
// calendar time and eight random() words, and binds seedKeyPK to it. A
// generator this process has not seeded is seeded first. Returns 0, or 1
// when no source of randomness answered (nothing is made then).
[[nodiscard]] int GenerateSeedKey(KeyContext* context);

// GenerateSecretKey hashes the seed key into secretKeyPK (32 bytes) and
// fetches the AES parameter constant for the later sealing. The caller must
// have run GenerateSeedKey. Returns 0, or 1 with a message.
[[nodiscard]] int GenerateSecretKey(KeyContext* context);

// HashRecord hashes |inLength| bytes of |in| into |out| in a container of
// its own and sets |*outLength| to the bytes produced; |*outLength| holds
// |out|'s capacity on entry. Returns 0, or 1 with a message when the hash
// fails or does not give 32 bytes.
[[nodiscard]] int HashRecord(const ProtectedKey* in, std::uint32_t inLength, ProtectedKey* out,
                             std::uint32_t* outLength);

// GenerateMessageDigest hashes the first 32 bytes behind |secretKey| into the
// 32 bytes at |digest|; with |store| non-zero it also writes the digest to
// EEPROM and to "keymgr.cs". |length| is not consulted. The caller must zero
// |digest| first. Returns 0, or 1 with a message; a disk copy that cannot be
// written is reported by WriteDigestHDD alone and still returns 0.
[[nodiscard]] int GenerateMessageDigest(std::int32_t length, ProtectedKey secretKey, int store,
                                        std::uint8_t* digest);

// GenerateStoreKey draws a one-off key and a TPM identity and password,
// replaces the previous TPM key, writes the three key files and seals the
// 48-byte secret-key area into storeKeyPK. The caller must have run
// GenerateSecretKey on the context. Returns 0, or 1 with a message.
[[nodiscard]] int GenerateStoreKey(KeyContext* context);

// DecryptStoreKey unseals the one-off key from the key files through the TPM
// and deciphers storeKeyPK into secretKeyPK (48 bytes). The caller must have
// bound storeKeyPK to the store key read from EEPROM. A return of 0 does not
// prove the key: the caller must compare the SC digest next.
[[nodiscard]] int DecryptStoreKey(KeyContext* context);

// NormalBoot reads the store key (three attempts), unseals it and proves its
// SC digest against the EEPROM copy, then the disk copy, between two banners.
// With |logFlag| non-zero it appends DT=OK or DT=FAIL to the boot status log.
// The caller must pass a zeroed context. Returns 0, or 1 on any failure.
[[nodiscard]] int NormalBoot(KeyContext* context, int logFlag);
