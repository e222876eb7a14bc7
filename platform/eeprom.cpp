#include "platform/eeprom.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "util/io.h"
#include "util/paths.h"
#include "util/secure.h"

namespace {

// Failure codes, all negative so callers test only the sign.
constexpr int kBadArgument = -EINVAL;
constexpr int kNoDevice = -ENODEV;
constexpr int kOutOfRange = -ERANGE;
constexpr int kIoError = -EIO;

// Image is an open EEPROM image; the descriptor is closed on every path.
struct Image {
  int fd = -1;
  std::uint64_t size = 0;
  ~Image() {
    if (fd >= 0) {
      ::close(fd);
    }
  }
};

// OpenImage opens the image without blocking on a special file and accepts
// only a regular file. Returns 0 or a negative failure code.
int OpenImage(int flags, Image& image) {
  image.fd = ::open(keymgr::kEepromPath, flags | O_NONBLOCK | O_CLOEXEC);
  if (image.fd < 0) {
    return errno != 0 ? -errno : kIoError;
  }
  struct stat st {};
  if (::fstat(image.fd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_size < 0) {
    return kNoDevice;
  }
  image.size = static_cast<std::uint64_t>(st.st_size);
  return 0;
}

// CheckRequest rejects another device, a missing buffer and a length that
// does not fit the int result.
int CheckRequest(int device, std::uint32_t length, const void* buffer) {
  if (device != 0) {
    return kNoDevice;
  }
  if ((buffer == nullptr && length != 0) || length > static_cast<std::uint32_t>(INT_MAX)) {
    return kBadArgument;
  }
  return 0;
}

// InRange tells whether [offset, offset+length) lies inside [start,
// start+size). The sums are 64-bit so they cannot wrap.
bool InRange(std::uint64_t offset, std::uint64_t length, std::uint64_t start, std::uint64_t size) {
  return offset >= start && offset + length <= start + size;
}

// MoveAt repeats |io| (pread or pwrite) until |length| bytes have moved at
// |offset|; false on an error or an image that ends early.
template <class Io, class Byte>
bool MoveAt(Io io, int fd, Byte* bytes, std::uint32_t length, std::uint32_t offset) {
  return keymgr::MoveAll(
      [&](std::size_t done, std::size_t left) {
        return io(fd, bytes + done, left, static_cast<off_t>(offset + done));
      },
      length);
}

int ReadImage(int device, std::uint32_t offset, std::uint32_t length, void* dst) {
  int check = CheckRequest(device, length, dst);
  if (check < 0) {
    return check;
  }
  Image image;
  int opened = OpenImage(O_RDONLY, image);
  if (opened < 0) {
    return opened;
  }
  if (!InRange(offset, length, 0, image.size)) {
    return kOutOfRange;
  }
  if (length == 0) {
    return 0;
  }
  // Read into a scratch buffer so a failed read leaves |dst| untouched; the
  // bytes may be key material, so the scratch copy is wiped.
  auto* scratch = static_cast<std::uint8_t*>(std::malloc(length));
  if (scratch == nullptr) {
    return -ENOMEM;
  }
  keymgr::ScopeExit release([&] {
    OPENSSL_cleanse(scratch, length);
    std::free(scratch);
  });
  if (!MoveAt(::pread, image.fd, scratch, length, offset)) {
    return kIoError;
  }
  std::memcpy(dst, scratch, length);
  return static_cast<int>(length);
}

int WriteImage(int device, std::uint32_t offset, std::uint32_t length, const void* src, bool lock) {
  int check = CheckRequest(device, length, src);
  if (check < 0) {
    return check;
  }
  Image image;
  int opened = OpenImage(O_WRONLY, image);
  if (opened < 0) {
    return opened;
  }
  // The lock is released when the descriptor closes.
  if (lock) {
    while (::flock(image.fd, LOCK_EX) != 0) {
      if (errno != EINTR) {
        return kIoError;
      }
    }
  }
  if (!InRange(offset, length, 0, image.size)) {
    return kOutOfRange;
  }
  if (!MoveAt(::pwrite, image.fd, static_cast<const std::uint8_t*>(src), length, offset)) {
    return kIoError;
  }
  if (::fdatasync(image.fd) != 0) {
    return kIoError;
  }
  return static_cast<int>(length);
}

}  // namespace

int ReadEEPROM(int device, uint32_t offset, uint32_t length, void* dst) {
  return ReadImage(device, offset, length, dst);
}

int ReadEEPROM_msok(int device, uint32_t offset, uint32_t length, void* dst) {
  return ReadImage(device, offset, length, dst);
}

int WriteSectionEEPROM(int device, uint32_t offset, uint32_t length, const void* src,
                       uint32_t sectionStart, uint32_t sectionLength) {
  if (!InRange(offset, length, sectionStart, sectionLength)) {
    return device != 0 ? kNoDevice : kOutOfRange;
  }
  return WriteImage(device, offset, length, src, false);
}

int WriteEEPROM_Bytes_Sema(int device, uint32_t offset, uint32_t length, const void* src) {
  return WriteImage(device, offset, length, src, true);
}
