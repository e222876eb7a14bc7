#include "eeprom/eeprom.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <sys/file.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "eeprom/eeprom_map.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"
#include "util/secure.h"
#include "util/status.h"

namespace {

using keymgr::ErrnoFailure;
using keymgr::Status;

// Image is an open EEPROM image.
struct Image {
  keymgr::Descriptor fd;
  std::uint64_t size = 0;
};

// OpenImage opens the image without blocking on a special file and accepts
// only a regular file.
Status OpenImage(int flags, Image& image) {
  image.fd = keymgr::OpenRegular(keymgr::kEepromPath, flags, &image.size);
  return image.fd ? Status() : ErrnoFailure("open");
}

void FreeBytes(std::uint8_t* bytes) {
  std::free(bytes);
}
using Scratch = keymgr::Owned<std::uint8_t*, FreeBytes>;

// CheckRequest rejects another device, a missing buffer and a length that
// does not fit the int result.
Status CheckRequest(int device, std::uint32_t length, const void* buffer) {
  if (device != keymgr::eeprom::kDevice) {
    return ErrnoFailure("device", ENODEV);
  }
  if ((buffer == nullptr && length != 0) || length > static_cast<std::uint32_t>(INT_MAX)) {
    return ErrnoFailure("length", EINVAL);
  }
  return Status();
}

// InRange tells whether [offset, offset+length) lies inside [start,
// start+size). The sums are 64-bit so they cannot wrap.
bool InRange(std::uint64_t offset, std::uint64_t length, std::uint64_t start, std::uint64_t size) {
  return offset >= start && offset + length <= start + size;
}

// MoveAt repeats |io| (pread or pwrite) until |length| bytes have moved at
// |offset|; fails on an error or an image that ends early.
template <class Io, class Byte>
Status MoveAt(Io io, const char* call, int fd, Byte* bytes, std::uint32_t length,
              std::uint32_t offset) {
  errno = EIO;  // what an image that ends early reports
  const auto step = [&](std::size_t done, std::size_t left) {
    return io(fd, bytes + done, left, static_cast<off_t>(offset + done));
  };
  return keymgr::MoveAll(step, length) ? Status() : ErrnoFailure(call);
}

// Whoever can read the image can hold a shared lock on it for as long as it
// likes: the exclusive lock is waited for this long at most, and then the
// write fails like any other.
constexpr long kLockWaitMs = 3000;

long MillisecondsNow() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  return now.tv_sec * 1000 + now.tv_nsec / 1'000'000;
}

Status LockImage(int fd) {
  const long deadline = MillisecondsNow() + kLockWaitMs;
  while (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK && errno != EINTR) {
      return ErrnoFailure("flock");
    }
    if (MillisecondsNow() >= deadline) {
      return ErrnoFailure("flock", ETIMEDOUT);
    }
    const timespec pause{0, 10'000'000};
    ::nanosleep(&pause, nullptr);
  }
  return Status();
}

Status ReadImage(int device, std::uint32_t offset, std::uint32_t length, void* dst) {
  if (Status status = CheckRequest(device, length, dst); !status.ok()) {
    return status;
  }
  Image image;
  if (Status status = OpenImage(O_RDONLY, image); !status.ok()) {
    return status;
  }
  if (!InRange(offset, length, 0, image.size)) {
    return ErrnoFailure("range", ERANGE);
  }
  if (length == 0) {
    return Status();
  }
  // Read into a scratch buffer so a failed read leaves |dst| untouched; the
  // bytes may be key material, so the scratch copy is wiped. It comes from
  // malloc, not new, so that keymgr does not load the C++ runtime library
  // at start.
  const Scratch scratch(static_cast<std::uint8_t*>(std::malloc(length)));
  if (!scratch) {
    return ErrnoFailure("malloc", ENOMEM);
  }
  keymgr::ScopeExit wipe([&] { OPENSSL_cleanse(scratch.get(), length); });
  if (Status status = MoveAt(::pread, "pread", image.fd.get(), scratch.get(), length, offset);
      !status.ok()) {
    return status;
  }
  std::memcpy(dst, scratch.get(), length);
  return Status();
}

Status WriteImage(int device, std::uint32_t offset, std::uint32_t length, const void* src,
                  bool lock) {
  if (Status status = CheckRequest(device, length, src); !status.ok()) {
    return status;
  }
  Image image;
  if (Status status = OpenImage(O_WRONLY, image); !status.ok()) {
    return status;
  }
  // The lock is released when the descriptor closes.
  if (lock) {
    if (Status status = LockImage(image.fd.get()); !status.ok()) {
      return status;
    }
  }
  if (!InRange(offset, length, 0, image.size)) {
    return ErrnoFailure("range", ERANGE);
  }
  const auto* bytes = static_cast<const std::uint8_t*>(src);
  if (Status status = MoveAt(::pwrite, "pwrite", image.fd.get(), bytes, length, offset);
      !status.ok()) {
    return status;
  }
  if (::fdatasync(image.fd.get()) != 0) {
    return ErrnoFailure("fdatasync");
  }
  return Status();
}

// Result reduces a status to the library's result: the number of bytes
// moved, or the negative errno of the failure.
int Result(const Status& status, std::uint32_t length) {
  if (status.ok()) {
    return static_cast<int>(length);
  }
  const int error = status.origin() == keymgr::Origin::kErrno ? static_cast<int>(status.code()) : 0;
  return error > 0 ? -error : -EIO;
}

}  // namespace

int ReadEEPROM(int device, uint32_t offset, uint32_t length, void* dst) {
  return Result(ReadImage(device, offset, length, dst), length);
}

int ReadEEPROM_msok(int device, uint32_t offset, uint32_t length, void* dst) {
  return Result(ReadImage(device, offset, length, dst), length);
}

int WriteSectionEEPROM(int device, uint32_t offset, uint32_t length, const void* src,
                       uint32_t sectionStart, uint32_t sectionLength) {
  if (!InRange(offset, length, sectionStart, sectionLength)) {
    return device != keymgr::eeprom::kDevice ? -ENODEV : -ERANGE;
  }
  return Result(WriteImage(device, offset, length, src, false), length);
}

int WriteEEPROM_Bytes_Sema(int device, uint32_t offset, uint32_t length, const void* src) {
  return Result(WriteImage(device, offset, length, src, true), length);
}
