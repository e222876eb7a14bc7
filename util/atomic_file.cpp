#include "util/atomic_file.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
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

Status AtomicFile::Open(const char* path, mode_t mode) {
  Discard();
  failed_ = Status();
  const std::size_t length = std::strlen(path);
  // The temporary name adds a dot and a seven-character suffix to the base.
  if (length == 0 || length + 9 > path_.size()) {
    return ErrnoFailure("open", ENAMETOOLONG);
  }
  std::memcpy(path_.data(), path, length + 1);
  char* slash = std::strrchr(path_.data(), '/');
  base_ = slash != nullptr ? slash + 1 : path_.data();
  if (*base_ == '\0') {
    return ErrnoFailure("open", EISDIR);
  }
  // The folder, as a path of its own for open(2) and mkostemp(3).
  std::array<char, kNameSize> dir{};
  if (slash == nullptr) {
    dir[0] = '.';
  } else {
    std::memcpy(dir.data(), path_.data(), slash == path_.data() ? 1 : slash - path_.data());
  }
  dirFd_.reset(::open(dir.data(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dirFd_) {
    return ErrnoFailure("open");
  }
  // An unnamed file disappears by itself if the process dies before Commit,
  // so a crash never leaves a partial file in the folder.
  fd_.reset(::openat(dirFd_.get(), ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, mode));
  anonymous_ = static_cast<bool>(fd_);
  if (!fd_ && NoAnonymousFiles(errno)) {
    // The length check above leaves room for the dot and the suffix; the
    // spare bytes let GCC see, at -Os too, that the name is never cut short.
    std::array<char, kNameSize + 16> templ{};
    (void)std::snprintf(templ.data(), templ.size(), "%s/.%s.XXXXXX", dir.data(), base_);
    fd_.reset(::mkostemp(templ.data(), O_CLOEXEC));
    if (fd_) {
      (void)std::snprintf(tempPath_.data(), tempPath_.size(), "%s",
                          std::strrchr(templ.data(), '/') + 1);
    }
  }
  // The umask must not widen or narrow the mode of a key file.
  if (!fd_ || ::fchmod(fd_.get(), mode) != 0) {
    Status failed = ErrnoFailure(fd_ ? "fchmod" : "open");
    Discard();
    return failed;
  }
  return Status();
}

void AtomicFile::Write(const void* bytes, std::size_t size) {
  const auto* in = static_cast<const std::uint8_t*>(bytes);
  while (failed_.ok() && size > 0) {
    if (used_ == buffer_.size() && !Flush().ok()) {
      return;
    }
    const std::size_t take = std::min(size, buffer_.size() - used_);
    std::memcpy(buffer_.data() + used_, in, take);
    used_ += take;
    in += take;
    size -= take;
  }
}

Status AtomicFile::Flush() {
  if (failed_.ok() && !WriteAll(fd_.get(), buffer_.data(), used_)) {
    failed_ = ErrnoFailure("write");
  }
  OPENSSL_cleanse(buffer_.data(), used_);
  used_ = 0;
  return failed_;
}

// Link gives the unnamed file a temporary name beside |path|. A stale name
// from an earlier crash between link and rename is replaced.
Status AtomicFile::Link() {
  (void)std::snprintf(tempPath_.data(), tempPath_.size(), ".%s.new", base_);
  if (::unlinkat(dirFd_.get(), tempPath_.data(), 0) != 0 && errno != ENOENT) {
    tempPath_[0] = '\0';
    return ErrnoFailure("unlinkat");
  }
  if (::linkat(fd_.get(), "", dirFd_.get(), tempPath_.data(), AT_EMPTY_PATH) == 0) {
    return Status();
  }
  // Without CAP_DAC_READ_SEARCH the descriptor is linked through /proc.
  char self[32];
  (void)std::snprintf(self, sizeof(self), "/proc/self/fd/%d", fd_.get());
  if (::linkat(AT_FDCWD, self, dirFd_.get(), tempPath_.data(), AT_SYMLINK_FOLLOW) == 0) {
    return Status();
  }
  tempPath_[0] = '\0';
  return ErrnoFailure("linkat");
}

Status AtomicFile::Commit() {
  if (!fd_) {
    return ErrnoFailure("write", EBADF);
  }
  Status status = Flush();
  if (status.ok() && ::fsync(fd_.get()) != 0) {
    status = ErrnoFailure("fsync");
  }
  if (status.ok() && anonymous_) {
    status = Link();
  }
  if (status.ok()) {
    if (::renameat(dirFd_.get(), tempPath_.data(), dirFd_.get(), base_) != 0) {
      status = ErrnoFailure("renameat");
    } else {
      tempPath_[0] = '\0';  // it is |path| now
      // The rename is durable only once the folder is.
      if (::fsync(dirFd_.get()) != 0) {
        status = ErrnoFailure("fsync");
      }
    }
  }
  Discard();
  return status;
}

void AtomicFile::Discard() {
  if (tempPath_[0] != '\0' && dirFd_) {
    ::unlinkat(dirFd_.get(), tempPath_.data(), 0);
  }
  tempPath_[0] = '\0';
  fd_.reset();
  dirFd_.reset();
  OPENSSL_cleanse(buffer_.data(), buffer_.size());
  used_ = 0;
}

Status ReplaceFile(const char* path, const void* bytes, std::size_t size, mode_t mode) {
  AtomicFile file;
  if (Status opened = file.Open(path, mode); !opened.ok()) {
    return opened;
  }
  file.Write(bytes, size);
  return file.Commit();
}

}  // namespace keymgr
