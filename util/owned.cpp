#include "util/owned.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
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

// Create makes the file at |path| where nothing stands: O_EXCL refuses a
// dangling symbolic link rather than create the file it points to.
Descriptor Create(const char* path, int flags) {
  return Descriptor(::open(path, (flags & ~O_TRUNC) | O_EXCL | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC,
                           kNewFileMode));
}

// KindError is the errno of a file that is not regular, or not |look|'s own.
int KindError(const struct stat& st, Look look) {
  if (S_ISDIR(st.st_mode)) {
    return EISDIR;
  }
  if (S_ISLNK(st.st_mode) || (look == Look::kOwnName && st.st_nlink != 1)) {
    return ELOOP;
  }
  return S_ISREG(st.st_mode) ? 0 : EINVAL;
}

// OpenLooked opens |path| after looking at what it names, and sets |looked|
// to that (left zero when it creates the file). It opens the file that the
// look found, through /proc, whatever |path| names by now; without /proc
// (early in boot) it opens the path once more, and the caller must check
// that the file is still the one looked at.
Descriptor OpenLooked(const char* path, int flags, Look look, struct stat& looked) {
  const int noFollow = look == Look::kOwnName ? O_NOFOLLOW : 0;
  Descriptor where(::open(path, O_PATH | O_CLOEXEC | noFollow));
  if (!where) {
    return errno == ENOENT && (flags & O_CREAT) != 0 ? Create(path, flags) : Descriptor();
  }
  if (::fstat(where.get(), &looked) != 0) {
    return Failed(where, errno);
  }
  if (const int error = KindError(looked, look); error != 0) {
    return Failed(where, error);
  }
  flags = (flags & ~(O_CREAT | O_EXCL | O_TRUNC)) | O_NONBLOCK | O_CLOEXEC;
  char self[32];
  (void)std::snprintf(self, sizeof(self), "/proc/self/fd/%d", where.get());
  Descriptor fd(::open(self, flags));
  if (!fd && errno == ENOENT) {
    fd.reset(::open(path, flags | noFollow));
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

Descriptor OpenRegular(const char* path, int flags, std::uint64_t* size, Look look) {
  struct stat looked {};
  Descriptor fd = look == Look::kAfterOpen
                      ? Descriptor(::open(path, (flags & ~O_TRUNC) | O_NONBLOCK | O_CLOEXEC))
                      : OpenLooked(path, flags, look, looked);
  if (!fd) {
    return fd;
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) {
    return Failed(fd, errno);
  }
  if (looked.st_ino != 0 && (st.st_dev != looked.st_dev || st.st_ino != looked.st_ino)) {
    return Failed(fd, EINVAL);
  }
  if (const int error = KindError(st, look); error != 0) {
    return Failed(fd, error);
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
