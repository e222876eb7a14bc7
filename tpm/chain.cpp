// The chain of trust's TPM work: salted sessions, the vendor's approvals,
// the release counter and the verdict PCR's extends (tpm/chain.h).
#include "tpm/chain.h"

#include <algorithm>
#include <cstring>

#include "policy/digests.h"
#include "tpm/commands.h"
#include "tpm/keys.h"
#include "util/endian.h"
#include "verdict/verdict.h"

namespace keymgr::tpm {

namespace {

static_assert(policy::kCounterAttributes ==
              ((TPM2_NT_COUNTER << TPMA_NV_TPM2_NT_SHIFT) | TPMA_NV_POLICYWRITE | TPMA_NV_AUTHREAD |
               TPMA_NV_NO_DA));
static_assert(policy::kCounterWritten == TPMA_NV_WRITTEN);

// VendorPublic is the vendor's RSA key as the TPM loads it to verify its
// signatures; its name is policy::RsaSigningKeyName of the modulus.
TPM2B_PUBLIC VendorPublic(std::span<const std::uint8_t> modulus) {
  TPM2B_PUBLIC area{};
  TPMT_PUBLIC& key = area.publicArea;
  key.type = TPM2_ALG_RSA;
  key.nameAlg = TPM2_ALG_SHA256;
  key.objectAttributes = TPMA_OBJECT_SIGN_ENCRYPT | TPMA_OBJECT_USERWITHAUTH;
  TPMS_RSA_PARMS& rsa = key.parameters.rsaDetail;
  rsa.symmetric.algorithm = TPM2_ALG_NULL;
  rsa.scheme.scheme = TPM2_ALG_RSASSA;
  rsa.scheme.details.rsassa.hashAlg = TPM2_ALG_SHA256;
  rsa.keyBits = static_cast<TPMI_RSA_KEY_BITS>(modulus.size() * 8);
  rsa.exponent = 0;
  key.unique.rsa.size = static_cast<std::uint16_t>(modulus.size());
  std::copy(modulus.begin(), modulus.end(), key.unique.rsa.buffer);
  return area;
}

template <class Sized, std::size_t N>
Sized SizedOf(const std::array<std::uint8_t, N>& bytes) {
  Sized sized{};
  sized.size = N;
  if constexpr (requires { sized.name; }) {
    static_assert(N <= sizeof(sized.name));
    std::copy(bytes.begin(), bytes.end(), sized.name);
  } else {
    static_assert(N <= sizeof(sized.buffer));
    std::copy(bytes.begin(), bytes.end(), sized.buffer);
  }
  return sized;
}

// Approve meets the vendor's approval of |approved| for |policyRef| in
// |session|: the TPM checks |signature| under the vendor key and gives a
// ticket that PolicyAuthorize takes.
template <std::size_t kRef>
Status Approve(Connection& tpm, ESYS_TR session, std::span<const std::uint8_t> vendor,
               const policy::Digest& approved, const policy::RsaSignature& signature,
               const std::array<std::uint8_t, kRef>& policyRef) {
  if (vendor.size() != policy::kRsaSignatureSize) {
    return Refused("vendor key");
  }
  ESYS_TR loaded = ESYS_TR_NONE;
  if (Status status = LoadExternal(tpm, VendorPublic(vendor), &loaded); !status.ok()) {
    return status;
  }
  TransientObject key(tpm.Object(loaded));
  TPMT_SIGNATURE rsassa{};
  rsassa.sigAlg = TPM2_ALG_RSASSA;
  rsassa.signature.rsassa.hash = TPM2_ALG_SHA256;
  rsassa.signature.rsassa.sig = SizedOf<TPM2B_PUBLIC_KEY_RSA>(signature);
  Output<TPMT_TK_VERIFIED> ticket;
  if (Status status = VerifySignature(
          tpm, loaded, SizedOf<TPM2B_DIGEST>(policy::ApprovalDigest(approved, policyRef)), rsassa,
          &ticket);
      !status.ok()) {
    return status;
  }
  return PolicyAuthorize(tpm, session, SizedOf<TPM2B_DIGEST>(approved),
                         SizedOf<TPM2B_NONCE>(policyRef),
                         SizedOf<TPM2B_NAME>(policy::RsaSigningKeyName(vendor)), *ticket.get());
}

// CounterOf is the release counter of this build.
policy::Counter CounterOf(std::span<const std::uint8_t> vendor, int verdictPcr) {
  return policy::ReleaseCounter(vendor, verdictPcr, verdict::GoodPcrValue());
}

TPM2B_NV_PUBLIC CounterPublic(const policy::Counter& counter) {
  TPM2B_NV_PUBLIC area{};
  area.nvPublic.nvIndex = counter.handle;
  area.nvPublic.nameAlg = TPM2_ALG_SHA256;
  area.nvPublic.attributes = policy::kCounterAttributes;
  area.nvPublic.authPolicy = SizedOf<TPM2B_DIGEST>(counter.policy);
  area.nvPublic.dataSize = policy::kCounterSize;
  return area;
}

// OpenedCounter is the release counter, open on a connection.
struct OpenedCounter {
  PersistentObject index;
  bool written = false;
};

// OpenCounter opens the release counter, defining it on first use, and
// holds its name against the one this build gives it.
Status OpenCounter(Connection& tpm, std::span<const std::uint8_t> vendor, int verdictPcr,
                   OpenedCounter* opened) {
  const policy::Counter counter = CounterOf(vendor, verdictPcr);
  ESYS_TR index = ESYS_TR_NONE;
  if (!OpenPersistent(tpm, counter.handle, &index).ok()) {
    if (tpm.broken) {
      return Refused("TPM connection lost");
    }
    if (Status status = NvDefineSpace(tpm, CounterPublic(counter), &index); !status.ok()) {
      return status;
    }
  }
  opened->index.reset(tpm.Object(index));
  Output<TPM2B_NAME> name;
  if (Status status = Check("Esys_TR_GetName", Esys_TR_GetName(tpm.ctx(), index, name.out()));
      !status.ok()) {
    return status;
  }
  const auto is = [&](bool written) {
    const policy::Name expected = policy::CounterName(counter, written);
    return name.get()->size == expected.size() &&
           std::equal(expected.begin(), expected.end(), name.get()->name);
  };
  opened->written = is(true);
  return opened->written || is(false) ? Status()
                                      : Refused("another NV index at the release counter's handle");
}

Status ReadCounter(Connection& tpm, const OpenedCounter& counter, std::uint64_t* value) {
  *value = 0;
  if (!counter.written) {
    return Status();
  }
  if (Status status = UseSaltedSession(tpm, 0); !status.ok()) {
    return status;
  }
  Output<TPM2B_MAX_NV_BUFFER> data;
  if (Status status =
          NvRead(tpm, counter.index.get().tr, tpm.session.get().tr, policy::kCounterSize, &data);
      !status.ok()) {
    return status;
  }
  if (data.get()->size != policy::kCounterSize) {
    return Refused("release counter size");
  }
  *value = LoadBig64(data.get()->buffer);
  return Status();
}

// MeetCounterPolicy runs the counter's write policy in |session|.
Status MeetCounterPolicy(Connection& tpm, ESYS_TR session, std::span<const std::uint8_t> vendor,
                         int verdictPcr, const policy::PolicyFile* file) {
  if (!vendor.empty() && file == nullptr) {
    return Refused("no policy file for the release counter");
  }
  const policy::PcrMask pcrs = vendor.empty() ? policy::PcrMask{1} << verdictPcr : file->pcrs;
  if (Status status = PolicyPCR(tpm, session, PcrSelection(pcrs)); !status.ok()) {
    return status;
  }
  if (Status status = PolicyCommandCode(tpm, session, TPM2_CC_NV_Increment); !status.ok()) {
    return status;
  }
  return vendor.empty() ? Status()
                        : Approve(tpm, session, vendor, file->counterPolicy, file->counterSignature,
                                  policy::kCounterPolicyRef);
}

}  // namespace

Status StartSaltedSession(Connection& tpm, TPM2_SE type, ESYS_TR* session) {
  if (Status status = UsePinnedParent(tpm); !status.ok()) {
    return status;
  }
  return StartSession(tpm, tpm.Parent(), ESYS_TR_NONE, session, type);
}

Status ExtendPcr(Connection& tpm, std::uint32_t pcr, std::span<const std::uint8_t, 32> digest) {
  if (pcr > 23) {
    return Refused("PCR index");
  }
  if (Status status = UsePinnedParent(tpm); !status.ok()) {
    return status;
  }
  // The digests are no TPM2B, so they cannot be encrypted; the session's
  // HMAC protects them.
  if (Status status = UseSaltedSession(tpm, 0); !status.ok()) {
    return status;
  }
  TPML_DIGEST_VALUES values{};
  values.count = 1;
  values.digests[0].hashAlg = TPM2_ALG_SHA256;
  std::copy(digest.begin(), digest.end(), values.digests[0].digest.sha256);
  return PcrExtend(tpm, pcr, tpm.session.get().tr, values);
}

Status MeetKeyPolicy(Connection& tpm, ESYS_TR session, const policy::PolicyFile& file) {
  if (Status status = PolicyPCR(tpm, session, PcrSelection(file.pcrs)); !status.ok()) {
    return status;
  }
  ESYS_TR counter = ESYS_TR_NONE;
  if (Status status = OpenPersistent(tpm, policy::kAuthorizedCounterHandle, &counter);
      !status.ok()) {
    return status;
  }
  PersistentObject counterIndex(tpm.Object(counter));
  TPM2B_OPERAND release{};
  release.size = policy::kCounterSize;
  StoreBig64(release.buffer, file.release);
  if (Status status = PolicyNV(tpm, session, counter, release, TPM2_EO_UNSIGNED_LE); !status.ok()) {
    return status;
  }
  if (Status status = Approve(tpm, session, tpm.options.vendorKey, file.keyPolicy,
                              file.keySignature, policy::kKeyPolicyRef);
      !status.ok()) {
    return status;
  }
  return PolicyAuthValue(tpm, session);
}

Status ReadReleaseFloor(Connection& tpm, std::span<const std::uint8_t> vendor, int verdictPcr,
                        std::uint64_t* floor) {
  *floor = 0;
  if (Status status = UsePinnedParent(tpm); !status.ok()) {
    return status;
  }
  OpenedCounter counter;
  if (Status status = OpenCounter(tpm, vendor, verdictPcr, &counter); !status.ok()) {
    return status;
  }
  return ReadCounter(tpm, counter, floor);
}

Status RaiseReleaseFloor(Connection& tpm, std::span<const std::uint8_t> vendor, int verdictPcr,
                         std::uint64_t release, const policy::PolicyFile* file) {
  if (Status status = UsePinnedParent(tpm); !status.ok()) {
    return status;
  }
  OpenedCounter counter;
  std::uint64_t floor = 0;
  if (Status status = OpenCounter(tpm, vendor, verdictPcr, &counter); !status.ok()) {
    return status;
  }
  if (Status status = ReadCounter(tpm, counter, &floor); !status.ok()) {
    return status;
  }
  while (!counter.written || floor < release) {
    ESYS_TR started = ESYS_TR_NONE;
    if (Status status = StartSaltedSession(tpm, TPM2_SE_POLICY, &started); !status.ok()) {
      return status;
    }
    TransientObject session(tpm.Object(started));
    if (Status status = MeetCounterPolicy(tpm, started, vendor, verdictPcr, file); !status.ok()) {
      return status;
    }
    if (Status status = NvIncrement(tpm, counter.index.get().tr, started); !status.ok()) {
      return status;
    }
    // A counter's first increment starts it where the TPM chooses, so the
    // value is read back each time rather than counted.
    counter.written = true;
    if (Status status = ReadCounter(tpm, counter, &floor); !status.ok()) {
      return status;
    }
  }
  return Status();
}

}  // namespace keymgr::tpm
