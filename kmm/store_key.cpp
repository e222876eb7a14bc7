// Sealing and unsealing of the store key. The store key is the secret-key area
// enciphered under a one-off key (OOK); the OOK is sealed by the TPM under a
// key with a random identity and password, kept in three files.
#include <array>
#include <cstdint>
#include <cstdio>
#include <cstring>

#include "crypto/hash.h"
#include "keymgr_build_config.h"
#include "kmm/internal.h"
#include "tpm/pcp.h"
#include "util/atomic_file.h"
#include "util/bytes.h"
#include "util/debug_print.h"
#include "util/paths.h"
#include "util/secure.h"

using namespace keymgr::kmm;

namespace {

using keymgr::Secret;
using keymgr::SecretText;

using TpmSecret = Secret<kTpmSecretSize>;
using TpmSecretHex = SecretText<kTpmSecretHexSize>;

// HexOf writes the hex text of a TPM identity or password. Both sizes are
// fixed, so it cannot fail.
void HexOf(const TpmSecret& bytes, TpmSecretHex& text) {
  static_assert(kTpmSecretHexSize == 2 * kTpmSecretSize + 1);
  (void)BytesToHex(bytes.data(), kTpmSecretSize, text.data(), kTpmSecretHexSize);
}

// ReadKeyFile reads up to |size| bytes of |path| into |dst| and returns false
// when the file cannot be opened. A short file leaves the rest of |dst|.
bool ReadKeyFile(const char* path, std::uint8_t* dst, std::size_t size) {
  keymgr::File file = keymgr::OpenFile(path, "r");
  if (!file) {
    return false;
  }
  std::size_t got = std::fread(dst, 1, size, file.get());
  (void)got;
  return true;
}

// Said prints a step's line, "Successed to " or "Failed to " then |step| and
// |object|, and returns |ok|.
bool Said(bool ok, const char* step, const char* object = "") {
  DebugPrint("%s to %s%s\n", ok ? "Successed" : "Failed", step, object);
  return ok;
}

// WriteKeyFile replaces |path| with |size| bytes of |src|, reporting it under
// the file's short |name|. The whole replacement counts as the open: the
// success line follows only once the new file is durably in place, and a
// failure leaves the old file whole.
bool WriteKeyFile(const char* path, const char* name, const std::uint8_t* src, std::size_t size) {
  return Said(keymgr::ReplaceFile(path, src, size, keymgr::kSecretFileMode).ok(), "open ", name);
}

// BindOneOffKey copies the OOK into the context and binds the AES key
// constant to it.
void BindOneOffKey(KeyContext* context, const Secret<kOneOffKeySize>& ook) {
  std::memcpy(context->oneOffKey, ook.data(), kOneOffKeySize);
  Bind(context->oneOffKeyRef, context->oneOffKey, context->oneOffKeyRefLength);
}

// RunAes runs one AES job over 48 bytes from |in| to |out|, attached to
// |outBytes|, under the bound OOK and the AES parameter constant, and prints
// |done|. Returns 0, or 1 with a message.
int RunAes(KeyContext* context, std::uint32_t direction, const ProtectedKey* in, ProtectedKey* out,
           std::uint8_t* outBytes, std::uint32_t* outLength, const char* done) {
  Attach(out, outBytes);
  Container container(VKT_DTC_CreateCryptoContainer());
  if (!container) {
    DebugPrint("VKT_DTC_CreateCryptoContainer Failed.\n");
    return 1;
  }
  if (VKT_DTC_AES_Init(container.get(), direction, DTC_AES_MODE, context->oneOffKeyRef,
                       context->oneOffKeyRefLength, context->cipherParamRef) != 0) {
    DebugPrint("VKT_DTC_AES_Init Failed.\n");
    return 1;
  }
  if (VKT_DTC_AES_Process(container.get(), in, kSealedKeySize, out, outLength) != 0) {
    DebugPrint("VKT_DTC_AES_Process Failed.\n");
    return 1;
  }
  if (*outLength != kSealedKeySize) {
    DebugPrint("DTC_AES Failed.\n");
    return 1;
  }
  container.reset();
  DebugPrint("%s", done);
  return 0;
}

}  // namespace

