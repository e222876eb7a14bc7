// The platform key manager's operations over a TPM 2.0. Each call opens its
// own connection (platform/tpm.h) and releases everything before it returns,
// so a transport error spoils only the call where it happens. Inside, every
// step returns a Status; the C entry points reduce it to 0 or 1.
#include <openssl/crypto.h>

#include <algorithm>
#include <cstring>

#include "crypto/hash.h"
#include "platform/fragment.h"
#include "platform/pcp.h"
#include "platform/tpm.h"
#include "util/secure.h"

namespace {

using keymgr::Refused;
using keymgr::ScopeExit;
using keymgr::Secret;
using keymgr::Status;
using namespace keymgr::tpm;

constexpr uint32_t kDigestSize = 16;
// Largest single draw; the callers ask for 20 to 252 bytes.
constexpr uint32_t kMaxRandom = 1024;
// OAEP with SHA-256 spends two digests and two bytes of the modulus.
constexpr uint32_t kOaepOverhead = 2 * 32 + 2;

// Keys this key manager creates carry this authPolicy, the SHA-256 of
// "keymgr: sealing key of the one-off key". No policy session can reach it
// (that would take a preimage), so it grants nothing, but it marks the key:
// only objects that carry it, with the exact template below, are ever
// evicted, never what other software made persistent in the owner range.
constexpr uint8_t kKeyMarker[32] = {
    0x6d, 0x92, 0x2a, 0xfd, 0xc6, 0xec, 0xa3, 0xf8, 0x6b, 0xc5, 0xa5, 0x93, 0xa1, 0x93, 0x9a, 0x34,
    0x0c, 0xe7, 0x29, 0x9b, 0x0e, 0x44, 0x81, 0x0d, 0x26, 0x78, 0xc8, 0x7b, 0x01, 0x65, 0x84, 0xd6};
constexpr TPMA_OBJECT kKeyAttributes = TPMA_OBJECT_DECRYPT | TPMA_OBJECT_FIXEDTPM |
                                       TPMA_OBJECT_FIXEDPARENT | TPMA_OBJECT_SENSITIVEDATAORIGIN |
                                       TPMA_OBJECT_USERWITHAUTH | TPMA_OBJECT_NODA;
constexpr uint32_t kOwnerPersistentFirst = 0x81000000u;
constexpr uint32_t kOwnerPersistentLast = 0x817FFFFFu;

// Keys are made persistent in the owner range 0x81000000-0x817FFFFF: the low
// 23 bits of the handle are the first three bytes of the name digest read
// big-endian, top bit dropped. MD5 spreads the names evenly, so two live keys
// meet on one handle with odds of about 1 in 8 million; pcp_create_key then
// refuses rather than overwrite the other key.
uint32_t PersistentHandle(const uint8_t* nameDigest) {
  uint32_t low = (uint32_t{nameDigest[0]} << 16) | (uint32_t{nameDigest[1]} << 8) | nameDigest[2];
  return kOwnerPersistentFirst | (low & 0x007FFFFFu);
}

// HandleOfName is the persistent handle of the key named by |nameHex|.
uint32_t HandleOfName(const char* nameHex) {
  uint8_t nameDigest[kDigestSize];
  (void)Md5OfString(nameHex, nameDigest);  // always 0
  return PersistentHandle(nameDigest);
}

// IsOwnKey tells whether |area| is the public area of a key this key manager
// created: its template and its marker.
bool IsOwnKey(const TPMT_PUBLIC& area) {
  const TPMS_RSA_PARMS& rsa = area.parameters.rsaDetail;
  return area.type == TPM2_ALG_RSA && area.nameAlg == TPM2_ALG_SHA256 &&
         area.objectAttributes == kKeyAttributes && area.authPolicy.size == sizeof(kKeyMarker) &&
         std::memcmp(area.authPolicy.buffer, kKeyMarker, sizeof(kKeyMarker)) == 0 &&
         rsa.symmetric.algorithm == TPM2_ALG_NULL && rsa.scheme.scheme == TPM2_ALG_OAEP &&
         rsa.scheme.details.oaep.hashAlg == TPM2_ALG_SHA256;
}

// ModulusSize is the size in bytes of an own key's modulus, which must leave
// room for OAEP and fit the fragment; 0 for any other key.
uint32_t ModulusSize(const TPMT_PUBLIC& area) {
  const uint32_t size = IsOwnKey(area) ? area.parameters.rsaDetail.keyBits / 8u : 0;
  return size > kOaepOverhead && size <= kMaxCipherSize ? size : 0;
}

// OpenOwnKey opens the persistent object at |handle| into |key| when it is a
// key of this key manager, and gives its modulus size.
Status OpenOwnKey(Connection& tpm, uint32_t handle, PersistentObject& key,
                  uint32_t* modulusSize = nullptr) {
  ESYS_TR tr = ESYS_TR_NONE;
  if (Status status = Check(
          "Esys_TR_FromTPMPublic",
          Esys_TR_FromTPMPublic(tpm.ctx(), handle, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, &tr));
      !status.ok()) {
    return status;
  }
  key.reset(tpm.Object(tr));
  Output<TPM2B_PUBLIC> keyPublic;
  if (Status status = Check("Esys_ReadPublic",
                            Esys_ReadPublic(tpm.ctx(), tr, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE,
                                            keyPublic.out(), nullptr, nullptr));
      !status.ok()) {
    return status;
  }
  const uint32_t size = ModulusSize(keyPublic.get()->publicArea);
  if (size == 0) {
    key.reset();
    return Refused("not a key of this system");
  }
  if (modulusSize != nullptr) {
    *modulusSize = size;
  }
  return Status();
}

// EvictKey evicts |key| from the TPM. ESAPI may release the handle of an
// evicted persistent object, so it is given up either way: whatever ESAPI
// still holds goes with the connection.
Status EvictKey(Connection& tpm, PersistentObject& key, uint32_t handle) {
  ESYS_TR none = ESYS_TR_NONE;
  return Check("Esys_EvictControl",
               Esys_EvictControl(tpm.ctx(), ESYS_TR_RH_OWNER, key.release().tr, ESYS_TR_PASSWORD,
                                 ESYS_TR_NONE, ESYS_TR_NONE, handle, &none));
}

// HandleFree tells whether nothing sits at persistent |handle|; an error
// counts as taken.
bool HandleFree(Connection& tpm, uint32_t handle) {
  TPMI_YES_NO more = TPM2_NO;
  Output<TPMS_CAPABILITY_DATA> data;
  if (!Check("Esys_GetCapability",
             Esys_GetCapability(tpm.ctx(), ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE,
                                TPM2_CAP_HANDLES, handle, 1, &more, data.out()))
           .ok()) {
    return false;
  }
  const TPML_HANDLE& handles = data.get()->data.handles;
  return handles.count == 0 || handles.handle[0] != handle;
}

TPMT_RSA_DECRYPT OaepSha256() {
  TPMT_RSA_DECRYPT scheme{};
  scheme.scheme = TPM2_ALG_OAEP;
  scheme.details.oaep.hashAlg = TPM2_ALG_SHA256;
  return scheme;
}

// Draws land in a wiped staging buffer and reach |dst| only when all |count|
// bytes are in, so that a failed call leaves |dst| as it was.
Status DrawRandom(uint32_t count, uint8_t* dst) {
  Secret<kMaxRandom> drawn;
  if (dst == nullptr || count > drawn.size()) {
    return Refused("pcp_getRandomBytes");
  }
  // The draws become keys and passwords: the response is encrypted.
  Connection tpm;
  if (Status status = Connect(tpm); !status.ok()) {
    return status;
  }
  if (Status status = StartSaltedSession(tpm, TPMA_SESSION_ENCRYPT); !status.ok()) {
    return status;
  }
  uint32_t filled = 0;
  while (filled < count) {
    const auto want = static_cast<uint16_t>(std::min<uint32_t>(count - filled, sizeof(TPMU_HA)));
    SecretOutput<TPM2B_DIGEST> part;
    if (Status status =
            Check("Esys_GetRandom", Esys_GetRandom(tpm.ctx(), tpm.session.get().tr, ESYS_TR_NONE,
                                                   ESYS_TR_NONE, want, part.out()));
        !status.ok()) {
      return status;
    }
    const uint32_t take = std::min<uint32_t>({part.get()->size, want, sizeof(part.get()->buffer)});
    if (take == 0) {
      return Refused("Esys_GetRandom");
    }
    std::memcpy(drawn.data() + filled, part.get()->buffer, take);
    filled += take;
  }
  std::memcpy(dst, drawn.data(), count);
  return Status();
}

Status CreateKey(const uint8_t* nameDigest, const uint8_t* passwordDigest, uint32_t bits) {
  // A larger modulus would not fit the fragment's 256 ciphertext bytes.
  if (nameDigest == nullptr || passwordDigest == nullptr || (bits != 1024 && bits != 2048)) {
    return Refused("pcp_create_key");
  }
  const uint32_t handle = PersistentHandle(nameDigest);
  Connection tpm;
  if (Status status = Connect(tpm); !status.ok()) {
    return status;
  }
  if (!HandleFree(tpm, handle)) {
    return Refused("handle taken");
  }
  // The auth value is the first command parameter of TPM2_Create: the salted
  // session carries it encrypted.
  if (Status status = StartSaltedSession(tpm, TPMA_SESSION_DECRYPT); !status.ok()) {
    return status;
  }

  TPM2B_SENSITIVE_CREATE sensitive{};
  ScopeExit wipeSensitive([&] { OPENSSL_cleanse(&sensitive, sizeof(sensitive)); });
  sensitive.sensitive.userAuth.size = kDigestSize;
  std::memcpy(sensitive.sensitive.userAuth.buffer, passwordDigest, kDigestSize);

  TPM2B_PUBLIC templ{};
  TPMT_PUBLIC& area = templ.publicArea;
  area.type = TPM2_ALG_RSA;
  area.nameAlg = TPM2_ALG_SHA256;
  area.objectAttributes = kKeyAttributes;
  area.authPolicy.size = sizeof(kKeyMarker);
  std::memcpy(area.authPolicy.buffer, kKeyMarker, sizeof(kKeyMarker));
  TPMS_RSA_PARMS& rsa = area.parameters.rsaDetail;
  rsa.symmetric.algorithm = TPM2_ALG_NULL;
  rsa.scheme.scheme = TPM2_ALG_OAEP;
  rsa.scheme.details.oaep.hashAlg = TPM2_ALG_SHA256;
  rsa.keyBits = static_cast<TPMI_RSA_KEY_BITS>(bits);
  rsa.exponent = 0;
  TPM2B_DATA outsideInfo{};
  TPML_PCR_SELECTION pcrs{};

  Output<TPM2B_PRIVATE> keyPrivate;
  Output<TPM2B_PUBLIC> keyPublic;
  if (Status status =
          Check("Esys_Create",
                Esys_Create(tpm.ctx(), tpm.primary.get().tr, tpm.session.get().tr, ESYS_TR_NONE,
                            ESYS_TR_NONE, &sensitive, &templ, &outsideInfo, &pcrs, keyPrivate.out(),
                            keyPublic.out(), nullptr, nullptr, nullptr));
      !status.ok()) {
    return status;
  }
  ESYS_TR loaded = ESYS_TR_NONE;
  if (Status status = Check(
          "Esys_Load", Esys_Load(tpm.ctx(), tpm.primary.get().tr, ESYS_TR_PASSWORD, ESYS_TR_NONE,
                                 ESYS_TR_NONE, keyPrivate.get(), keyPublic.get(), &loaded));
      !status.ok()) {
    return status;
  }
  TransientObject loadedKey(tpm.Object(loaded));
  ESYS_TR persistent = ESYS_TR_NONE;
  if (Status status = Check("Esys_EvictControl",
                            Esys_EvictControl(tpm.ctx(), ESYS_TR_RH_OWNER, loaded, ESYS_TR_PASSWORD,
                                              ESYS_TR_NONE, ESYS_TR_NONE, handle, &persistent));
      !status.ok()) {
    return status;
  }
  PersistentObject key(tpm.Object(persistent));
  return Status();
}

// An object this key manager did not create is left alone, as if absent.
Status DeleteKey(const uint8_t* nameDigest) {
  if (nameDigest == nullptr) {
    return Refused("pcp_delete_key");
  }
  const uint32_t handle = PersistentHandle(nameDigest);
  Connection tpm;
  PersistentObject key;
  if (Status status = Connect(tpm); !status.ok()) {
    return status;
  }
  if (Status status = OpenOwnKey(tpm, handle, key); !status.ok()) {
    return status;
  }
  return EvictKey(tpm, key, handle);
}

Status EvictStaleKeys(const uint8_t* keepNameDigest) {
  Connection tpm;
  if (Status status = Connect(tpm); !status.ok()) {
    return status;
  }
  const uint32_t keep = keepNameDigest != nullptr ? PersistentHandle(keepNameDigest) : 0;
  TPMI_YES_NO more = TPM2_NO;
  Output<TPMS_CAPABILITY_DATA> data;
  if (Status status = Check(
          "Esys_GetCapability",
          Esys_GetCapability(tpm.ctx(), ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, TPM2_CAP_HANDLES,
                             kOwnerPersistentFirst, TPM2_MAX_CAP_HANDLES, &more, data.out()));
      !status.ok()) {
    return status;
  }
  // A TPM holds a handful of persistent objects, far fewer than one answer
  // can list, so |more| is not followed.
  Status result;
  const TPML_HANDLE& handles = data.get()->data.handles;
  for (uint32_t i = 0; i < handles.count; ++i) {
    const uint32_t handle = handles.handle[i];
    PersistentObject key;
    if (handle > kOwnerPersistentLast || handle == keep || !OpenOwnKey(tpm, handle, key).ok()) {
      continue;
    }
    if (Status status = EvictKey(tpm, key, handle); !status.ok()) {
      result = status;
    }
  }
  return result;
}

// The password is not needed to seal: only the key's public part is used.
Status Seal(const char* nameHex, const uint8_t* data, uint32_t length, uint8_t* out,
            uint32_t* outSize) {
  if (nameHex == nullptr || data == nullptr || out == nullptr || outSize == nullptr ||
      *outSize < PCP_FRAGMENT_SIZE) {
    return Refused("pcp_encryptDataFragment");
  }
  Connection tpm;
  PersistentObject key;
  uint32_t modulusSize = 0;
  if (Status status = Connect(tpm); !status.ok()) {
    return status;
  }
  if (Status status = OpenOwnKey(tpm, HandleOfName(nameHex), key, &modulusSize); !status.ok()) {
    return status;
  }
  if (length > modulusSize - kOaepOverhead) {
    return Refused("pcp_encryptDataFragment");
  }
  // The plaintext is the first command parameter: it crosses the bus
  // encrypted under the salted session.
  if (Status status = StartSaltedSession(tpm, TPMA_SESSION_DECRYPT); !status.ok()) {
    return status;
  }
  TPM2B_PUBLIC_KEY_RSA message{};
  ScopeExit wipeMessage([&] { OPENSSL_cleanse(&message, sizeof(message)); });
  message.size = static_cast<uint16_t>(length);
  std::memcpy(message.buffer, data, length);
  TPMT_RSA_DECRYPT scheme = OaepSha256();
  TPM2B_DATA label{};
  Output<TPM2B_PUBLIC_KEY_RSA> cipher;
  if (Status status =
          Check("Esys_RSA_Encrypt",
                Esys_RSA_Encrypt(tpm.ctx(), key.get().tr, tpm.session.get().tr, ESYS_TR_NONE,
                                 ESYS_TR_NONE, &message, &scheme, &label, cipher.out()));
      !status.ok()) {
    return status;
  }
  const auto size = std::min<std::size_t>(cipher.get()->size, sizeof(cipher.get()->buffer));
  if (Status status = EncodeFragment({cipher.get()->buffer, size},
                                     std::span<uint8_t, PCP_FRAGMENT_SIZE>(out, PCP_FRAGMENT_SIZE));
      !status.ok()) {
    return status;
  }
  *outSize = PCP_FRAGMENT_SIZE;
  return Status();
}

Status Unseal(const char* nameHex, const char* passHex, const uint8_t* fragment, uint32_t length,
              uint8_t* out, uint32_t* outSize) {
  if (nameHex == nullptr || passHex == nullptr || fragment == nullptr || out == nullptr ||
      outSize == nullptr) {
    return Refused("pcp_decryptDataFragment");
  }
  std::span<const uint8_t> sealed;
  if (Status status = DecodeFragment({fragment, length}, &sealed); !status.ok()) {
    return status;
  }
  Connection tpm;
  PersistentObject key;
  if (Status status = Connect(tpm); !status.ok()) {
    return status;
  }
  if (Status status = OpenOwnKey(tpm, HandleOfName(nameHex), key); !status.ok()) {
    return status;
  }
  {
    TPM2B_AUTH auth{};
    ScopeExit wipeAuth([&] { OPENSSL_cleanse(&auth, sizeof(auth)); });
    auth.size = kDigestSize;
    (void)Md5OfString(passHex, auth.buffer);  // always 0
    if (Status status = Check("Esys_TR_SetAuth", Esys_TR_SetAuth(tpm.ctx(), key.get().tr, &auth));
        !status.ok()) {
      return status;
    }
  }
  // The plaintext is the first response parameter: the TPM returns it
  // encrypted under the salted session.
  if (Status status = StartSaltedSession(tpm, TPMA_SESSION_ENCRYPT); !status.ok()) {
    return status;
  }
  TPM2B_PUBLIC_KEY_RSA cipher{};
  cipher.size = static_cast<uint16_t>(sealed.size());
  std::memcpy(cipher.buffer, sealed.data(), sealed.size());
  TPMT_RSA_DECRYPT scheme = OaepSha256();
  TPM2B_DATA label{};
  SecretOutput<TPM2B_PUBLIC_KEY_RSA> message;
  if (Status status =
          Check("Esys_RSA_Decrypt",
                Esys_RSA_Decrypt(tpm.ctx(), key.get().tr, tpm.session.get().tr, ESYS_TR_NONE,
                                 ESYS_TR_NONE, &cipher, &scheme, &label, message.out()));
      !status.ok()) {
    return status;
  }
  if (message.get()->size > *outSize || message.get()->size > sizeof(message.get()->buffer)) {
    return Refused("pcp_decryptDataFragment");
  }
  std::memcpy(out, message.get()->buffer, message.get()->size);
  *outSize = message.get()->size;
  return Status();
}

// Result reduces a status to the key manager's result.
int Result(const Status& status) {
  return status.ok() ? 0 : 1;
}

}  // namespace

int pcp_getRandomBytes(uint32_t count, uint8_t* dst) {
  return count == 0 ? 0 : Result(DrawRandom(count, dst));
}

int pcp_create_key(const uint8_t* nameDigest, const uint8_t* passwordDigest, uint32_t bits,
                   uint32_t /*flags*/) {
  return Result(CreateKey(nameDigest, passwordDigest, bits));
}

int pcp_delete_key(const uint8_t* nameDigest, uint32_t /*flags*/) {
  return Result(DeleteKey(nameDigest));
}

int pcp_evict_stale_keys(const uint8_t* keepNameDigest) {
  return Result(EvictStaleKeys(keepNameDigest));
}

int pcp_encryptDataFragment(const char* nameHex, const char* /*passHex*/, const uint8_t* data,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  return Result(Seal(nameHex, data, length, out, outSize));
}

int pcp_decryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* fragment,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  return Result(Unseal(nameHex, passHex, fragment, length, out, outSize));
}
