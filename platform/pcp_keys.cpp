// The platform key manager's operations over a TPM 2.0 (platform/tpm.h holds
// the connection). Inside, every step returns a Status; the C entry points
// reduce it to 0 or 1. The commands each flow sends are few on purpose: a
// discrete TPM takes tens to hundreds of milliseconds for an asymmetric
// operation, so a boot sends one (the RSA decrypt) and a regeneration one
// RSA key generation and at most one primary.
#include <openssl/crypto.h>
#include <tss2/tss2_mu.h>

#include <algorithm>
#include <cstring>
#include <optional>

#include "crypto/hash.h"
#include "crypto/rsa.h"
#include "platform/fragment.h"
#include "platform/pcp.h"
#include "platform/tpm.h"
#include "util/random.h"
#include "util/secure.h"

namespace {

using keymgr::Refused;
using keymgr::ScopeExit;
using keymgr::Secret;
using keymgr::Status;
using namespace keymgr::tpm;

constexpr uint32_t kDigestSize = 16;
// Largest single draw; the callers ask for 20 or 32 bytes.
constexpr uint32_t kMaxRandom = 1024;
// OAEP with SHA-256 spends two digests and two bytes of the modulus.
constexpr uint32_t kOaepOverhead = 2 * 32 + 2;
// TPM2_GetRandom gives at most the size of the TPM's largest digest.
constexpr uint32_t kMaxEntropy = sizeof(TPMU_HA);

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

// Keys are made persistent in the owner range, above the handles TCG's
// registry keeps for storage root keys (0x81000000-0x8100FFFF) and
// endorsement keys (0x81010000-0x8101FFFF), so that a device's SRK and EK are
// never in the way and never read when stale keys are swept.
constexpr uint32_t kOwnKeysFirst = 0x81020000u;
constexpr uint32_t kOwnerPersistentLast = 0x817FFFFFu;

// The handle of a key is derived from the first three bytes of its name
// digest, read big-endian. MD5 spreads the names evenly, so two live keys
// meet on one handle with odds of about 1 in 8 million; pcp_create_key then
// refuses rather than overwrite the other key.
uint32_t PersistentHandle(const uint8_t* nameDigest) {
  const uint32_t bits =
      (uint32_t{nameDigest[0]} << 16) | (uint32_t{nameDigest[1]} << 8) | nameDigest[2];
  return kOwnKeysFirst + bits % (kOwnerPersistentLast - kOwnKeysFirst + 1);
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
  return size > kOaepOverhead && size <= kMaxCipherSize && area.unique.rsa.size == size ? size : 0;
}

// ReadOwnKey reads the public area of the object at |handle| and fails,
// as for a missing key, when it is not a key of this key manager.
Status ReadOwnKey(Connection& tpm, uint32_t handle, TPM2B_PUBLIC* area) {
  if (Status status = ReadPublic(tpm, handle, area); !status.ok()) {
    return status;
  }
  return ModulusSize(area->publicArea) != 0 ? Status() : Refused("not a key of this system");
}

TPMT_RSA_DECRYPT OaepSha256() {
  TPMT_RSA_DECRYPT scheme{};
  scheme.scheme = TPM2_ALG_OAEP;
  scheme.details.oaep.hashAlg = TPM2_ALG_SHA256;
  return scheme;
}

// GetRandom draws up to |want| bytes in one command, in |session| (the
// response encrypted) or with none.
Status GetRandom(Connection& tpm, ESYS_TR session, uint16_t want,
                 SecretOutput<TPM2B_DIGEST>& part) {
  Status status = Run(
      tpm, "Esys_GetRandom",
      [&] { return Esys_GetRandom_Async(tpm.ctx(), session, ESYS_TR_NONE, ESYS_TR_NONE, want); },
      [&] { return Esys_GetRandom_Finish(tpm.ctx(), part.out()); });
  WipeResponse(tpm);
  return status;
}

// DrawRandom fills |count| bytes at |dst| (at most kMaxRandom) from the
// TPM's generator; a failure may leave part of a draw there.
Status DrawRandom(Connection& tpm, uint32_t count, uint8_t* dst) {
  // The draws become keys and passwords: the response is encrypted.
  if (Status status = UseSaltedSession(tpm, TPMA_SESSION_ENCRYPT); !status.ok()) {
    return status;
  }
  uint32_t filled = 0;
  while (filled < count) {
    const auto want = static_cast<uint16_t>(std::min(count - filled, kMaxEntropy));
    SecretOutput<TPM2B_DIGEST> part;
    if (Status status = GetRandom(tpm, tpm.session.get().tr, want, part); !status.ok()) {
      return status;
    }
    const uint32_t take = std::min<uint32_t>({part.get()->size, want, sizeof(part.get()->buffer)});
    if (take == 0) {
      return Refused("Esys_GetRandom");
    }
    std::memcpy(dst + filled, part.get()->buffer, take);
    filled += take;
  }
  return Status();
}

Status DrawEntropy(Connection& tpm, uint32_t count, uint8_t* dst, uint32_t* drawn) {
  if (dst == nullptr || drawn == nullptr) {
    return Refused("pcp_getEntropyBytes");
  }
  SecretOutput<TPM2B_DIGEST> part;
  const auto want = static_cast<uint16_t>(std::min(count, kMaxEntropy));
  if (Status status = GetRandom(tpm, ESYS_TR_NONE, want, part); !status.ok()) {
    return status;
  }
  *drawn = std::min<uint32_t>({part.get()->size, want, sizeof(part.get()->buffer)});
  std::memcpy(dst, part.get()->buffer, *drawn);
  return Status();
}

// KeyTemplate is the template of every key this key manager creates.
TPM2B_TEMPLATE KeyTemplate(uint32_t bits) {
  TPMT_PUBLIC area{};
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
  TPM2B_TEMPLATE templ{};
  std::size_t size = 0;
  // A TPMT_PUBLIC always fits the template buffer.
  (void)Tss2_MU_TPMT_PUBLIC_Marshal(&area, templ.buffer, sizeof(templ.buffer), &size);
  templ.size = static_cast<uint16_t>(size);
  return templ;
}

Status CreateKey(Connection& tpm, const uint8_t* nameDigest, const uint8_t* passwordDigest,
                 uint32_t bits) {
  // A larger modulus would not fit the fragment's 256 ciphertext bytes.
  if (nameDigest == nullptr || passwordDigest == nullptr || (bits != 1024 && bits != 2048)) {
    return Refused("pcp_create_key");
  }
  const uint32_t handle = PersistentHandle(nameDigest);
  // The auth value is the first command parameter of TPM2_CreateLoaded: the
  // salted session carries it encrypted.
  if (Status status = UseSaltedSession(tpm, TPMA_SESSION_DECRYPT); !status.ok()) {
    return status;
  }
  TPM2B_SENSITIVE_CREATE sensitive{};
  ScopeExit wipeSensitive([&] { OPENSSL_cleanse(&sensitive, sizeof(sensitive)); });
  sensitive.sensitive.userAuth.size = kDigestSize;
  std::memcpy(sensitive.sensitive.userAuth.buffer, passwordDigest, kDigestSize);
  const TPM2B_TEMPLATE templ = KeyTemplate(bits);

  ESYS_TR loaded = ESYS_TR_NONE;
  Output<TPM2B_PUBLIC> keyPublic;
  if (Status status = Run(
          tpm, "Esys_CreateLoaded",
          [&] {
            return Esys_CreateLoaded_Async(tpm.ctx(), tpm.Parent(), tpm.session.get().tr,
                                           ESYS_TR_NONE, ESYS_TR_NONE, &sensitive, &templ);
          },
          [&] { return Esys_CreateLoaded_Finish(tpm.ctx(), &loaded, nullptr, keyPublic.out()); });
      !status.ok()) {
    return status;
  }
  TransientObject loadedKey(tpm.Object(loaded));
  // The handle is checked by the TPM itself: the eviction fails when it is
  // taken.
  ESYS_TR persistent = ESYS_TR_NONE;
  if (Status status = Run(
          tpm, "Esys_EvictControl",
          [&] {
            return Esys_EvictControl_Async(tpm.ctx(), ESYS_TR_RH_OWNER, loaded, ESYS_TR_PASSWORD,
                                           ESYS_TR_NONE, ESYS_TR_NONE, handle);
          },
          [&] { return Esys_EvictControl_Finish(tpm.ctx(), &persistent); });
      !status.ok()) {
    return status;
  }
  PersistentObject key(tpm.Object(persistent));
  // The public area came from the TPM with the key: sealing to it in the same
  // connection needs no command.
  tpm.createdHandle = handle;
  tpm.createdPublic = *keyPublic.get();
  return Status();
}

// An object this key manager did not create is left alone, as if absent.
Status DeleteKey(Connection& tpm, const uint8_t* nameDigest) {
  if (nameDigest == nullptr) {
    return Refused("pcp_delete_key");
  }
  const uint32_t handle = PersistentHandle(nameDigest);
  TPM2B_PUBLIC area{};
  if (Status status = ReadOwnKey(tpm, handle, &area); !status.ok()) {
    return status;
  }
  return EvictPersistent(tpm, handle);
}

Status EvictStaleKeys(Connection& tpm, const uint8_t* keepNameDigest) {
  const uint32_t keep = keepNameDigest != nullptr ? PersistentHandle(keepNameDigest) : 0;
  TPMI_YES_NO more = TPM2_NO;
  Output<TPMS_CAPABILITY_DATA> data;
  if (Status status = Run(
          tpm, "Esys_GetCapability",
          [&] {
            return Esys_GetCapability_Async(tpm.ctx(), ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE,
                                            TPM2_CAP_HANDLES, kOwnKeysFirst, TPM2_MAX_CAP_HANDLES);
          },
          [&] { return Esys_GetCapability_Finish(tpm.ctx(), &more, data.out()); });
      !status.ok()) {
    return status;
  }
  // A TPM holds a handful of persistent objects, far fewer than one answer
  // can list, so |more| is not followed.
  Status result;
  const TPML_HANDLE& handles = data.get()->data.handles;
  for (uint32_t i = 0; i < handles.count; ++i) {
    const uint32_t handle = handles.handle[i];
    TPM2B_PUBLIC area{};
    if (handle > kOwnerPersistentLast || handle == keep || !ReadOwnKey(tpm, handle, &area).ok()) {
      continue;
    }
    if (Status status = EvictPersistent(tpm, handle); !status.ok()) {
      result = status;
    }
  }
  return result;
}

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
  const uint32_t modulusSize = ModulusSize(key);
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

// The session that carries the decryption is bound to the key: its session
// key comes from the key's auth value, which the call has anyway, so the
// plaintext returns encrypted without a second asymmetric operation. The
// session ends with the command (continueSession clear).
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
  if (Status status = Run(
          tpm, "Esys_TR_FromTPMPublic",
          [&] {
            return Esys_TR_FromTPMPublic_Async(tpm.ctx(), handle, ESYS_TR_NONE, ESYS_TR_NONE,
                                               ESYS_TR_NONE);
          },
          [&] { return Esys_TR_FromTPMPublic_Finish(tpm.ctx(), &tr); });
      !status.ok()) {
    return status;
  }
  PersistentObject key(tpm.Object(tr));
  {
    TPM2B_AUTH auth{};
    ScopeExit wipeAuth([&] { OPENSSL_cleanse(&auth, sizeof(auth)); });
    auth.size = kDigestSize;
    (void)Md5OfString(passHex, auth.buffer);  // always 0
    if (Status status = Check("Esys_TR_SetAuth", Esys_TR_SetAuth(tpm.ctx(), tr, &auth));
        !status.ok()) {
      return status;
    }
  }
  ESYS_TR bound = ESYS_TR_NONE;
  if (Status status = StartHmacSession(tpm, ESYS_TR_NONE, tr, &bound); !status.ok()) {
    return status;
  }
  TransientObject session(tpm.Object(bound));
  if (Status status =
          Check("Esys_TRSess_SetAttributes",
                Esys_TRSess_SetAttributes(tpm.ctx(), bound, TPMA_SESSION_ENCRYPT, 0xff));
      !status.ok()) {
    return status;
  }
  TPM2B_PUBLIC_KEY_RSA cipher{};
  cipher.size = static_cast<uint16_t>(sealed.size());
  std::memcpy(cipher.buffer, sealed.data(), sealed.size());
  const TPMT_RSA_DECRYPT scheme = OaepSha256();
  TPM2B_DATA label{};
  SecretOutput<TPM2B_PUBLIC_KEY_RSA> message;
  if (Status status = Run(
          tpm, "Esys_RSA_Decrypt",
          [&] {
            return Esys_RSA_Decrypt_Async(tpm.ctx(), tr, bound, ESYS_TR_NONE, ESYS_TR_NONE, &cipher,
                                          &scheme, &label);
          },
          [&] { return Esys_RSA_Decrypt_Finish(tpm.ctx(), message.out()); });
      !status.ok()) {
    return status;
  }
  WipeResponse(tpm);
  // The TPM ended the session with the command, and ESAPI forgot it.
  (void)session.release();
  if (message.get()->size > *outSize || message.get()->size > sizeof(message.get()->buffer)) {
    return Refused("pcp_decryptDataFragment");
  }
  std::memcpy(out, message.get()->buffer, message.get()->size);
  *outSize = message.get()->size;
  return Status();
}

