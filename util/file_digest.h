#pragma once

#include <openssl/types.h>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <span>

namespace keymgr {

inline constexpr std::size_t kFileDigestSize = 32;

// Files are read this much at a time: enough that the system calls cost
// little next to the hashing, little enough to stay in the CPU cache between
// the read and the hash.
inline constexpr std::size_t kFileReadChunk = 128 * 1024;

enum class FileDigestResult {
  kOk,
  kStatusFailure,  // stat failed
  kOpenFailure,    // could not open, not a regular file, too large, no memory
};

// FileHasher holds what hashing reuses from one file to the next: an aligned
// read buffer of kFileReadChunk bytes and a hash context, both taken at the
// first use. One per thread.
struct FileHasher {
  FileHasher() = default;
  ~FileHasher();
  FileHasher(const FileHasher&) = delete;
  FileHasher& operator=(const FileHasher&) = delete;

  std::uint8_t* buffer = nullptr;
  EVP_MD_CTX* context = nullptr;
};

// A file opened for hashing, with the size that stat gave it.
struct FileToHash {
  int fd = -1;
  std::size_t size = 0;
};

// OpenFileToHash stats |path| and opens it for HashOpenFile, failing as
// ComputeFileDigest does; errno tells why. |soon| tells the kernel that the
// file will be read shortly, so it can start reading it in now.
FileDigestResult OpenFileToHash(const char* path, FileToHash& file, bool soon);

// HashOpenFile hashes |file| with SHA-256 into |digest| and closes it. The
// file streams through |hasher|'s buffer, so memory does not grow with the
// file. Exactly the size that stat gave is hashed: bytes missing because the
// file shrank count as zeros, bytes added since are not hashed. On failure
// |digest| is left as it was and errno tells why. When |stop| becomes true
// the file is abandoned part way as an open failure (ECANCELED), so that a
// run that has already failed does not wait for it.
FileDigestResult HashOpenFile(FileHasher& hasher, FileToHash& file,
                              std::span<std::uint8_t, kFileDigestSize> digest,
                              const std::atomic<bool>* stop);

// CloseFileToHash closes a file that was opened but is not to be hashed; an
// already closed one is left alone.
void CloseFileToHash(FileToHash& file);

// ComputeFileDigest opens and hashes the file at |path| with a hasher of its
// own: the digest of a single file.
FileDigestResult ComputeFileDigest(const char* path,
                                   std::span<std::uint8_t, kFileDigestSize> digest);

}  // namespace keymgr
