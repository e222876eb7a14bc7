#include "policy/digests.h"

#include <tss2/tss2_tpm2_types.h>

#include "crypto/hash.h"
#include "util/endian.h"

namespace keymgr::policy {

namespace {

// Hasher hashes TPM-marshalled fields: integers big-endian, byte strings as
// they are.
class Hasher {
 public:
  Hasher& Bytes(std::span<const std::uint8_t> bytes) {
    (void)sha_.Update(bytes.data(), bytes.size());
    return *this;
  }
  template <class Int>
  Hasher& Big(Int value) {
    std::array<std::uint8_t, sizeof(Int)> bytes{};
    StoreBig(bytes.data(), value);
    return Bytes(bytes);
  }
  // Sized writes a TPM2B: a 16-bit size, then the bytes.
  Hasher& Sized(std::span<const std::uint8_t> bytes) {
    return Big(static_cast<std::uint16_t>(bytes.size())).Bytes(bytes);
  }
  Digest Final() {
    Digest digest{};
    (void)sha_.Final(digest);
    return digest;
  }
  // After starts the digest of a policy command: the digest before it, then
  // the command's code.
  static Hasher After(const Digest& policy, std::uint32_t commandCode) {
    Hasher hash;
    hash.Bytes(policy).Big(commandCode);
    return hash;
  }

 private:
  crypto::Sha256 sha_;
};

Name NameOf(const Digest& digest) {
  Name name{};
  StoreBig16(name.data(), TPM2_ALG_SHA256);
  std::copy(digest.begin(), digest.end(), name.begin() + 2);
  return name;
}

}  // namespace

void MarshalPcrSelection(PcrMask pcrs, std::span<std::uint8_t, kPcrSelectionSize> out) {
  StoreBig32(out.data(), 1);
  StoreBig16(out.data() + 4, TPM2_ALG_SHA256);
  out[6] = 3;
  for (int i = 0; i < 3; ++i) {
    out[7 + i] = static_cast<std::uint8_t>(pcrs >> (8 * i));
  }
}

Digest PcrDigest(std::span<const Digest> values) {
  Hasher hash;
  for (const Digest& value : values) {
    hash.Bytes(value);
  }
  return hash.Final();
}

Digest PolicyPcr(const Digest& policy, PcrMask pcrs, const Digest& pcrDigest) {
  std::array<std::uint8_t, kPcrSelectionSize> selection{};
  MarshalPcrSelection(pcrs, selection);
  return Hasher::After(policy, TPM2_CC_PolicyPCR).Bytes(selection).Bytes(pcrDigest).Final();
}

Digest PolicyAuthValue(const Digest& policy) {
  return Hasher::After(policy, TPM2_CC_PolicyAuthValue).Final();
}

Digest PolicyCommandCode(const Digest& policy, std::uint32_t commandCode) {
  return Hasher::After(policy, TPM2_CC_PolicyCommandCode).Big(commandCode).Final();
}

Digest PolicyNv(const Digest& policy, std::uint64_t operand, std::uint16_t operation,
                const Name& index) {
  // The arguments enter as one digest: operand, offset, operation.
  const Digest args = Hasher().Big(operand).Big<std::uint16_t>(0).Big(operation).Final();
  return Hasher::After(policy, TPM2_CC_PolicyNV).Bytes(args).Bytes(index).Final();
}

Digest PolicyAuthorize(const Name& signer, std::span<const std::uint8_t> policyRef) {
  const Digest first = Hasher::After(Digest{}, TPM2_CC_PolicyAuthorize).Bytes(signer).Final();
  return Hasher().Bytes(first).Bytes(policyRef).Final();
}

Digest ApprovalDigest(const Digest& approved, std::span<const std::uint8_t> policyRef) {
  return Hasher().Bytes(approved).Bytes(policyRef).Final();
}

Name RsaSigningKeyName(std::span<const std::uint8_t> modulus) {
  return NameOf(Hasher()
                    .Big<std::uint16_t>(TPM2_ALG_RSA)
                    .Big<std::uint16_t>(TPM2_ALG_SHA256)
                    .Big<std::uint32_t>(TPMA_OBJECT_SIGN_ENCRYPT | TPMA_OBJECT_USERWITHAUTH)
                    .Sized({})  // no policy
                    .Big<std::uint16_t>(TPM2_ALG_NULL)
                    .Big<std::uint16_t>(TPM2_ALG_RSASSA)
                    .Big<std::uint16_t>(TPM2_ALG_SHA256)
                    .Big(static_cast<std::uint16_t>(modulus.size() * 8))
                    .Big<std::uint32_t>(0)  // the default exponent
                    .Sized(modulus)
                    .Final());
}

Name NvIndexName(std::uint32_t handle, std::uint32_t attributes, const Digest& authPolicy,
                 std::uint16_t dataSize) {
  return NameOf(Hasher()
                    .Big(handle)
                    .Big<std::uint16_t>(TPM2_ALG_SHA256)
                    .Big(attributes)
                    .Sized(authPolicy)
                    .Big(dataSize)
                    .Final());
}

Counter ReleaseCounter(std::span<const std::uint8_t> vendor, int verdictPcr,
                       const Digest& goodPcr) {
  if (!vendor.empty()) {
    return {kAuthorizedCounterHandle,
            PolicyAuthorize(RsaSigningKeyName(vendor), kCounterPolicyRef)};
  }
  const Digest good[] = {goodPcr};
  return {kCounterHandle,
          PolicyCommandCode(PolicyPcr(Digest{}, PcrMask{1} << verdictPcr, PcrDigest(good)),
                            TPM2_CC_NV_Increment)};
}

Name CounterName(const Counter& counter, bool written) {
  return NvIndexName(counter.handle, kCounterAttributes | (written ? kCounterWritten : 0),
                     counter.policy, kCounterSize);
}

Digest ApprovedKeyPolicy(PcrMask pcrs, const Digest& pcrDigest, std::uint64_t release,
                         const Name& counter) {
  return PolicyNv(PolicyPcr(Digest{}, pcrs, pcrDigest), release, TPM2_EO_UNSIGNED_LE, counter);
}

Digest ApprovedCounterPolicy(PcrMask pcrs, const Digest& pcrDigest) {
  return PolicyCommandCode(PolicyPcr(Digest{}, pcrs, pcrDigest), TPM2_CC_NV_Increment);
}

}  // namespace keymgr::policy