// The connection held by pcp_hold_connection, opened by the first call that
// needs it.
bool g_holding = false;
std::optional<Connection> g_held;
// Set when the held connection could not be opened or lost its TPM (a
// command left unanswered past its deadline, a transport that failed).
// Until the hold ends every call fails at once, so that a TPM that stops
// answering costs one deadline per held call, not one per command.
bool g_heldLost = false;

// OnTpm runs |op| on the held connection, or on one of its own that closes
// when the call ends. SIGPIPE stays blocked while the TPM is used.
template <class Op>
int OnTpm(Op op) {
  if (g_holding && g_heldLost) {
    return 1;
  }
  SigpipeBlock sigpipe;
  std::optional<Connection> own;
  std::optional<Connection>& slot = g_holding ? g_held : own;
  if (!slot) {
    slot.emplace();
    if (!Connect(*slot).ok()) {
      slot.reset();
      g_heldLost = g_holding;
      return 1;
    }
  }
  const Status status = op(*slot);
  if (slot->broken) {
    slot.reset();
    g_heldLost = g_holding;
  }
  return status.ok() ? 0 : 1;
}

}  // namespace

void pcp_hold_connection(void) {
  g_holding = true;
  g_heldLost = false;
}

void pcp_release_connection(void) {
  SigpipeBlock sigpipe;
  g_held.reset();
  g_holding = false;
  g_heldLost = false;
}

