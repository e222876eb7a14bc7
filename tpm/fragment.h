// The sealed fragment of the platform key manager: a 12-byte header and the
// RSA-OAEP ciphertext, PCP_FRAGMENT_SIZE bytes in all. Pure code: no TPM.
//   0..3   tag "PCPF"
//   4..7   format version, 1
//   8..11  ciphertext length n (the key's modulus size, at most 256)
//   12..   n bytes of ciphertext, zero-filled up to 256 bytes
// Integers are big-endian.
#pragma once

#include <cstdint>
#include <span>

#include "tpm/pcp.h"
#include "util/status.h"

namespace keymgr::tpm {

inline constexpr std::uint32_t kFragmentHeaderSize = 12;
inline constexpr std::uint32_t kMaxCipherSize = PCP_FRAGMENT_SIZE - kFragmentHeaderSize;

// EncodeFragment writes the fragment of |cipher| (1 to kMaxCipherSize bytes)
// to |out|.
Status EncodeFragment(std::span<const std::uint8_t> cipher,
                      std::span<std::uint8_t, PCP_FRAGMENT_SIZE> out);

// DecodeFragment checks the header of |fragment| (its bytes as given, which
// may be fewer or more than PCP_FRAGMENT_SIZE) and sets |cipher| to the
// ciphertext inside it. Fails on a wrong tag or version, an empty or
// oversized ciphertext, or one that runs past the bytes given.
Status DecodeFragment(std::span<const std::uint8_t> fragment,
                      std::span<const std::uint8_t>* cipher);

}  // namespace keymgr::tpm
