// The platform key manager's operations on one connection (tpm/connection.h).
// Each returns a Status; the C entry points (pcp.cpp) reduce it to 0 or 1.
// The commands each flow sends are few on purpose: a discrete TPM takes tens
// to hundreds of milliseconds for an asymmetric operation, so a boot sends
// one (the RSA decrypt) and a regeneration one RSA key generation and at
// most one primary. Private to tpm/.
#pragma once

#include <cstdint>
#include <span>

#include "policy/digests.h"
#include "tpm/connection.h"

namespace keymgr::tpm {

// Largest single draw; the callers ask for 20 or 32 bytes.
inline constexpr std::uint32_t kMaxRandom = 1024;
// OAEP with SHA-256 spends two digests and two bytes of the modulus.
inline constexpr std::uint32_t kOaepOverhead = 2 * 32 + 2;

// Keys (keys.cpp).

// HandleOfName is the persistent handle of the key named by |nameHex|.
std::uint32_t HandleOfName(const char* nameHex);
// ModulusSize is the size in bytes of the modulus of a key this key manager
// created (sealed ones under the vendor key |vendor|), which leaves room for
// OAEP and fits the fragment; 0 for any other.
std::uint32_t ModulusSize(const TPMT_PUBLIC& area, std::span<const std::uint8_t> vendor);
// CreateKey creates an RSA-|bits| key (1024 or 2048) authorised by the
// 16 bytes |passwordDigest| and makes it persistent at the handle of
// |nameDigest|; its public area stays with the connection for sealing.
Status CreateKey(Connection& tpm, const std::uint8_t* nameDigest,
                 const std::uint8_t* passwordDigest, std::uint32_t bits);
// DeleteKey evicts the key of |nameDigest|; anything else there is left.
Status DeleteKey(Connection& tpm, const std::uint8_t* nameDigest);
// EvictStaleKeys evicts every key of this key manager but the one of
// |keepNameDigest| (may be null).
Status EvictStaleKeys(Connection& tpm, const std::uint8_t* keepNameDigest);
// ListOwnKeys writes the handles of the keys of this key manager in the TPM
// to |handles|, as many as fit, and sets |*count| to how many there are.
Status ListOwnKeys(Connection& tpm, std::span<std::uint32_t> handles, std::uint32_t* count);

// A connection whose options name a seal PCR (a build with
// KEYMGR_SEAL_TO_VERDICT) creates keys that require that PCR at the good
// boot verdict's value as well as their password, and opens their fragments
// in a policy session that meets it.
// PcrSelection selects the PCRs of |pcrs| in the SHA-256 bank.
TPML_PCR_SELECTION PcrSelection(policy::PcrMask pcrs);

// Sealing (seal.cpp).

// Seal seals |length| bytes under the public part of the key of |nameHex|
// into the fragment at |out|, on the host.
Status Seal(Connection& tpm, const char* nameHex, const std::uint8_t* data, std::uint32_t length,
            std::uint8_t* out, std::uint32_t* outSize);
// Unseal opens a fragment with the key of |nameHex|, authorised by the MD5
// of |passHex|, the plaintext returning encrypted.
Status Unseal(Connection& tpm, const char* nameHex, const char* passHex,
              const std::uint8_t* fragment, std::uint32_t length, std::uint8_t* out,
              std::uint32_t* outSize);

// Random draws (draws.cpp).

// DrawRandom fills |count| bytes at |dst| (at most kMaxRandom) from the
// TPM's generator, the responses encrypted; a failure may leave part of a
// draw there.
Status DrawRandom(Connection& tpm, std::uint32_t count, std::uint8_t* dst);
// DrawEntropy draws up to |count| bytes in one command with no session.
Status DrawEntropy(Connection& tpm, std::uint32_t count, std::uint8_t* dst, std::uint32_t* drawn);

}  // namespace keymgr::tpm
