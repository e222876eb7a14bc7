// The crypto containers of the services: one hash job, or one AES set-up and
// run, over OpenSSL EVP (SHA-256; AES-256-CBC without padding).
#include <openssl/crypto.h>
#include <openssl/evp.h>

#include <cstdint>
#include <new>
#include <utility>

#include "crypto/internal.h"
#include "util/secure.h"

using keymgr::Secret;
using namespace keymgr::crypto;

namespace {

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
  std::uint32_t magic = kContainerMagic;
  Phase phase = Phase::kFresh;
  CipherContext cipher;
};

namespace {

bool IsUsable(const DtcContainer* container) {
  return container->magic == kContainerMagic;
}

// Backend reduces a failed libcrypto call to the services' code, naming it
// on request.
std::uint32_t Backend(const char* call) {
  LogOpenssl(call);
  return DTC_E_BACKEND;
}

}  // namespace

CryptoContainer VKT_DTC_CreateCryptoContainer(void) {
  return new (std::nothrow) DtcContainer;
}

uint32_t VKT_DTC_DestroyCryptoContainer(CryptoContainer container) {
  if (container == nullptr) {
    return DTC_E_NULL_ARGUMENT;
  }
  if (!IsUsable(container)) {
    return DTC_E_BAD_STATE;
  }
  // The key schedule, if a job left one, is wiped by EVP as it is freed.
  container->magic = 0;
  delete container;
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
  if (*outLength < kSha256Size) {
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
      produced != kSha256Size) {
    return Backend("EVP_Digest");
  }
  Store(out, digest.data(), kSha256Size);
  *outLength = kSha256Size;
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

  CipherContext cipher(EVP_CIPHER_CTX_new());
  if (!cipher) {
    return Backend("EVP_CIPHER_CTX_new");
  }
  Secret<kAesKeySize> keyBytes;
  Secret<kIvSize> iv;
  ReadPlain(*key, keyBytes.data(), kAesKeySize);
  ReadPlain(*param, iv.data(), kIvSize);
  const int encrypt = direction == DTC_AES_ENCRYPT ? 1 : 0;
  Steps step;
  if (!step("EVP_CipherInit_ex", EVP_CipherInit_ex(cipher.get(), EVP_aes_256_cbc(), nullptr,
                                                   keyBytes.data(), iv.data(), encrypt) == 1) ||
      !step("EVP_CIPHER_CTX_set_padding", EVP_CIPHER_CTX_set_padding(cipher.get(), 0) == 1)) {
    return Backend(step.call());
  }
  container->cipher = std::move(cipher);
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
  Steps step;
  const bool ok =
      step("EVP_CipherUpdate", EVP_CipherUpdate(container->cipher.get(), plainOut.data(), &updated,
                                                plainIn.data(), static_cast<int>(inLength)) == 1) &&
      step("EVP_CipherFinal_ex",
           EVP_CipherFinal_ex(container->cipher.get(), plainOut.data() + updated, &finished) == 1 &&
               static_cast<std::uint32_t>(updated + finished) == inLength);
  // The key schedule is not needed past the one run.
  container->cipher.reset();
  if (!ok) {
    return Backend(step.call());
  }
  Store(out, plainOut.data(), inLength);
  *outLength = inLength;
  return 0;
}
