// The boot-chain policy file, /quorvan/hidden/keymgr.policy: what the vendor
// approved for one release, signed on the build host with an RSA-2048 key
// that the TPM verifies (PKCS#1 v1.5 over SHA-256, deterministic, so the
// same inputs give the same file). 596 bytes, integers big-endian:
//   0..3     magic "KMPL"
//   4..7     format version, 1
//   8..15    release counter, as in keymgr.sig
//   16..19   the PCRs of the SHA-256 bank the policies read, bit i for PCR i
//   20..51   approved policy of the sealed key: TPM2_PolicyPCR over those
//            PCRs at their predicted values, then TPM2_PolicyNV: the release
//            counter of the TPM at most this release
//   52..83   approved policy of the release counter's write: TPM2_PolicyPCR
//            as above, then TPM2_PolicyCommandCode(TPM2_NV_Increment)
//   84..339  signature of the key's approval digest (policy/digests.h)
//   340..595 signature of the counter's approval digest
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

#include "policy/digests.h"
#include "util/status.h"

namespace keymgr::policy {

inline constexpr std::size_t kRsaSignatureSize = 256;
inline constexpr std::size_t kPolicyFileSize = 84 + 2 * kRsaSignatureSize;
inline constexpr std::uint32_t kPolicyFileVersion = 1;

using RsaSignature = std::array<std::uint8_t, kRsaSignatureSize>;

struct PolicyFile {
  std::uint64_t release = 0;
  PcrMask pcrs = 0;
  Digest keyPolicy{};
  Digest counterPolicy{};
  RsaSignature keySignature{};
  RsaSignature counterSignature{};
};

// EncodePolicyFile lays |file| out as the policy file holds it.
void EncodePolicyFile(const PolicyFile& file, std::span<std::uint8_t, kPolicyFileSize> out);

// ReadPolicyFile reads and decodes the release's policy file,
// /quorvan/hidden/keymgr.policy.
Status ReadPolicyFile(PolicyFile* file);

// DecodePolicyFile reads |bytes|, which must be a whole policy file of this
// format version selecting PCRs of 0 to 23 only. The signatures are left to
// the TPM.
Status DecodePolicyFile(std::span<const std::uint8_t> bytes, PolicyFile* file);

}  // namespace keymgr::policy
