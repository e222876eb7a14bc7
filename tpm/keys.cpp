// The keys of the platform key manager: their template and marker, their
// handles, creation, deletion and the sweep of stale keys.
#include <openssl/crypto.h>
#include <tss2/tss2_mu.h>

#include <array>
#include <cstring>
#include <span>

#include "crypto/hash.h"
#include "keymgr_build_config.h"
#include "policy/digests.h"
#include "policy/file.h"
#include "tpm/chain.h"
#include "tpm/commands.h"
#include "tpm/fragment.h"
#include "tpm/keys.h"
#include "util/endian.h"
#include "util/secure.h"
#include "verdict/verdict.h"

namespace keymgr::tpm {

namespace {

// Keys this key manager creates carry this authPolicy, the SHA-256 of
// "keymgr: sealing key of the one-off key". No policy session can reach it
// (that would take a preimage), so it grants nothing, but it marks the key:
// only objects that carry it, with the exact template below, are ever
// evicted, never what other software made persistent in the owner range.
constexpr policy::Digest kKeyMarker = {
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
// digest, read big-endian (the top byte of the first four dropped). MD5 spreads the names evenly,
// so two live keys meet on one handle with odds of about 1 in 8 million; pcp_create_key then
// refuses rather than overwrite the other key.
uint32_t PersistentHandle(const uint8_t* nameDigest) {
  const uint32_t bits = LoadBig32(nameDigest) >> 8;
  return kOwnKeysFirst + bits % (kOwnerPersistentLast - kOwnKeysFirst + 1);
}

// A sealed key's user role is reached only through its policy.
constexpr TPMA_OBJECT kSealedKeyAttributes = kKeyAttributes & ~TPMA_OBJECT_USERWITHAUTH;

// VerdictPolicy is the authPolicy of a key sealed to PCR |pcr| alone by the
// builds before the vendor's policies: TPM2_PolicyPCR with the PCR at the
// good verdict's value, then TPM2_PolicyAuthValue. Such keys are still known,
// so that they are swept, but no longer opened.
policy::Digest VerdictPolicy(int pcr) {
  const policy::Digest good[] = {verdict::GoodPcrValue()};
  return policy::PolicyAuthValue(
      policy::PolicyPcr(policy::Digest{}, policy::PcrMask{1} << pcr, policy::PcrDigest(good)));
}

// AuthorizedPolicy is the authPolicy of a key sealed under the vendor key
// |vendor|: whatever policy the vendor approved for the key, then the key's
// password. It depends on nothing a regeneration or an update changes, so
// it marks the keys of this system as well.
policy::Digest AuthorizedPolicy(std::span<const uint8_t> vendor) {
  return policy::PolicyAuthValue(
      policy::PolicyAuthorize(policy::RsaSigningKeyName(vendor), policy::kKeyPolicyRef));
}

// IsOwnKey tells whether |area| is the public area of a key this key manager
// created: its template, and the marker or, for a sealed key, the policy of
// |vendor| or a verdict policy of one of the 24 PCRs. Keys of plain and
// sealed builds are all known, so that changing the build strands none.
bool IsOwnKey(const TPMT_PUBLIC& area, std::span<const uint8_t> vendor) {
  const TPMS_RSA_PARMS& rsa = area.parameters.rsaDetail;
  const auto carries = [&](std::span<const uint8_t, 32> policy) {
    return area.authPolicy.size == 32 &&
           std::memcmp(area.authPolicy.buffer, policy.data(), 32) == 0;
  };
  const bool plain = area.objectAttributes == kKeyAttributes && carries(kKeyMarker);
  bool sealed = area.objectAttributes == kSealedKeyAttributes && !vendor.empty() &&
                carries(AuthorizedPolicy(vendor));
  for (int pcr = 0; pcr < 24 && !plain && !sealed && area.objectAttributes == kSealedKeyAttributes;
       ++pcr) {
    sealed = carries(VerdictPolicy(pcr));
  }
  return area.type == TPM2_ALG_RSA && area.nameAlg == TPM2_ALG_SHA256 && (plain || sealed) &&
         rsa.symmetric.algorithm == TPM2_ALG_NULL && rsa.scheme.scheme == TPM2_ALG_OAEP &&
         rsa.scheme.details.oaep.hashAlg == TPM2_ALG_SHA256;
}

}  // namespace

TPML_PCR_SELECTION PcrSelection(policy::PcrMask pcrs) {
  TPML_PCR_SELECTION selection{};
  selection.count = 1;
  selection.pcrSelections[0].hash = TPM2_ALG_SHA256;
  selection.pcrSelections[0].sizeofSelect = 3;
  for (int i = 0; i < 3; ++i) {
    selection.pcrSelections[0].pcrSelect[i] = static_cast<uint8_t>(pcrs >> (8 * i));
  }
  return selection;
}

uint32_t HandleOfName(const char* nameHex) {
  uint8_t nameDigest[crypto::kMd5Size];
  (void)Md5OfString(nameHex, nameDigest);  // always 0
  return PersistentHandle(nameDigest);
}

uint32_t ModulusSize(const TPMT_PUBLIC& area, std::span<const uint8_t> vendor) {
  const uint32_t size = IsOwnKey(area, vendor) ? area.parameters.rsaDetail.keyBits / 8u : 0;
  return size > kOaepOverhead && size <= kMaxCipherSize && area.unique.rsa.size == size ? size : 0;
}

namespace {

// ReadOwnKey reads the public area of the object at |handle| and fails,
// as for a missing key, when it is not a key of this key manager.
Status ReadOwnKey(Connection& tpm, uint32_t handle, TPM2B_PUBLIC* area) {
  if (Status status = ReadPublic(tpm, handle, area); !status.ok()) {
    return status;
  }
  return ModulusSize(area->publicArea, tpm.options.vendorKey) != 0
             ? Status()
             : Refused("not a key of this system");
}

// KeyTemplate is the template of every key this key manager creates.
TPM2B_TEMPLATE KeyTemplate(uint32_t bits, const Options& options) {
  const bool sealed = options.sealPcr >= 0;
  TPMT_PUBLIC area{};
  area.type = TPM2_ALG_RSA;
  area.nameAlg = TPM2_ALG_SHA256;
  area.objectAttributes = sealed ? kSealedKeyAttributes : kKeyAttributes;
  const policy::Digest policy = sealed ? AuthorizedPolicy(options.vendorKey) : kKeyMarker;
  area.authPolicy.size = policy.size();
  std::memcpy(area.authPolicy.buffer, policy.data(), policy.size());
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

}  // namespace

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
  // A sealed key's proofs salt their sessions to the storage key it is made
  // under, which its creation pins.
  if (Status status = tpm.options.sealPcr >= 0 ? PinParent(tpm) : Status(); !status.ok()) {
    return status;
  }
  TPM2B_SENSITIVE_CREATE sensitive{};
  ScopeExit wipeSensitive([&] { OPENSSL_cleanse(&sensitive, sizeof(sensitive)); });
  sensitive.sensitive.userAuth.size = crypto::kMd5Size;
  std::memcpy(sensitive.sensitive.userAuth.buffer, passwordDigest, crypto::kMd5Size);
  const TPM2B_TEMPLATE templ = KeyTemplate(bits, tpm.options);

