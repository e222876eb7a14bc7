// Platform key manager over a TPM 2.0 through tpm2-tss ESAPI.
//
// Every call opens its own TCTI and ESAPI contexts and closes them before it
// returns, so a transport error spoils only the call where it happens and the
// next call starts on fresh contexts. The TPM has few transient slots and, in
// tests, no resource manager: whatever a call loads is flushed on every path.
#include "platform/pcp.h"

#include <openssl/crypto.h>
#include <tss2/tss2_esys.h>
#include <tss2/tss2_sys.h>
#include <tss2/tss2_tctildr.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "platform/pcp_tcti.h"
#include "util/bytes.h"
#include "util/secure.h"

namespace {

using keymgr::ScopeExit;
using keymgr::Secret;

constexpr uint32_t kDigestSize = 16;
// Largest single draw; the callers ask for 20 or 32 bytes.
constexpr uint32_t kMaxRandom = 1024;

// Sealed fragment, PCP_FRAGMENT_SIZE bytes, integers big-endian:
//   0..3   tag "PCPF"
//   4..7   format version, 1
//   8..11  ciphertext length n (the key's modulus size, at most 256)
//   12..   n bytes of RSA-OAEP (SHA-256, empty label) ciphertext, zero-filled
//          up to 256 bytes
constexpr uint8_t kFragmentTag[4] = {'P', 'C', 'P', 'F'};
constexpr uint32_t kFragmentVersion = 1;
constexpr uint32_t kHeaderSize = 12;
constexpr uint32_t kMaxCipherSize = PCP_FRAGMENT_SIZE - kHeaderSize;
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

// HasResourceManager tells whether |tcti| reaches the TPM through a resource
// manager (the kernel's /dev/tpmrm*, or tpm2-abrmd), which isolates each
// connection and flushes what it leaves behind.
bool HasResourceManager(const char* tcti) {
  return std::strncmp(tcti, "device:/dev/tpmrm", 17) == 0 || std::strncmp(tcti, "tabrmd", 6) == 0;
}

void PutBigEndian(uint8_t* dst, uint32_t value) {
  dst[0] = static_cast<uint8_t>(value >> 24);
  dst[1] = static_cast<uint8_t>(value >> 16);
  dst[2] = static_cast<uint8_t>(value >> 8);
  dst[3] = static_cast<uint8_t>(value);
}

uint32_t GetBigEndian(const uint8_t* src) {
  return (uint32_t{src[0]} << 24) | (uint32_t{src[1]} << 16) | (uint32_t{src[2]} << 8) | src[3];
}

// tpm2-tss writes an error line to stderr for every failed command, the
// expected ones here included (a wrong password, a missing key, a taken
// handle, an absent TPM). Callers only see 0 or non-zero and print their own
// line for the step, so the library's log is switched off for this process.
// Each tpm2-tss module reads TSS2_LOG the first time it logs, so setting it
// before the first ESAPI call is enough; a TSS2_LOG the user has set is kept
// (no overwrite), so the log can still be had when chasing a fault.
void QuietTssLog() {
  setenv("TSS2_LOG", "all+none", 0);
}

// Tpm holds one call's contexts and objects and releases them on every path:
// transient objects and sessions are flushed, the persistent key's auth value
// is overwritten and its handle closed, then ESAPI and the TCTI are finalised.
// After a transport error ESAPI refuses further commands and the flushes fail;
// the device's kernel resource manager (/dev/tpmrm0) then drops what the
// connection held when it closes.
struct Tpm {
  TSS2_TCTI_CONTEXT* tcti = nullptr;
  ESYS_CONTEXT* ctx = nullptr;
  ESYS_TR primary = ESYS_TR_NONE;
  ESYS_TR session = ESYS_TR_NONE;
  ESYS_TR loaded = ESYS_TR_NONE;
  ESYS_TR key = ESYS_TR_NONE;

