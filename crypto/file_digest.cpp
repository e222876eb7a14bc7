#include "crypto/file_digest.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>

#include "crypto/internal.h"
#include "util/io.h"

namespace keymgr {

namespace {

// Page alignment lets the kernel copy whole pages into the buffer.
constexpr std::size_t kBufferAlignment = 4096;
static_assert(kFileReadChunk % kBufferAlignment == 0);
// How much of a file opened ahead of its turn the kernel is asked to read in.
constexpr std::size_t kSoonBytes = 4 * kFileReadChunk;

// ReadUpTo reads up to |size| bytes into |buffer| and returns how many came:
// fewer only at the end of the file or on a read error.
std::size_t ReadUpTo(int fd, std::uint8_t* buffer, std::size_t size) {
  std::size_t got = 0;
  (void)MoveAll(
      [&](std::size_t done, std::size_t left) {
        const ssize_t moved = ::read(fd, buffer + done, left);
        if (moved > 0) {
          got = done + static_cast<std::size_t>(moved);
        }
        return moved;
      },
      size);
  return got;
}

// Ready takes the hasher's buffer and context at their first use and starts
// a digest.
Status Ready(FileHasher& hasher) {
  if (!hasher.buffer) {
    hasher.buffer.reset(
        static_cast<std::uint8_t*>(std::aligned_alloc(kBufferAlignment, kFileReadChunk)));
  }
  if (!hasher.context) {
    hasher.context.reset(EVP_MD_CTX_new());
  }
  // A hash that cannot run fails like a buffer that cannot be had.
  if (!hasher.buffer || !hasher.context) {
    return ErrnoFailure(hasher.buffer ? "EVP_MD_CTX_new" : "aligned_alloc", ENOMEM);
  }
  return EVP_DigestInit_ex(hasher.context.get(), EVP_sha256(), nullptr) == 1
             ? Status()
             : crypto::OpensslFailure("EVP_DigestInit_ex");
}

}  // namespace

HashResult OpenFileToHash(const char* path, FileToHash& file, bool soon) {
  // Opened without blocking: a FIFO with no writer would otherwise hold the
  // boot run for ever. Opening first and asking the descriptor for the size
  // walks the path once; only a path that cannot be opened is stat'ed, since
  // a failed stat, not the open, is what makes a status failure. Devices and
  // directories have no meaningful contents to hash.
  std::uint64_t size = 0;
  file.fd = OpenRegular(path, O_RDONLY, &size, Look::kAfterOpen);
  if (!file.fd) {
    const int error = errno;
    struct stat st;
    return ::stat(path, &st) < 0 ? HashResult{HashResult::kStat, ErrnoFailure("stat")}
                                 : HashResult{HashResult::kOpen, ErrnoFailure("open", error)};
  }
  // The size is a signed 32-bit count: a file of 2 GiB or more fails like an
  // unopenable one rather than wrapping.
  if (size > static_cast<std::uint64_t>(std::numeric_limits<std::int32_t>::max())) {
    file.fd.reset();
    return {HashResult::kOpen, ErrnoFailure("fstat", EFBIG)};
  }
  file.size = static_cast<std::size_t>(size);
  if (soon && file.size > 0) {
    // Advice only: its result changes nothing.
    (void)::posix_fadvise(file.fd.get(), 0, static_cast<off_t>(std::min(file.size, kSoonBytes)),
                          POSIX_FADV_WILLNEED);
  }
  return {};
}

Status HashOpenFile(FileHasher& hasher, FileToHash& file,
                    std::span<std::uint8_t, crypto::kSha256Size> digest,
                    const std::atomic<bool>* stop) {
  const Descriptor fd = std::move(file.fd);
  if (Status status = Ready(hasher); !status.ok()) {
    return status;
  }
  std::size_t left = file.size;
  if (left > kFileReadChunk) {
    // Doubles the kernel's read-ahead for the rest of the file.
    (void)::posix_fadvise(fd.get(), 0, 0, POSIX_FADV_SEQUENTIAL);
  }
  std::uint8_t* buffer = hasher.buffer.get();
  bool ended = false;
  while (left > 0) {
    if (stop != nullptr && stop->load(std::memory_order_relaxed)) {
      return ErrnoFailure("read", ECANCELED);
    }
    const std::size_t want = std::min(left, kFileReadChunk);
    const std::size_t got = ended ? 0 : ReadUpTo(fd.get(), buffer, want);
    // Bytes missing at the end, or that could not be read, count as zeros.
    if (got < want) {
      std::memset(buffer + got, 0, want - got);
      ended = true;
    }
    if (EVP_DigestUpdate(hasher.context.get(), buffer, want) != 1) {
      return crypto::OpensslFailure("EVP_DigestUpdate");
    }
    left -= want;
  }
  std::uint8_t out[EVP_MAX_MD_SIZE] = {};
  if (EVP_DigestFinal_ex(hasher.context.get(), out, nullptr) != 1) {
    return crypto::OpensslFailure("EVP_DigestFinal_ex");
  }
  std::memcpy(digest.data(), out, crypto::kSha256Size);
  return Status();
}

HashResult ComputeFileDigest(const char* path,
                             std::span<std::uint8_t, crypto::kSha256Size> digest) {
  FileToHash file;
  if (HashResult opened = OpenFileToHash(path, file, false); !opened.ok()) {
    return opened;
  }
  FileHasher hasher;
  Status status = HashOpenFile(hasher, file, digest, nullptr);
  return {status.ok() ? HashResult::kNone : HashResult::kOpen, status};
}

}  // namespace keymgr
