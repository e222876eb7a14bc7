// TPM policy digests computed off the TPM: what a policy session's digest
// becomes after each policy command, and the names the commands take in.
// The host tool that signs a release's policies and the key manager that
// creates keys and counters under them compute them here, the same way.
#pragma once

#include <array>
#include <cstdint>
#include <span>

namespace keymgr::policy {

using Digest = std::array<std::uint8_t, 32>;
// A TPM name of a SHA-256 object: the name algorithm, then the digest.
using Name = std::array<std::uint8_t, 34>;
// PCRs of the SHA-256 bank, bit i for PCR i (0 to 23).
using PcrMask = std::uint32_t;
inline constexpr PcrMask kAllPcrs = 0xFFFFFF;

// MarshalPcrSelection writes the TPML_PCR_SELECTION of |pcrs| in the SHA-256
// bank: one selection of three bytes.
inline constexpr std::size_t kPcrSelectionSize = 10;
void MarshalPcrSelection(PcrMask pcrs, std::span<std::uint8_t, kPcrSelectionSize> out);

// PcrDigest is the SHA-256 of the values of the selected PCRs, in ascending
// order: what TPM2_PolicyPCR compares.
Digest PcrDigest(std::span<const Digest> values);

// Each gives the session digest after the command, from |policy| before it.
Digest PolicyPcr(const Digest& policy, PcrMask pcrs, const Digest& pcrDigest);
Digest PolicyAuthValue(const Digest& policy);
Digest PolicyCommandCode(const Digest& policy, std::uint32_t commandCode);
// PolicyNv: the index's 8 bytes, read as a big-endian number, compared with
// |operand| by |operation| (a TPM_EO code).
Digest PolicyNv(const Digest& policy, std::uint64_t operand, std::uint16_t operation,
                const Name& index);
// PolicyAuthorize replaces the digest by one that any policy |signer|
// approved for |policyRef| satisfies.
Digest PolicyAuthorize(const Name& signer, std::span<const std::uint8_t> policyRef);

// ApprovalDigest is what the signer signs to approve |approved| for
// |policyRef|: the SHA-256 of the two.
Digest ApprovalDigest(const Digest& approved, std::span<const std::uint8_t> policyRef);

// RsaSigningKeyName is the name of an RSA public key loaded to verify
// RSASSA signatures with SHA-256 (no policy, sign only), of |modulus| and
// the default exponent.
Name RsaSigningKeyName(std::span<const std::uint8_t> modulus);

// NvIndexName is the name of the NV index at |handle| with |attributes|,
// |authPolicy| and |dataSize| bytes.
Name NvIndexName(std::uint32_t handle, std::uint32_t attributes, const Digest& authPolicy,
                 std::uint16_t dataSize);

// The policy references the two approvals are made for, so that neither
// signature serves the other.
inline constexpr std::array<std::uint8_t, 10> kKeyPolicyRef = {'k', 'e', 'y', 'm', 'g',
                                                               'r', ' ', 'k', 'e', 'y'};
inline constexpr std::array<std::uint8_t, 14> kCounterPolicyRef = {
    'k', 'e', 'y', 'm', 'g', 'r', ' ', 'c', 'o', 'u', 'n', 't', 'e', 'r'};

// The release counter: an 8-byte TPM_NT_COUNTER NV index in the owner range
// (TCG's registry of handles: 0x01800000-0x01BFFFFF) that only a policy
// session can move and anyone can read with its empty password. A build
// whose counter the vendor's approvals move and one whose counter the good
// verdict alone moves each have a handle of their own, so that neither
// finds the other's counter in its place.
inline constexpr std::uint32_t kCounterHandle = 0x01800B0Eu;            // the verdict's
inline constexpr std::uint32_t kAuthorizedCounterHandle = 0x01800B0Fu;  // the vendor's
inline constexpr std::uint16_t kCounterSize = 8;
// TPM_NT_COUNTER | POLICYWRITE | AUTHREAD | NO_DA; the TPM sets WRITTEN on
// the first increment.
inline constexpr std::uint32_t kCounterAttributes = 0x02040018u;
inline constexpr std::uint32_t kCounterWritten = 0x20000000u;

struct Counter {
  std::uint32_t handle;
  Digest policy;  // its authPolicy
};

// ReleaseCounter is a build's counter: moved by the vendor's approval for
// the counter when |vendor| (an RSA modulus) is given, else by the good
// verdict |goodPcr| in PCR |verdictPcr| for TPM2_NV_Increment.
Counter ReleaseCounter(std::span<const std::uint8_t> vendor, int verdictPcr, const Digest& goodPcr);

// CounterName is |counter|'s name, |written| or not yet.
Name CounterName(const Counter& counter, bool written);

// The two policies the vendor approves for a release, over the PCRs of
// |pcrs| at the values whose PcrDigest is |pcrDigest|:
// ApprovedKeyPolicy, the sealed key's: those PCRs, then the release counter
// named |counter| at most |release| (TPM_EO_UNSIGNED_LE);
Digest ApprovedKeyPolicy(PcrMask pcrs, const Digest& pcrDigest, std::uint64_t release,
                         const Name& counter);
// ApprovedCounterPolicy, the counter's write: those PCRs, then
// TPM2_NV_Increment.
Digest ApprovedCounterPolicy(PcrMask pcrs, const Digest& pcrDigest);

}  // namespace keymgr::policy
