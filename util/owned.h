// Ownership of C handles by type: one template, one release function named
// per handle type, so that no cleanup is written by hand.
#pragma once

#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <utility>

namespace keymgr {

// Owned<Handle, Release, kNone> holds one handle (a pointer, a descriptor,
// a small record) and hands it to Release exactly once: when it goes out of
// scope, is reset, or is assigned another. kNone is the value that holds
// nothing. Moves pass the handle on; copies are not allowed.
template <class Handle, auto Release, Handle kNone = Handle{}>
class Owned {
 public:
  Owned() = default;
  explicit Owned(Handle handle) : handle_(handle) {}
  Owned(Owned&& other) noexcept : handle_(other.release()) {}
  Owned& operator=(Owned&& other) noexcept {
    reset(other.release());
    return *this;
  }
  Owned(const Owned&) = delete;
  Owned& operator=(const Owned&) = delete;
  ~Owned() { reset(); }

  Handle get() const { return handle_; }
  explicit operator bool() const { return !(handle_ == kNone); }
  // out releases what is held and lends the slot to a C call that fills it.
  Handle* out() {
    reset();
    return &handle_;
  }
  // release gives the handle up without releasing it.
  Handle release() { return std::exchange(handle_, kNone); }
  void reset(Handle handle = kNone) {
    Handle old = std::exchange(handle_, handle);
    if (!(old == kNone)) {
      Release(old);
    }
  }

 private:
  Handle handle_ = kNone;
};

inline void FreeBytes(std::uint8_t* bytes) {
  std::free(bytes);
}
inline void CloseStream(std::FILE* f) {
  (void)std::fclose(f);
}
inline void CloseDescriptor(int fd) {
  ::close(fd);
}

// HeapBytes frees bytes from malloc, File closes its stream, Descriptor its
// file descriptor.
using HeapBytes = Owned<std::uint8_t*, FreeBytes>;
using File = Owned<std::FILE*, CloseStream>;
using Descriptor = Owned<int, CloseDescriptor, -1>;

// How OpenRegular makes sure that |path| is a regular file.
enum class Look {
  // Looked at before it is opened, so that no device, FIFO or folder at a
  // fixed path is ever opened (opening a watchdog device arms it; a FIFO may
  // have a reader). Symbolic links are followed.
  kBeforeOpen,
  // As kBeforeOpen, and the path itself must be the file, with no other
  // name: no symbolic link, no hard link. For a file in a folder that other
  // accounts may write.
  kOwnName,
  // Opened without blocking and checked afterwards: two calls fewer, for
  // runs over many files.
  kAfterOpen,
};

// OpenRegular opens |path| with the open(2) |flags| and keeps it only when
// it is a regular file: anything else fails like a file that cannot be
// opened, instead of blocking the boot or feeding it endless bytes. The open
// itself never blocks and the descriptor is closed on exec. With O_CREAT a
// missing file is created (mode 0666 less the umask), never through a
// dangling symbolic link; O_TRUNC empties it only once it is known to be
// regular. On failure errno tells why: EISDIR for a folder, ELOOP for a link
// that |look| refuses, EINVAL for any other kind of file. |size|, when given,
// receives the file's size.
[[nodiscard]] Descriptor OpenRegular(const char* path, int flags, std::uint64_t* size = nullptr,
                                     Look look = Look::kBeforeOpen);

// OpenFile is OpenRegular as a stream, with an fopen(3) |mode| ("r", "w" or
// "a", with "+" and "b" as fopen takes them).
[[nodiscard]] File OpenFile(const char* path, const char* mode);

}  // namespace keymgr