  Tpm() = default;
  Tpm(const Tpm&) = delete;
  Tpm& operator=(const Tpm&) = delete;
  ~Tpm() {
    if (ctx != nullptr) {
      if (key != ESYS_TR_NONE) {
        TPM2B_AUTH blank{};
        blank.size = kDigestSize;
        Esys_TR_SetAuth(ctx, key, &blank);
        Esys_TR_Close(ctx, &key);
      }
      for (ESYS_TR transient : {loaded, session, primary}) {
        if (transient != ESYS_TR_NONE) {
          Esys_FlushContext(ctx, transient);
        }
      }
      Esys_Finalize(&ctx);
    }
    if (tcti != nullptr) {
      Tss2_TctiLdr_Finalize(&tcti);
    }
  }
};

// FlushLeftovers flushes every transient object and session the TPM holds.
// Without a resource manager the TPM keeps whatever a process loaded until
// someone flushes it, so a process that died part way (killed, or its host
// reset without the TPM) leaves its objects and sessions behind, and a few of
// them fill the TPM's slots for good. It is safe here because without a
// resource manager only one process can hold the TPM at a time (the kernel
// opens /dev/tpm0 exclusively, a simulator serves one connection at a time):
// whatever is loaded when a call starts belongs to nobody alive.
void FlushLeftovers(Tpm& tpm) {
  TSS2_SYS_CONTEXT* sys = nullptr;
  if (Esys_GetSysContext(tpm.ctx, &sys) != TSS2_RC_SUCCESS) {
    return;
  }
  for (uint32_t first :
       {TPM2_TRANSIENT_FIRST, TPM2_LOADED_SESSION_FIRST, TPM2_ACTIVE_SESSION_FIRST}) {
    TPMI_YES_NO more = TPM2_NO;
    TPMS_CAPABILITY_DATA* data = nullptr;
    if (Esys_GetCapability(tpm.ctx, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, TPM2_CAP_HANDLES,
                           first, TPM2_MAX_CAP_HANDLES, &more, &data) != TSS2_RC_SUCCESS) {
      continue;
    }
    // ESAPI knows nothing of these handles, so they go as raw commands.
    for (uint32_t i = 0; i < data->data.handles.count; ++i) {
      const TPM2_HANDLE handle = data->data.handles.handle[i];
      if ((handle >> TPM2_HR_SHIFT) == (first >> TPM2_HR_SHIFT)) {
        Tss2_Sys_FlushContext(sys, handle);
      }
    }
    Esys_Free(data);
  }
}

// Open connects to the TPM and starts it; "already started" is fine.
bool Open(Tpm& tpm) {
  QuietTssLog();
  if (Tss2_TctiLdr_Initialize(keymgr::kPcpTcti, &tpm.tcti) != TSS2_RC_SUCCESS) {
    return false;
  }
  if (Esys_Initialize(&tpm.ctx, tpm.tcti, nullptr) != TSS2_RC_SUCCESS) {
    tpm.ctx = nullptr;
    return false;
  }
  TSS2_RC rc = Esys_Startup(tpm.ctx, TPM2_SU_CLEAR);
  if (rc != TSS2_RC_SUCCESS && rc != TPM2_RC_INITIALIZE) {
    return false;
  }
  if (!HasResourceManager(keymgr::kPcpTcti)) {
    FlushLeftovers(tpm);
  }
  return true;
}

// CreatePrimary makes the owner hierarchy's storage primary key from a fixed
// ECC P-256 template; the same template gives the same key on every call, so
// it need not be kept in the TPM between calls.
bool CreatePrimary(Tpm& tpm) {
  TPM2B_SENSITIVE_CREATE sensitive{};
  TPM2B_PUBLIC templ{};
  TPMT_PUBLIC& area = templ.publicArea;
  area.type = TPM2_ALG_ECC;
  area.nameAlg = TPM2_ALG_SHA256;
  area.objectAttributes = TPMA_OBJECT_RESTRICTED | TPMA_OBJECT_DECRYPT | TPMA_OBJECT_FIXEDTPM |
                          TPMA_OBJECT_FIXEDPARENT | TPMA_OBJECT_SENSITIVEDATAORIGIN |
                          TPMA_OBJECT_USERWITHAUTH | TPMA_OBJECT_NODA;
  TPMS_ECC_PARMS& ecc = area.parameters.eccDetail;
  ecc.symmetric.algorithm = TPM2_ALG_AES;
  ecc.symmetric.keyBits.aes = 128;
  ecc.symmetric.mode.aes = TPM2_ALG_CFB;
  ecc.scheme.scheme = TPM2_ALG_NULL;
  ecc.curveID = TPM2_ECC_NIST_P256;
  ecc.kdf.scheme = TPM2_ALG_NULL;
  TPM2B_DATA outsideInfo{};
  TPML_PCR_SELECTION pcrs{};
  return Esys_CreatePrimary(tpm.ctx, ESYS_TR_RH_OWNER, ESYS_TR_PASSWORD, ESYS_TR_NONE, ESYS_TR_NONE,
                            &sensitive, &templ, &outsideInfo, &pcrs, &tpm.primary, nullptr, nullptr,
                            nullptr, nullptr) == TSS2_RC_SUCCESS;
}

// StartSaltedSession opens an HMAC session salted by the storage primary with
// AES-128-CFB parameter encryption in the direction(s) of |attributes|
// (TPMA_SESSION_DECRYPT: first command parameter; TPMA_SESSION_ENCRYPT: first
// response parameter). The salt travels under the primary's public key, so
// the session key, and the secrets it covers, never cross the bus in clear.
bool StartSaltedSession(Tpm& tpm, TPMA_SESSION attributes) {
  if (!CreatePrimary(tpm)) {
    return false;
  }
  TPMT_SYM_DEF symmetric{};
  symmetric.algorithm = TPM2_ALG_AES;
  symmetric.keyBits.aes = 128;
  symmetric.mode.aes = TPM2_ALG_CFB;
  if (Esys_StartAuthSession(tpm.ctx, tpm.primary, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE,
                            ESYS_TR_NONE, nullptr, TPM2_SE_HMAC, &symmetric, TPM2_ALG_SHA256,
                            &tpm.session) != TSS2_RC_SUCCESS) {
    tpm.session = ESYS_TR_NONE;
    return false;
  }
  // The session stays loaded after each command, so that it is flushed here
  // on every path, failed commands included.
  return Esys_TRSess_SetAttributes(tpm.ctx, tpm.session, TPMA_SESSION_CONTINUESESSION | attributes,
                                   0xff) == TSS2_RC_SUCCESS;
}

// HandleFree tells whether nothing sits at persistent |handle|; an error
// counts as taken.
bool HandleFree(Tpm& tpm, uint32_t handle) {
  TPMI_YES_NO more = TPM2_NO;
  TPMS_CAPABILITY_DATA* data = nullptr;
  if (Esys_GetCapability(tpm.ctx, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, TPM2_CAP_HANDLES,
                         handle, 1, &more, &data) != TSS2_RC_SUCCESS) {
    return false;
  }
  bool taken = data->data.handles.count > 0 && data->data.handles.handle[0] == handle;
  Esys_Free(data);
  return !taken;
}

// OpenKey finds the persistent key of |nameHex| (at the handle of its MD5).
bool OpenKey(Tpm& tpm, const char* nameHex) {
  uint8_t nameDigest[kDigestSize];
  Md5OfString(nameHex, nameDigest);
  if (Esys_TR_FromTPMPublic(tpm.ctx, PersistentHandle(nameDigest), ESYS_TR_NONE, ESYS_TR_NONE,
                            ESYS_TR_NONE, &tpm.key) != TSS2_RC_SUCCESS) {
    tpm.key = ESYS_TR_NONE;
    return false;
  }
  return true;
}

// OpenOwnKey opens the persistent object at |handle| and keeps it in
// tpm.key only when it is a key of this key manager.
bool OpenOwnKey(Tpm& tpm, uint32_t handle) {
  if (Esys_TR_FromTPMPublic(tpm.ctx, handle, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, &tpm.key) !=
      TSS2_RC_SUCCESS) {
    tpm.key = ESYS_TR_NONE;
    return false;
  }
  TPM2B_PUBLIC* keyPublic = nullptr;
  bool own = Esys_ReadPublic(tpm.ctx, tpm.key, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, &keyPublic,
                             nullptr, nullptr) == TSS2_RC_SUCCESS &&
             IsOwnKey(keyPublic->publicArea);
  Esys_Free(keyPublic);
  if (!own) {
    Esys_TR_Close(tpm.ctx, &tpm.key);
    tpm.key = ESYS_TR_NONE;
  }
  return own;
}

// EvictKey evicts the key in tpm.key. ESAPI may release the handle of an
// evicted persistent object, so it is never used again either way: whatever
// ESAPI still holds goes with Esys_Finalize.
bool EvictKey(Tpm& tpm, uint32_t handle) {
  ESYS_TR none = ESYS_TR_NONE;
  const ESYS_TR key = tpm.key;
  tpm.key = ESYS_TR_NONE;
  return Esys_EvictControl(tpm.ctx, ESYS_TR_RH_OWNER, key, ESYS_TR_PASSWORD, ESYS_TR_NONE,
                           ESYS_TR_NONE, handle, &none) == TSS2_RC_SUCCESS;
}

TPMT_RSA_DECRYPT OaepSha256() {
  TPMT_RSA_DECRYPT scheme{};
  scheme.scheme = TPM2_ALG_OAEP;
  scheme.details.oaep.hashAlg = TPM2_ALG_SHA256;
  return scheme;
}

}  // namespace

