// Sealing and opening the one-off key's fragment: RSA-OAEP on the host to
// seal, the TPM's RSA decrypt in a session bound to the key to open.
#include <openssl/crypto.h>

#include <cstring>

#include "crypto/hash.h"
#include "crypto/rsa.h"
#include "policy/file.h"
#include "tpm/chain.h"
#include "tpm/commands.h"
#include "tpm/fragment.h"
#include "tpm/keys.h"
#include "util/secure.h"

namespace keymgr::tpm {

namespace {

// StartUnsealSession starts the session that carries the decryption. For a
// plain key it is bound to the key: its session key comes from the key's
// password, which the call has anyway, so the plaintext returns encrypted
// without a second asymmetric operation. A sealed key opens only in a policy
// session that meets the vendor's policy; that session is salted to the
// pinned storage key, so that whoever has read the password from the disk
// and listens on the bus still learns nothing, and TPM2_PolicyAuthValue
// puts the password in its keys as binding would.
Status StartUnsealSession(Connection& tpm, ESYS_TR key, ESYS_TR* session) {
  if (tpm.options.sealPcr < 0) {
    return StartSession(tpm, ESYS_TR_NONE, key, session, TPM2_SE_HMAC);
  }
  policy::PolicyFile file;
  if (Status status = policy::ReadPolicyFile(&file); !status.ok()) {
    return status;
  }
  if (Status status = StartSaltedSession(tpm, TPM2_SE_POLICY, session); !status.ok()) {
    return status;
  }
  return MeetKeyPolicy(tpm, *session, file);
}

}  // namespace

// Sealing needs only the key's public part: it is done on the host, and the
// password is not needed.
Status Seal(Connection& tpm, const char* nameHex, const uint8_t* data, uint32_t length,
            uint8_t* out, uint32_t* outSize) {
  if (nameHex == nullptr || data == nullptr || out == nullptr || outSize == nullptr ||
      *outSize < PCP_FRAGMENT_SIZE) {
    return Refused("pcp_encryptDataFragment");
  }
  const uint32_t handle = HandleOfName(nameHex);
  TPM2B_PUBLIC area{};
  if (tpm.createdHandle == handle) {
    area = tpm.createdPublic;
  } else if (Status status = ReadPublic(tpm, handle, &area); !status.ok()) {
    return status;
  }
  const TPMT_PUBLIC& key = area.publicArea;
  const uint32_t modulusSize = ModulusSize(key, tpm.options.vendorKey);
  if (modulusSize == 0 || length > modulusSize - kOaepOverhead) {
    return Refused("pcp_encryptDataFragment");
  }
  // An exponent of 0 in a TPM key means the default, 65537.
  const uint32_t exponent =
      key.parameters.rsaDetail.exponent != 0 ? key.parameters.rsaDetail.exponent : 65537;
  uint8_t cipher[kMaxCipherSize];
  std::size_t cipherSize = 0;
  if (Status status = keymgr::crypto::RsaOaepSha256Encrypt(
          {key.unique.rsa.buffer, modulusSize}, exponent, {data, length}, cipher, &cipherSize);
      !status.ok()) {
    return status;
  }
  if (Status status = EncodeFragment({cipher, cipherSize},
                                     std::span<uint8_t, PCP_FRAGMENT_SIZE>(out, PCP_FRAGMENT_SIZE));
      !status.ok()) {
    return status;
  }
  *outSize = PCP_FRAGMENT_SIZE;
  return Status();
}

// The session that carries the decryption ends with the command
// (continueSession clear).
Status Unseal(Connection& tpm, const char* nameHex, const char* passHex, const uint8_t* fragment,
              uint32_t length, uint8_t* out, uint32_t* outSize) {
  if (nameHex == nullptr || passHex == nullptr || fragment == nullptr || out == nullptr ||
      outSize == nullptr) {
    return Refused("pcp_decryptDataFragment");
  }
  std::span<const uint8_t> sealed;
  if (Status status = DecodeFragment({fragment, length}, &sealed); !status.ok()) {
    return status;
  }
  const uint32_t handle = HandleOfName(nameHex);
  ESYS_TR tr = ESYS_TR_NONE;
  if (Status status = OpenPersistent(tpm, handle, &tr); !status.ok()) {
    return status;
  }
  PersistentObject key(tpm.Object(tr));
  {
    TPM2B_AUTH auth{};
    ScopeExit wipeAuth([&] { OPENSSL_cleanse(&auth, sizeof(auth)); });
    auth.size = crypto::kMd5Size;
    (void)Md5OfString(passHex, auth.buffer);  // always 0
    if (Status status = Check("Esys_TR_SetAuth", Esys_TR_SetAuth(tpm.ctx(), tr, &auth));
        !status.ok()) {
      return status;
    }
  }
  ESYS_TR started = ESYS_TR_NONE;
  Status opened = StartUnsealSession(tpm, tr, &started);
  TransientObject session(started != ESYS_TR_NONE ? tpm.Object(started) : EsysObject());
  if (!opened.ok()) {
    return opened;
  }
  const ESYS_TR bound = started;
  if (Status status =
          Check("Esys_TRSess_SetAttributes",
                Esys_TRSess_SetAttributes(tpm.ctx(), bound, TPMA_SESSION_ENCRYPT, 0xff));
      !status.ok()) {
    return status;
  }
  TPM2B_PUBLIC_KEY_RSA cipher{};
  cipher.size = static_cast<uint16_t>(sealed.size());
  std::memcpy(cipher.buffer, sealed.data(), sealed.size());
  SecretOutput<TPM2B_PUBLIC_KEY_RSA> message;
  if (Status status = RsaDecrypt(tpm, tr, bound, cipher, &message); !status.ok()) {
    return status;
  }
  // The TPM ended the session with the command, and ESAPI forgot it.
  (void)session.release();
  if (message.get()->size > *outSize || message.get()->size > sizeof(message.get()->buffer)) {
    return Refused("pcp_decryptDataFragment");
  }
  std::memcpy(out, message.get()->buffer, message.get()->size);
  *outSize = message.get()->size;
  return Status();
}

}  // namespace keymgr::tpm