int GenerateStoreKey(KeyContext* context) {
  Secret<kOneOffKeySize> ook;
  ook.bytes = kInitialOneOffKey;
  TpmSecret identity;
  TpmSecret password;
  TpmSecretHex nameHex;
  TpmSecretHex passHex;
  Secret<keymgr::crypto::kMd5Size> nameDigest;
  Secret<keymgr::crypto::kMd5Size> passDigest;
  // Cleared so that the bytes past the sealed fragment are defined on disk.
  std::array<std::uint8_t, kStoredOokSize> storedOok{};
  std::uint32_t storedOokSize = kStoredOokSize;

  // The previous generation's TPM key goes first; on a first generation
  // there is none and nothing is said about it. Keys of this system that no
  // key file names (left by a killed regeneration) can never be used again
  // and are evicted silently, so they do not fill the TPM over the years.
  const bool hadIdentity = ReadKeyFile(keymgr::kKeyIdPath, identity.data(), kTpmSecretSize);
  if (hadIdentity) {
    HexOf(identity, nameHex);
    Md5OfString(nameHex.c_str(), nameDigest.data());
  }
  (void)pcp_evict_stale_keys(hadIdentity ? nameDigest.data() : nullptr);
  if (hadIdentity) {
    Said(pcp_delete_key(nameDigest.data(), 0) == 0, "delete ID/PWD in TPM.");
  }

  // A draw that fails (neither the TPM nor the kernel answered) stops the
  // regeneration before anything is created: the buffer would still hold the
  // built-in initial key, or the previous identity, or zeros.
  if (!Said(pcp_getRandomBytes(kOneOffKeySize, ook.data()) == 0, "generate one_off_key by TPM.") ||
      !Said(pcp_getRandomBytes(kTpmSecretSize, identity.data()) == 0, "generate user_name_hex.")) {
    return 1;
  }
  HexOf(identity, nameHex);
  Md5OfString(nameHex.c_str(), nameDigest.data());
  if (!Said(pcp_getRandomBytes(kTpmSecretSize, password.data()) == 0, "generate user_pass_hex.")) {
    return 1;
  }
  HexOf(password, passHex);
  Md5OfString(passHex.c_str(), passDigest.data());

  // The TPM key lives under the MD5 digests of the hex texts; the fragment
  // is sealed under the texts themselves.
  if (!Said(pcp_create_key(nameDigest.data(), passDigest.data(), kTpmKeyBits, 0) == 0,
            "create OOK.")) {
    return 1;
  }
  // Until its identity is on disk nothing can ever name the new key again:
  // a failure before that evicts it (a leak fix, not a rollback).
  bool identityStored = false;
  keymgr::ScopeExit evictUnnamed([&] {
    if (!identityStored) {
      (void)pcp_delete_key(nameDigest.data(), 0);
    }
  });
  if (!Said(pcp_encryptDataFragment(nameHex.c_str(), passHex.c_str(), ook.data(), kOneOffKeySize,
                                    storedOok.data(), &storedOokSize) == 0,
            "encrypt Stored-OOK.")) {
    return 1;
  }

  // Fixed order, each file replaced whole: a failure leaves a mixed
  // generation, every file of it intact.
  identityStored =
      WriteKeyFile(keymgr::kKeyIdPath, "keymgr.hddkeyid", identity.data(), kTpmSecretSize);
  if (!identityStored ||
      !WriteKeyFile(keymgr::kKeyPwdPath, "keymgr.hddpwd", password.data(), kTpmSecretSize) ||
      !WriteKeyFile(keymgr::kStoredOokPath, "keymgr.ook", storedOok.data(), storedOok.size())) {
    return 1;
  }

  FetchConstant(DTC_CONST_AES_KEY, &context->oneOffKeyRef, &context->oneOffKeyRefLength);
  BindOneOffKey(context, ook);
  // All 48 bytes of the secret-key area are sealed: the secret key and the
  // 16 bytes after it.
  return RunAes(context, DTC_AES_ENCRYPT, &context->secretKeyPK, &context->storeKeyPK,
                context->storeKeyBytes, &context->storeKeyLength, "ST Key is encrypted!!\n");
}

int DecryptStoreKey(KeyContext* context) {
  TpmSecret identity;
  TpmSecret password;
  TpmSecretHex nameHex;
  TpmSecretHex passHex;
  Secret<kOneOffKeySize> ook;
  ook.bytes = kInitialOneOffKey;
  std::uint32_t ookSize = kOneOffKeySize;
  // Cleared so that a short file leaves defined bytes behind what it held.
  std::array<std::uint8_t, kStoredOokSize> storedOok{};

  FetchConstant(DTC_CONST_AES_KEY, &context->oneOffKeyRef, &context->oneOffKeyRefLength);
  // Without the identity file the OOK is not unsealed and the AES step runs
  // with the key record as the crypto services hold it.
  if (ReadKeyFile(keymgr::kKeyIdPath, identity.data(), kTpmSecretSize)) {
    // A missing password file leaves the password cleared; the TPM then
    // refuses it and the digest check rejects the result.
    ReadKeyFile(keymgr::kKeyPwdPath, password.data(), kTpmSecretSize);
    if (!Said(ReadKeyFile(keymgr::kStoredOokPath, storedOok.data(), storedOok.size()),
              "open keymgr.ook")) {
      return 1;
    }
    HexOf(identity, nameHex);
    HexOf(password, passHex);
    // Only the first 268 bytes of the file are the sealed fragment.
    Said(pcp_decryptDataFragment(nameHex.c_str(), passHex.c_str(), storedOok.data(),
                                 kStoredOokPassed, ook.data(), &ookSize) == 0,
         "decrypt OOK.");
    // Shown on every call, as a diagnostic; the digest check decides. With
    // the store key from EEPROM the one-off key gives away the secret key,
    // so a production build may show the line without its bytes.
    DebugPrint("one_off_key: ");
    if constexpr (KEYMGR_REDACT_OOK) {
      PrintRedactedArray(kOneOffKeySize);
    } else {
      PrintArray(ook.data(), kOneOffKeySize);
    }
    BindOneOffKey(context, ook);
  }

  FetchConstant(DTC_CONST_AES_PARAM, &context->cipherParamRef, &context->cipherParamLength);
  return RunAes(context, DTC_AES_DECRYPT, &context->storeKeyPK, &context->secretKeyPK,
                context->secretKeyBytes, &context->secretKeyLength, "ST Key is decrypted!!\n");
}

extern "C" int KmmListKeys(uint32_t* handles, int capacity, uint32_t* named) {
  if (named == nullptr || capacity < 0 || (handles == nullptr && capacity != 0)) {
    return -1;
  }
  *named = 0;
  TpmSecret identity;
  TpmSecretHex nameHex;
  if (ReadKeyFile(keymgr::kKeyIdPath, identity.data(), kTpmSecretSize)) {
    HexOf(identity, nameHex);
    *named = pcp_key_handle(nameHex.c_str());
  }
  std::uint32_t count = 0;
  if (pcp_list_keys(handles, static_cast<std::uint32_t>(capacity), &count) != 0 ||
      count > INT32_MAX) {
    return -1;
  }
  return static_cast<int>(count);
}