// Draws land in a wiped staging buffer and reach |dst| only when all |count|
// bytes are in, so that a failed call leaves |dst| as it was.
int pcp_getRandomBytes(uint32_t count, uint8_t* dst) {
  if (count == 0) {
    return 0;
  }
  Secret<kMaxRandom> drawn;
  if (dst == nullptr || count > drawn.size()) {
    return 1;
  }
  // The draws become keys and passwords: the response is encrypted.
  Tpm tpm;
  if (!Open(tpm) || !StartSaltedSession(tpm, TPMA_SESSION_ENCRYPT)) {
    return 1;
  }
  uint32_t filled = 0;
  while (filled < count) {
    uint16_t want = static_cast<uint16_t>(std::min<uint32_t>(count - filled, sizeof(TPMU_HA)));
    TPM2B_DIGEST* part = nullptr;
    if (Esys_GetRandom(tpm.ctx, tpm.session, ESYS_TR_NONE, ESYS_TR_NONE, want, &part) !=
        TSS2_RC_SUCCESS) {
      return 1;
    }
    uint32_t take = std::min<uint32_t>({part->size, want, sizeof(part->buffer)});
    std::memcpy(drawn.data() + filled, part->buffer, take);
    OPENSSL_cleanse(part, sizeof(*part));
    Esys_Free(part);
    if (take == 0) {
      return 1;
    }
    filled += take;
  }
  std::memcpy(dst, drawn.data(), count);
  return 0;
}

