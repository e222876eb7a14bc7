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

}  // namespace keymgr::policy
