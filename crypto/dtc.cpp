// Crypto services of the key-management module over OpenSSL EVP: SHA-256,
// AES-256-CBC without padding, one-job containers, protected key records and
// the built-in constants.
#include <kmm/dtc.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/rand.h>
#include <time.h>
#include <unistd.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>

#include "keymgr_build_config.h"
#include "util/bytes.h"
#include "util/secure.h"

namespace {

using keymgr::Secret;

constexpr std::uint32_t kDigestSize = 32;
constexpr std::uint32_t kAesKeySize = 32;
constexpr std::uint32_t kAesBlockSize = 16;
constexpr std::uint32_t kIvSize = 16;
// The module's keys are at most 48 bytes; the bound keeps a corrupt length
// from running the fixed work buffers below past their end.
constexpr std::uint32_t kMaxLength = 1024;

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
constexpr bool IsDigestText(const char* text) {
  for (std::size_t i = 0; i < 2 * kDigestSize; ++i) {
    if (HexDigitValue(text[i]) < 0) {
      return false;
    }
  }
  return text[2 * kDigestSize] == '\0';
}

constexpr std::array<std::uint8_t, kDigestSize> ParseDigest(const char* text) {
  std::array<std::uint8_t, kDigestSize> out{};
  for (std::size_t i = 0; i < kDigestSize; ++i) {
    out[i] =
        static_cast<std::uint8_t>(HexDigitValue(text[2 * i]) * 16 + HexDigitValue(text[2 * i + 1]));
  }
  return out;
}

static_assert(sizeof(KEYMGR_DMSETUP_SHA256) == 2 * kDigestSize + 1 &&
                  IsDigestText(KEYMGR_DMSETUP_SHA256),
              "KEYMGR_DMSETUP_SHA256 must be 64 hex digits");
constexpr std::array<std::uint8_t, kDigestSize> kDmsetupDigest = ParseDigest(KEYMGR_DMSETUP_SHA256);

// Masking of key bytes. Byte i of a sized record is stored as
//   plain[i] XOR byte (i mod 8) of SipHash-2-4(processKey; nonce, i / 8)
// with a 128-bit key drawn once per process and a nonce taken from a counter
// each time a record is sized or written. SipHash is a keyed PRF that costs a
// few dozen integer operations per 8 bytes, so reading a key byte by byte
// stays cheap, and the bytes left in memory are noise to anyone without the
// process key. The nonce travels inside the record, so a bitwise copy reads
// the same bytes and the record owns nothing that needs releasing.
struct MaskKey {
  std::uint64_t k0;
  std::uint64_t k1;
};

constexpr std::uint64_t Rotl(std::uint64_t x, int bits) {
  return (x << bits) | (x >> (64 - bits));
}

struct SipState {
  std::uint64_t v0, v1, v2, v3;
  void Round() {
    v0 += v1;
    v1 = Rotl(v1, 13);
    v1 ^= v0;
    v0 = Rotl(v0, 32);
    v2 += v3;
    v3 = Rotl(v3, 16);
    v3 ^= v2;
    v0 += v3;
    v3 = Rotl(v3, 21);
    v3 ^= v0;
    v2 += v1;
    v1 = Rotl(v1, 17);
    v1 ^= v2;
    v2 = Rotl(v2, 32);
  }
  void Absorb(std::uint64_t m) {
    v3 ^= m;
    Round();
    Round();
    v0 ^= m;
  }
};

std::uint64_t MaskWord(const MaskKey& key, std::uint64_t nonce, std::uint64_t block) {
  SipState s{key.k0 ^ 0x736f6d6570736575ull, key.k1 ^ 0x646f72616e646f6dull,
             key.k0 ^ 0x6c7967656e657261ull, key.k1 ^ 0x7465646279746573ull};
  s.Absorb(nonce);
  s.Absorb(block);
  s.Absorb(16ull << 56);  // the message length, as SipHash pads its last word
  s.v2 ^= 0xff;
  s.Round();
  s.Round();
  s.Round();
  s.Round();
  return s.v0 ^ s.v1 ^ s.v2 ^ s.v3;
}

// XorMask writes |count| bytes of |src| combined with the mask stream of
// |nonce| to |dst| (which may be |src|). Masking and unmasking are the same.
void XorMask(const MaskKey& key, std::uint64_t nonce, const std::uint8_t* src, std::uint8_t* dst,
             std::uint32_t count) {
  std::uint64_t word = 0;
  for (std::uint32_t i = 0; i < count; ++i) {
    if (i % 8 == 0) {
      word = MaskWord(key, nonce, i / 8);
    }
    dst[i] = static_cast<std::uint8_t>(src[i] ^ (word >> (8 * (i % 8))));
  }
}

// DrawMaskKey takes the process key from the OpenSSL generator. Should that
// ever fail, the clocks, process id and stack address still give a key that
// keeps plain bytes out of memory; only its unpredictability suffers.
MaskKey DrawMaskKey() {
  Secret<16> seed;
  if (RAND_bytes(seed.data(), static_cast<int>(seed.size())) != 1) {
    timespec now{};
    timespec mono{};
    clock_gettime(CLOCK_REALTIME, &now);
    clock_gettime(CLOCK_MONOTONIC, &mono);
    const MaskKey fallback{
        static_cast<std::uint64_t>(now.tv_nsec) ^ (static_cast<std::uint64_t>(now.tv_sec) << 20),
        static_cast<std::uint64_t>(mono.tv_nsec) ^ reinterpret_cast<std::uintptr_t>(&seed) ^
            (static_cast<std::uint64_t>(getpid()) << 32)};
    const std::uint64_t a = MaskWord(fallback, 1, 0);
    const std::uint64_t b = MaskWord(fallback, 2, 0);
    std::memcpy(seed.data(), &a, 8);
    std::memcpy(seed.data() + 8, &b, 8);
  }
  MaskKey key{};
  std::memcpy(&key.k0, seed.data(), 8);
  std::memcpy(&key.k1, seed.data() + 8, 8);
  return key;
}

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
  std::array<std::uint8_t, kDigestSize> dmsetupBytes;
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
  SealConstant(lib, lib.dmsetup, kDmsetupDigest.data(), lib.dmsetupBytes.data(), kDigestSize);
  return true;
}

