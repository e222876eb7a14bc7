// The SHA-256 digest of a listed file.
#pragma once

#include <cstdint>
#include <span>

#include "util/status.h"

namespace keymgr {

inline constexpr std::size_t kFileDigestSize = 32;

// ComputeFileDigest hashes the whole file at |path| with SHA-256 into
// |digest|, opening it with |mode| ("r" or "rb"). It fails on "stat" when
// the path cannot be examined; every other failure (cannot open, not a
// regular file, too large, no memory) counts as an open failure. On failure
// |digest| is left as it was. A file that shrinks after the stat is hashed as
// if the missing bytes were zeros.
Status ComputeFileDigest(const char* path, const char* mode,
                         std::span<std::uint8_t, kFileDigestSize> digest);

}  // namespace keymgr