  ESYS_TR loaded = ESYS_TR_NONE;
  Output<TPM2B_PUBLIC> keyPublic;
  if (Status status = CreateLoaded(tpm, tpm.Parent(), tpm.session.get().tr, sensitive, templ,
                                   &loaded, &keyPublic);
      !status.ok()) {
    return status;
  }
  TransientObject loadedKey(tpm.Object(loaded));
  // The handle is checked by the TPM itself: the eviction fails when it is
  // taken.
  TPM2_HANDLE loadedHandle = 0;
  if (Status status =
          Check("Esys_TR_GetTpmHandle", Esys_TR_GetTpmHandle(tpm.ctx(), loaded, &loadedHandle));
      !status.ok()) {
    return status;
  }
  if (Status status = EvictControl(tpm, loadedHandle, handle); !status.ok()) {
    return status;
  }
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
  return EvictControl(tpm, handle, handle);
}

namespace {

// ForEachOwnKey calls |each| with the handle of every persistent key of this
// key manager but the one at |skip|, which it does not even read.
template <class Each>
Status ForEachOwnKey(Connection& tpm, uint32_t skip, Each each) {
  TPMS_CAPABILITY_DATA data{};
  if (Status status =
          GetCapability(tpm, TPM2_CAP_HANDLES, kOwnKeysFirst, TPM2_MAX_CAP_HANDLES, &data);
      !status.ok()) {
    return status;
  }
  // A TPM holds a handful of persistent objects, far fewer than one answer
  // can list, so |more| is not followed.
  const TPML_HANDLE& handles = data.data.handles;
  for (uint32_t i = 0; i < handles.count; ++i) {
    const uint32_t handle = handles.handle[i];
    TPM2B_PUBLIC area{};
    if (handle <= kOwnerPersistentLast && handle != skip && ReadOwnKey(tpm, handle, &area).ok()) {
      each(handle);
    }
  }
  return Status();
}

}  // namespace

Status EvictStaleKeys(Connection& tpm, const uint8_t* keepNameDigest) {
  const uint32_t keep = keepNameDigest != nullptr ? PersistentHandle(keepNameDigest) : 0;
  Status result;
  Status listed = ForEachOwnKey(tpm, keep, [&](uint32_t handle) {
    if (Status status = EvictControl(tpm, handle, handle); !status.ok()) {
      result = status;
    }
  });
  return listed.ok() ? result : listed;
}

Status ListOwnKeys(Connection& tpm, std::span<uint32_t> handles, uint32_t* count) {
  *count = 0;
  return ForEachOwnKey(tpm, 0, [&](uint32_t handle) {
    if (*count < handles.size()) {
      handles[*count] = handle;
    }
    ++*count;
  });
}

}  // namespace keymgr::tpm