Library& Lib() {
  static Library lib{};
  static const bool ready = InitLibrary(lib);
  (void)ready;
  return lib;
}

bool IsAttached(const ProtectedKey* key) {
  return key != nullptr && key->bytes != nullptr &&
         (key->state == kStateAttached || key->state == kStateSized);
}

bool IsSized(const ProtectedKey* key) {
  return key != nullptr && key->bytes != nullptr && key->state == kStateSized;
}

// Constants 2 and 3 are the library's fixed values: they are never re-bound
// or overwritten, or one caller could change them for the whole process.
bool IsFixedConstant(const ProtectedKey* key) {
  const Library& lib = Lib();
  return key == &lib.iv || key == &lib.dmsetup;
}

// ReadPlain copies |count| plain bytes of an attached record to |out|: the
// key bytes unmasked, and past the sized length the array's raw bytes.
void ReadPlain(const ProtectedKey& key, std::uint8_t* out, std::uint32_t count) {
  const std::uint32_t masked =
      key.state == kStateSized ? (key.length < count ? key.length : count) : 0;
  XorMask(Lib().mask, key.nonce, key.bytes, out, masked);
  std::memcpy(out + masked, key.bytes + masked, count - masked);
}

// Store writes |count| plain bytes into an attached record, masked under a
// fresh nonce, and sizes it to |count|. Bytes of a longer previous sizing
// are no longer key bytes and are wiped.
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

constexpr std::uint32_t kContainerMagic = 0xD7C0C0DEu;

enum class Phase : std::uint32_t {
  kFresh,     // created, no job yet
  kAesReady,  // AES set up, waiting for its one run
  kDone,      // the job ran; the container only awaits destruction
};

}  // namespace

// One hash job or one AES set-up and run. The cipher context holds the key
// schedule between the two AES steps and is freed as soon as the run ends.
struct DtcContainer {
  std::uint32_t magic;
  Phase phase;
  EVP_CIPHER_CTX* cipher;
};

namespace {

bool IsUsable(const DtcContainer* container) {
  return container->magic == kContainerMagic;
}

}  // namespace

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
      *length = kDigestSize;
      return 0;
    default:
      *ref = nullptr;
      *length = 0;
      return DTC_E_BAD_SELECTOR;
  }
}

CryptoContainer VKT_DTC_CreateCryptoContainer(void) {
  auto* container = static_cast<DtcContainer*>(OPENSSL_zalloc(sizeof(DtcContainer)));
  if (container == nullptr) {
    return nullptr;
  }
  container->magic = kContainerMagic;
  container->phase = Phase::kFresh;
  container->cipher = nullptr;
  return container;
}