int pcp_create_key(const uint8_t* nameDigest, const uint8_t* passwordDigest, uint32_t bits,
                   uint32_t) {
  // A larger modulus would not fit the fragment's 256 ciphertext bytes.
  if (nameDigest == nullptr || passwordDigest == nullptr || (bits != 1024 && bits != 2048)) {
    return 1;
  }
  uint32_t handle = PersistentHandle(nameDigest);
  Tpm tpm;
  // The auth value is the first command parameter of TPM2_Create: the salted
  // session carries it encrypted.
  if (!Open(tpm) || !HandleFree(tpm, handle) || !StartSaltedSession(tpm, TPMA_SESSION_DECRYPT)) {
    return 1;
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

  TPM2B_PRIVATE* keyPrivate = nullptr;
  TPM2B_PUBLIC* keyPublic = nullptr;
  ScopeExit freeKey([&] {
    Esys_Free(keyPrivate);
    Esys_Free(keyPublic);
  });
  if (Esys_Create(tpm.ctx, tpm.primary, tpm.session, ESYS_TR_NONE, ESYS_TR_NONE, &sensitive, &templ,
                  &outsideInfo, &pcrs, &keyPrivate, &keyPublic, nullptr, nullptr,
                  nullptr) != TSS2_RC_SUCCESS) {
    return 1;
  }
  if (Esys_Load(tpm.ctx, tpm.primary, ESYS_TR_PASSWORD, ESYS_TR_NONE, ESYS_TR_NONE, keyPrivate,
                keyPublic, &tpm.loaded) != TSS2_RC_SUCCESS) {
    tpm.loaded = ESYS_TR_NONE;
    return 1;
  }
  if (Esys_EvictControl(tpm.ctx, ESYS_TR_RH_OWNER, tpm.loaded, ESYS_TR_PASSWORD, ESYS_TR_NONE,
                        ESYS_TR_NONE, handle, &tpm.key) != TSS2_RC_SUCCESS) {
    tpm.key = ESYS_TR_NONE;
    return 1;
  }
  return 0;
}

int pcp_delete_key(const uint8_t* nameDigest, uint32_t) {
  if (nameDigest == nullptr) {
    return 1;
  }
  uint32_t handle = PersistentHandle(nameDigest);
  Tpm tpm;
  // An object this key manager did not create is left alone, as if absent.
  if (!Open(tpm) || !OpenOwnKey(tpm, handle)) {
    return 1;
  }
  return EvictKey(tpm, handle) ? 0 : 1;
}

int pcp_evict_stale_keys(const uint8_t* keepNameDigest) {
  Tpm tpm;
  if (!Open(tpm)) {
    return 1;
  }
  const uint32_t keep = keepNameDigest != nullptr ? PersistentHandle(keepNameDigest) : 0;
  TPMI_YES_NO more = TPM2_NO;
  TPMS_CAPABILITY_DATA* data = nullptr;
  if (Esys_GetCapability(tpm.ctx, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, TPM2_CAP_HANDLES,
                         kOwnerPersistentFirst, TPM2_MAX_CAP_HANDLES, &more,
                         &data) != TSS2_RC_SUCCESS) {
    return 1;
  }
  ScopeExit freeData([&] { Esys_Free(data); });
  // A TPM holds a handful of persistent objects, far fewer than one answer
  // can list, so |more| is not followed.
  int result = 0;
  for (uint32_t i = 0; i < data->data.handles.count; ++i) {
    const uint32_t handle = data->data.handles.handle[i];
    if (handle > kOwnerPersistentLast || handle == keep || !OpenOwnKey(tpm, handle)) {
      continue;
    }
    if (!EvictKey(tpm, handle)) {
      result = 1;
    }
  }
  return result;
}

// The password is not needed to seal: only the key's public part is used.
int pcp_encryptDataFragment(const char* nameHex, const char*, const uint8_t* data, uint32_t length,
                            uint8_t* out, uint32_t* outSize) {
  if (nameHex == nullptr || data == nullptr || out == nullptr || outSize == nullptr ||
      *outSize < PCP_FRAGMENT_SIZE) {
    return 1;
  }
  Tpm tpm;
  if (!Open(tpm) || !OpenKey(tpm, nameHex)) {
    return 1;
  }
  TPM2B_PUBLIC* keyPublic = nullptr;
  if (Esys_ReadPublic(tpm.ctx, tpm.key, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, &keyPublic,
                      nullptr, nullptr) != TSS2_RC_SUCCESS) {
    return 1;
  }
  const TPMT_PUBLIC& area = keyPublic->publicArea;
  uint32_t modulusSize = area.type == TPM2_ALG_RSA ? area.parameters.rsaDetail.keyBits / 8u : 0;
  bool usable = IsOwnKey(area) && modulusSize > kOaepOverhead && modulusSize <= kMaxCipherSize;
  Esys_Free(keyPublic);
  if (!usable || length > modulusSize - kOaepOverhead) {
    return 1;
  }

  // The plaintext is the first command parameter: it crosses the bus
  // encrypted under the salted session.
  if (!StartSaltedSession(tpm, TPMA_SESSION_DECRYPT)) {
    return 1;
  }
  TPM2B_PUBLIC_KEY_RSA message{};
  ScopeExit wipeMessage([&] { OPENSSL_cleanse(&message, sizeof(message)); });
  message.size = static_cast<uint16_t>(length);
  std::memcpy(message.buffer, data, length);
  TPMT_RSA_DECRYPT scheme = OaepSha256();
  TPM2B_DATA label{};
  TPM2B_PUBLIC_KEY_RSA* cipher = nullptr;
  if (Esys_RSA_Encrypt(tpm.ctx, tpm.key, tpm.session, ESYS_TR_NONE, ESYS_TR_NONE, &message, &scheme,
                       &label, &cipher) != TSS2_RC_SUCCESS) {
    return 1;
  }
  ScopeExit freeCipher([&] { Esys_Free(cipher); });
  if (cipher->size == 0 || cipher->size > kMaxCipherSize) {
    return 1;
  }
  std::memset(out, 0, PCP_FRAGMENT_SIZE);
  std::memcpy(out, kFragmentTag, sizeof(kFragmentTag));
  PutBigEndian(out + 4, kFragmentVersion);
  PutBigEndian(out + 8, cipher->size);
  std::memcpy(out + kHeaderSize, cipher->buffer, cipher->size);
  *outSize = PCP_FRAGMENT_SIZE;
  return 0;
}

int pcp_decryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* fragment,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  if (nameHex == nullptr || passHex == nullptr || fragment == nullptr || out == nullptr ||
      outSize == nullptr || length < kHeaderSize) {
    return 1;
  }
  uint32_t cipherSize = GetBigEndian(fragment + 8);
  if (std::memcmp(fragment, kFragmentTag, sizeof(kFragmentTag)) != 0 ||
      GetBigEndian(fragment + 4) != kFragmentVersion || cipherSize == 0 ||
      cipherSize > kMaxCipherSize || cipherSize > length - kHeaderSize) {
    return 1;
  }

  Tpm tpm;
  if (!Open(tpm) || !OpenKey(tpm, nameHex)) {
    return 1;
  }
  {
    TPM2B_AUTH auth{};
    ScopeExit wipeAuth([&] { OPENSSL_cleanse(&auth, sizeof(auth)); });
    auth.size = kDigestSize;
    Md5OfString(passHex, auth.buffer);
    if (Esys_TR_SetAuth(tpm.ctx, tpm.key, &auth) != TSS2_RC_SUCCESS) {
      return 1;
    }
  }
  // The plaintext is the first response parameter: the TPM returns it
  // encrypted under the salted session.
  if (!StartSaltedSession(tpm, TPMA_SESSION_ENCRYPT)) {
    return 1;
  }
  TPM2B_PUBLIC_KEY_RSA cipher{};
  cipher.size = static_cast<uint16_t>(cipherSize);
  std::memcpy(cipher.buffer, fragment + kHeaderSize, cipherSize);
  TPMT_RSA_DECRYPT scheme = OaepSha256();
  TPM2B_DATA label{};
  TPM2B_PUBLIC_KEY_RSA* message = nullptr;
  ScopeExit freeMessage([&] {
    if (message != nullptr) {
      OPENSSL_cleanse(message, sizeof(*message));
      Esys_Free(message);
    }
  });
  if (Esys_RSA_Decrypt(tpm.ctx, tpm.key, tpm.session, ESYS_TR_NONE, ESYS_TR_NONE, &cipher, &scheme,
                       &label, &message) != TSS2_RC_SUCCESS) {
    return 1;
  }
  if (message->size > *outSize || message->size > sizeof(message->buffer)) {
    return 1;
  }
  std::memcpy(out, message->buffer, message->size);
  *outSize = message->size;
  return 0;
}