int pcp_getRandomBytes(uint32_t count, uint8_t* dst) {
  if (count == 0) {
    return 0;
  }
  if (dst == nullptr || count > kMaxRandom) {
    return 1;
  }
  // The TPM's bytes are mixed with the kernel's, and either serves alone when
  // the other cannot be had: a TPM that fails or falls silent never leaves a
  // key at a fixed value, and one whose generator is weak gives nothing away.
  // The kernel is waited for only when the TPM did not answer.
  Secret<kMaxRandom> fromTpm;
  Secret<kMaxRandom> fromKernel;
  const bool tpmAnswered =
      OnTpm([&](Connection& tpm) { return DrawRandom(tpm, count, fromTpm.data()); }) == 0;
  const bool kernelAnswered = keymgr::KernelRandom(
      fromKernel.data(), count, tpmAnswered ? keymgr::KernelWait::kNo : keymgr::KernelWait::kYes);
  if (!tpmAnswered && !kernelAnswered) {
    return 1;
  }
  for (uint32_t i = 0; i < count; ++i) {
    dst[i] =
        static_cast<uint8_t>((tpmAnswered ? fromTpm[i] : 0) ^ (kernelAnswered ? fromKernel[i] : 0));
  }
  return 0;
}

int pcp_getEntropyBytes(uint32_t count, uint8_t* dst, uint32_t* drawn) {
  return OnTpm([&](Connection& tpm) { return DrawEntropy(tpm, count, dst, drawn); });
}

int pcp_create_key(const uint8_t* nameDigest, const uint8_t* passwordDigest, uint32_t bits,
                   uint32_t /*flags*/) {
  return OnTpm([&](Connection& tpm) { return CreateKey(tpm, nameDigest, passwordDigest, bits); });
}

int pcp_delete_key(const uint8_t* nameDigest, uint32_t /*flags*/) {
  return OnTpm([&](Connection& tpm) { return DeleteKey(tpm, nameDigest); });
}

int pcp_evict_stale_keys(const uint8_t* keepNameDigest) {
  return OnTpm([&](Connection& tpm) { return EvictStaleKeys(tpm, keepNameDigest); });
}

int pcp_encryptDataFragment(const char* nameHex, const char* /*passHex*/, const uint8_t* data,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  return OnTpm([&](Connection& tpm) { return Seal(tpm, nameHex, data, length, out, outSize); });
}

int pcp_decryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* fragment,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  return OnTpm([&](Connection& tpm) {
    return Unseal(tpm, nameHex, passHex, fragment, length, out, outSize);
  });
}

int pcp_persist_srk(void) {
  return OnTpm([](Connection& tpm) { return PersistSrk(tpm); });
}
