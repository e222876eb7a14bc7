#include "util/atomic_file.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "util/io.h"

namespace keymgr {

namespace {

// Filesystems without O_TMPFILE answer with one of these.
bool NoAnonymousFiles(int error) {
  return error == EOPNOTSUPP || error == EISDIR || error == EINVAL;
}

}  // namespace

AtomicFile::~AtomicFile() {
  Discard();
}

bool AtomicFile::Open(const char* path, mode_t mode) {
  Discard();
  failed_ = false;
  used_ = 0;
  const std::size_t length = std::strlen(path);
  // The temporary name adds a dot and a seven-character suffix to the base.
  if (length == 0 || length + 9 > path_.size()) {
    errno = ENAMETOOLONG;
    return false;
  }
  std::memcpy(path_.data(), path, length + 1);
  char* slash = std::strrchr(path_.data(), '/');
  base_ = slash != nullptr ? slash + 1 : path_.data();
  if (*base_ == '\0') {
    errno = EISDIR;
    return false;
  }
  {
    // The folder, as a path of its own for open(2) and mkostemp(3).
    std::array<char, kNameSize> dir{};
    if (slash == nullptr) {
      dir[0] = '.';
    } else {
      std::memcpy(dir.data(), path_.data(), slash == path_.data() ? 1 : slash - path_.data());
    }
    dirFd_ = ::open(dir.data(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirFd_ < 0) {
      return false;
    }
    // An unnamed file disappears by itself if the process dies before
    // Commit, so a crash never leaves a partial file in the folder.
    fd_ = ::openat(dirFd_, ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, mode);
    anonymous_ = fd_ >= 0;
    if (fd_ < 0 && NoAnonymousFiles(errno)) {
      std::array<char, kNameSize> templ{};
      std::snprintf(templ.data(), templ.size(), "%s/.%s.XXXXXX", dir.data(), base_);
      fd_ = ::mkostemp(templ.data(), O_CLOEXEC);
      if (fd_ >= 0) {
        std::snprintf(tempPath_.data(), tempPath_.size(), "%s",
                      std::strrchr(templ.data(), '/') + 1);
      }
    }
  }
  // The umask must not widen or narrow the mode of a key file.
  if (fd_ < 0 || ::fchmod(fd_, mode) != 0) {
    const int saved = errno;
    Discard();
    errno = saved;
    return false;
  }
  return true;
}

void AtomicFile::Write(const void* bytes, std::size_t size) {
  const auto* in = static_cast<const std::uint8_t*>(bytes);
  while (!failed_ && size > 0) {
    if (used_ == buffer_.size() && !Flush()) {
      return;
    }
    const std::size_t take = std::min(size, buffer_.size() - used_);
    std::memcpy(buffer_.data() + used_, in, take);
    used_ += take;
    in += take;
    size -= take;
  }
}

bool AtomicFile::Flush() {
  const auto write = [&](std::size_t done, std::size_t left) {
    return ::write(fd_, buffer_.data() + done, left);
  };
  if (!failed_ && !MoveAll(write, used_)) {
    failed_ = true;
  }
  OPENSSL_cleanse(buffer_.data(), used_);
  used_ = 0;
  return !failed_;
}

// Link gives the unnamed file a temporary name beside |path|. A stale name
// from an earlier crash between link and rename is replaced.
bool AtomicFile::Link() {
  std::snprintf(tempPath_.data(), tempPath_.size(), ".%s.new", base_);
  if (::unlinkat(dirFd_, tempPath_.data(), 0) != 0 && errno != ENOENT) {
    tempPath_[0] = '\0';
    return false;
  }
  if (::linkat(fd_, "", dirFd_, tempPath_.data(), AT_EMPTY_PATH) == 0) {
    return true;
  }
  // Without CAP_DAC_READ_SEARCH the descriptor is linked through /proc.
  char self[32];
  std::snprintf(self, sizeof(self), "/proc/self/fd/%d", fd_);
  if (::linkat(AT_FDCWD, self, dirFd_, tempPath_.data(), AT_SYMLINK_FOLLOW) == 0) {
    return true;
  }
  tempPath_[0] = '\0';
  return false;
}

bool AtomicFile::Commit() {
  if (fd_ < 0) {
    return false;
  }
  const bool done = Flush() && ::fsync(fd_) == 0 && (!anonymous_ || Link()) &&
                    ::renameat(dirFd_, tempPath_.data(), dirFd_, base_) == 0;
  if (done) {
    tempPath_[0] = '\0';  // it is |path| now
  }
  // The rename is durable only once the folder is.
  const bool durable = done && ::fsync(dirFd_) == 0;
  Discard();
  return durable;
}

void AtomicFile::Discard() {
  if (tempPath_[0] != '\0' && dirFd_ >= 0) {
    ::unlinkat(dirFd_, tempPath_.data(), 0);
  }
  tempPath_[0] = '\0';
  if (fd_ >= 0) {
    ::close(fd_);
    fd_ = -1;
  }
  if (dirFd_ >= 0) {
    ::close(dirFd_);
    dirFd_ = -1;
  }
  OPENSSL_cleanse(buffer_.data(), buffer_.size());
  used_ = 0;
}

bool ReplaceFile(const char* path, const void* bytes, std::size_t size, mode_t mode) {
  AtomicFile file;
  if (!file.Open(path, mode)) {
    return false;
  }
  file.Write(bytes, size);
  return file.Commit();
}

}  // namespace keymgr
