#include "util/file_digest.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>

#include "util/io.h"
#include "util/secure.h"

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

FileDigestResult OpenFailure(int error) {
  errno = error;
  return FileDigestResult::kOpenFailure;
}

// Ready takes the hasher's buffer and context at their first use.
bool Ready(FileHasher& hasher) {
  if (hasher.buffer == nullptr) {
    hasher.buffer =
        static_cast<std::uint8_t*>(std::aligned_alloc(kBufferAlignment, kFileReadChunk));
  }
  if (hasher.context == nullptr) {
    hasher.context = EVP_MD_CTX_new();
  }
  return hasher.buffer != nullptr && hasher.context != nullptr;
}

}  // namespace

FileHasher::~FileHasher() {
  std::free(buffer);
  EVP_MD_CTX_free(context);
}

FileDigestResult OpenFileToHash(const char* path, FileToHash& file, bool soon) {
  // Opened without blocking: a FIFO with no writer would otherwise hold the
  // boot run for ever. Opening first and asking the descriptor for the size
  // walks the path once; only a path that cannot be opened is stat'ed, since
  // a failed stat, not the open, is what makes a status failure.
  const int fd = ::open(path, O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) {
    const int error = errno;
    struct stat st;
    if (::stat(path, &st) < 0) {
      return FileDigestResult::kStatusFailure;
    }
    return OpenFailure(error);
  }
  // The size is a signed 32-bit count: a file of 2 GiB or more fails like an
  // unopenable one rather than wrapping. Devices and directories have no
  // meaningful contents to hash.
  struct stat st {};
  int error = 0;
  if (::fstat(fd, &st) != 0) {
    error = EINVAL;
  } else if (st.st_size < 0 || st.st_size > std::numeric_limits<std::int32_t>::max()) {
    error = EFBIG;
  } else if (!S_ISREG(st.st_mode)) {
    error = S_ISDIR(st.st_mode) ? EISDIR : EINVAL;
  }
  if (error != 0) {
    (void)::close(fd);
    return OpenFailure(error);
  }
  file.fd = fd;
  file.size = static_cast<std::size_t>(st.st_size);
  if (soon && file.size > 0) {
    // Advice only: its result changes nothing.
    (void)::posix_fadvise(fd, 0, static_cast<off_t>(std::min(file.size, kSoonBytes)),
                          POSIX_FADV_WILLNEED);
  }
  return FileDigestResult::kOk;
}

FileDigestResult HashOpenFile(FileHasher& hasher, FileToHash& file,
                              std::span<std::uint8_t, kFileDigestSize> digest,
                              const std::atomic<bool>* stop) {
  ScopeExit closeFile([&] { CloseFileToHash(file); });
  // A hash that cannot run fails like a buffer that cannot be had.
  if (!Ready(hasher) || EVP_DigestInit_ex(hasher.context, EVP_sha256(), nullptr) != 1) {
    return OpenFailure(ENOMEM);
  }
  std::size_t left = file.size;
  if (left > kFileReadChunk) {
    // Doubles the kernel's read-ahead for the rest of the file.
    (void)::posix_fadvise(file.fd, 0, 0, POSIX_FADV_SEQUENTIAL);
  }
  bool ended = false;
  while (left > 0) {
    if (stop != nullptr && stop->load(std::memory_order_relaxed)) {
      return OpenFailure(ECANCELED);
    }
    const std::size_t want = std::min(left, kFileReadChunk);
    const std::size_t got = ended ? 0 : ReadUpTo(file.fd, hasher.buffer, want);
    // Bytes missing at the end, or that could not be read, count as zeros.
    if (got < want) {
      std::memset(hasher.buffer + got, 0, want - got);
      ended = true;
    }
    if (EVP_DigestUpdate(hasher.context, hasher.buffer, want) != 1) {
      return OpenFailure(ENOMEM);
    }
    left -= want;
  }
  std::uint8_t out[EVP_MAX_MD_SIZE] = {};
  if (EVP_DigestFinal_ex(hasher.context, out, nullptr) != 1) {
    return OpenFailure(ENOMEM);
  }
  std::memcpy(digest.data(), out, kFileDigestSize);
  return FileDigestResult::kOk;
}

void CloseFileToHash(FileToHash& file) {
  if (file.fd >= 0) {
    // Read-only: a failed close loses nothing.
    (void)::close(file.fd);
    file.fd = -1;
  }
}

FileDigestResult ComputeFileDigest(const char* path,
                                   std::span<std::uint8_t, kFileDigestSize> digest) {
  FileToHash file;
  const FileDigestResult opened = OpenFileToHash(path, file, false);
  if (opened != FileDigestResult::kOk) {
    return opened;
  }
  FileHasher hasher;
  return HashOpenFile(hasher, file, digest, nullptr);
}

}  // namespace keymgr