uint32_t VKT_DTC_DestroyCryptoContainer(CryptoContainer container) {
  if (container == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  if (!IsUsable(container)) {
    return DTC_E_BAD_STATE;
  }
  EVP_CIPHER_CTX_free(container->cipher);
  OPENSSL_clear_free(container, sizeof(*container));
  return 0;
}

uint32_t VKT_DTC_GetHash(CryptoContainer container, uint32_t selector, const ProtectedKey* in,
                         uint32_t inLength, ProtectedKey* out, uint32_t* outLength) {
  if (container == nullptr || in == nullptr || out == nullptr || outLength == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  if (!IsUsable(container) || container->phase != Phase::kFresh) {
    return DTC_E_BAD_STATE;
  }
  if (selector != DTC_HASH_SELECTOR) {
    return DTC_E_BAD_SELECTOR;
  }
  if (!IsSized(in) || !IsAttached(out) || IsFixedConstant(out)) {
    return DTC_E_BAD_STATE;
  }
  if (inLength > kMaxLength) {
    return DTC_E_BAD_LENGTH;
  }
  if (*outLength < kDigestSize) {
    return DTC_E_SMALL_OUTPUT;
  }
  container->phase = Phase::kDone;

  // The input is read whole before the output is written, so |in| and |out|
  // may share their array.
  Secret<kMaxLength> plain;
  ReadPlain(*in, plain.data(), inLength);
  Secret<EVP_MAX_MD_SIZE> digest;
  unsigned int produced = 0;
  if (EVP_Digest(plain.data(), inLength, digest.data(), &produced, EVP_sha256(), nullptr) != 1 ||
      produced != kDigestSize) {
    return DTC_E_BACKEND;
  }
  Store(out, digest.data(), kDigestSize);
  *outLength = kDigestSize;
  return 0;
}

uint32_t VKT_DTC_AES_Init(CryptoContainer container, uint32_t direction, uint32_t mode,
                          const ProtectedKey* key, uint32_t keyLength, const ProtectedKey* param) {
  if (container == nullptr || key == nullptr || param == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  if (!IsUsable(container) || container->phase != Phase::kFresh) {
    return DTC_E_BAD_STATE;
  }
  if ((direction != DTC_AES_ENCRYPT && direction != DTC_AES_DECRYPT) || mode != DTC_AES_MODE) {
    return DTC_E_BAD_SELECTOR;
  }
  // A key record that was never bound and sized (constant 1 before its first
  // binding in this process) has no key to run with.
  if (!IsSized(key)) {
    return DTC_E_KEY_NOT_BOUND;
  }
  if (keyLength != kAesKeySize || key->length != kAesKeySize) {
    return DTC_E_BAD_LENGTH;
  }
  if (!IsSized(param)) {
    return DTC_E_BAD_STATE;
  }
  if (param->length != kIvSize) {
    return DTC_E_BAD_LENGTH;
  }

  EVP_CIPHER_CTX* cipher = EVP_CIPHER_CTX_new();
  if (cipher == nullptr) {
    return DTC_E_BACKEND;
  }
  Secret<kAesKeySize> keyBytes;
  Secret<kIvSize> iv;
  ReadPlain(*key, keyBytes.data(), kAesKeySize);
  ReadPlain(*param, iv.data(), kIvSize);
  const int encrypt = direction == DTC_AES_ENCRYPT ? 1 : 0;
  if (EVP_CipherInit_ex(cipher, EVP_aes_256_cbc(), nullptr, keyBytes.data(), iv.data(), encrypt) !=
          1 ||
      EVP_CIPHER_CTX_set_padding(cipher, 0) != 1) {
    EVP_CIPHER_CTX_free(cipher);
    return DTC_E_BACKEND;
  }
  container->cipher = cipher;
  container->phase = Phase::kAesReady;
  return 0;
}

uint32_t VKT_DTC_AES_Process(CryptoContainer container, const ProtectedKey* in, uint32_t inLength,
                             ProtectedKey* out, uint32_t* outLength) {
  if (container == nullptr || in == nullptr || out == nullptr || outLength == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  if (!IsUsable(container) || container->phase != Phase::kAesReady) {
    return DTC_E_BAD_STATE;
  }
  if (!IsSized(in) || !IsAttached(out) || IsFixedConstant(out)) {
    return DTC_E_BAD_STATE;
  }
  if (inLength == 0 || inLength % kAesBlockSize != 0 || inLength > kMaxLength) {
    return DTC_E_BAD_LENGTH;
  }
  container->phase = Phase::kDone;

  Secret<kMaxLength> plainIn;
  Secret<kMaxLength + kAesBlockSize> plainOut;
  ReadPlain(*in, plainIn.data(), inLength);
  int updated = 0;
  int finished = 0;
  const bool ok =
      EVP_CipherUpdate(container->cipher, plainOut.data(), &updated, plainIn.data(),
                       static_cast<int>(inLength)) == 1 &&
      EVP_CipherFinal_ex(container->cipher, plainOut.data() + updated, &finished) == 1 &&
      static_cast<std::uint32_t>(updated + finished) == inLength;
  // The key schedule is not needed past the one run.
  EVP_CIPHER_CTX_free(container->cipher);
  container->cipher = nullptr;
  if (!ok) {
    return DTC_E_BACKEND;
  }
  Store(out, plainOut.data(), inLength);
  *outLength = inLength;
  return 0;
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
