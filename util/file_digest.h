#pragma once

#include <cstdint>
#include <span>

namespace keymgr {

inline constexpr std::size_t kFileDigestSize = 32;

enum class FileDigestResult {
  kOk,
  kStatusFailure,  // stat failed
  kOpenFailure,    // could not open, not a regular file, too large, no memory
};

// ComputeFileDigest hashes the whole file at |path| with SHA-256 into
// |digest|, opening it with |mode| ("r" or "rb"). On failure |digest| is left
// as it was and errno tells why. A file that shrinks after the stat is hashed
// as if the missing bytes were zeros.
FileDigestResult ComputeFileDigest(const char* path, const char* mode,
                                   std::span<std::uint8_t, kFileDigestSize> digest);

}  // namespace keymgr
