#include "util/owned.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace keymgr {

namespace {

// The mode fopen(3) creates files with; the umask narrows it.
constexpr mode_t kNewFileMode = 0666;

// Failed closes |fd| and leaves |error| in errno, which the close must not
// overwrite.
Descriptor Failed(Descriptor& fd, int error) {
  fd.reset();
  errno = error;
  return Descriptor();
}

// OpenWithoutBlocking opens |path| with O_NONBLOCK, so that a FIFO with no
// peer fails or opens at once instead of waiting for one. A file that O_CREAT
// would create is created only where nothing stands: O_EXCL refuses a
// dangling symbolic link rather than create the file it points to.
int OpenWithoutBlocking(const char* path, int flags) {
  flags |= O_NONBLOCK | O_CLOEXEC;
  if ((flags & O_CREAT) == 0) {
    return ::open(path, flags);
  }
  int fd = ::open(path, flags & ~O_CREAT);
  if (fd < 0 && errno == ENOENT) {
    fd = ::open(path, flags | O_EXCL, kNewFileMode);
  }
  return fd;
}

// FlagsOf gives the open(2) flags of an fopen(3) mode.
int FlagsOf(const char* mode) {
  const bool update = std::strchr(mode, '+') != nullptr;
  const int access = update ? O_RDWR : O_WRONLY;
  switch (mode[0]) {
    case 'w':
      return access | O_CREAT | O_TRUNC;
    case 'a':
      return access | O_CREAT | O_APPEND;
    default:
      return update ? O_RDWR : O_RDONLY;
  }
}

}  // namespace

Descriptor OpenRegular(const char* path, int flags, std::uint64_t* size) {
  Descriptor fd(OpenWithoutBlocking(path, flags & ~O_TRUNC));
  if (!fd) {
    return fd;
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) {
    return Failed(fd, errno);
  }
  if (!S_ISREG(st.st_mode)) {
    return Failed(fd, S_ISDIR(st.st_mode) ? EISDIR : EINVAL);
  }
  if ((flags & O_TRUNC) != 0) {
    if (::ftruncate(fd.get(), 0) != 0) {
      return Failed(fd, errno);
    }
    st.st_size = 0;
  }
  if (size != nullptr) {
    *size = static_cast<std::uint64_t>(st.st_size);
  }
  return fd;
}

File OpenFile(const char* path, const char* mode) {
  Descriptor fd = OpenRegular(path, FlagsOf(mode));
  if (!fd) {
    return File();
  }
  std::FILE* stream = ::fdopen(fd.get(), mode);
  if (stream == nullptr) {
    (void)Failed(fd, errno);
    return File();
  }
  (void)fd.release();  // the stream owns it now
  return File(stream);
}

}  // namespace keymgr
