// The SHA-256 digest of a listed file, streamed through a fixed buffer.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <span>

#include "crypto/hash.h"
#include "crypto/openssl_handles.h"
#include "util/status.h"

namespace keymgr {

// Files are read this much at a time: enough that the system calls cost
// little next to the hashing, little enough to stay in the CPU cache between
// the read and the hash.
inline constexpr std::size_t kFileReadChunk = std::size_t{128} * 1024;

// FileHasher holds what hashing reuses from one file to the next: an aligned
// read buffer of kFileReadChunk bytes and a hash context, both taken at the
// first use. One per thread.
struct FileHasher {
  HeapBytes buffer;
  crypto::EvpMdContext context;
};

// A file opened for hashing, with the size that stat gave it.
struct FileToHash {
  Descriptor fd;
  std::size_t size = 0;
};

// What kept a file from being hashed, which decides the line a caller
// prints; |status| names the call that failed and its code.
struct HashResult {
  enum Failure : std::uint8_t {
    kNone,
    kStat,  // the path cannot be examined
    kOpen,  // the file cannot be opened or read, or is no regular file below 2 GiB
  };
  Failure failure = kNone;
  Status status;
  bool ok() const { return failure == kNone; }
};

// OpenFileToHash opens |path| for HashOpenFile without blocking, and only a
// regular file below 2 GiB. |soon| tells the kernel that the file will be
// read shortly, so that it can start reading it in now.
HashResult OpenFileToHash(const char* path, FileToHash& file, bool soon);

// HashOpenFile hashes |file| with SHA-256 into |digest| and closes it; a
// failure counts as the file's open failure. The
// file streams through |hasher|'s buffer, so memory does not grow with the
// file. Exactly the size that stat gave is hashed: bytes missing because the
// file shrank count as zeros, bytes added since are not hashed. On failure
// |digest| is left as it was. When |stop| becomes true the file is abandoned
// part way (ECANCELED), so that a run that has already
// failed does not wait for it.
Status HashOpenFile(FileHasher& hasher, FileToHash& file,
                    std::span<std::uint8_t, crypto::kSha256Size> digest,
                    const std::atomic<bool>* stop);

// ComputeFileDigest opens and hashes the file at |path| with a hasher of its
// own: the digest of a single file. A file that cannot be hashed once opened
// fails as one that cannot be opened.
HashResult ComputeFileDigest(const char* path, std::span<std::uint8_t, crypto::kSha256Size> digest);

}  // namespace keymgr
