// Whole-file replacement that survives a crash or a power cut at any point:
// readers see the old file or the new one, never a torn or empty mix.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstddef>
#include <cstdint>

#include "util/owned.h"
#include "util/status.h"

namespace keymgr {

// AtomicFile builds the new contents of |path| in an unnamed file of the same
// folder and puts it in place only at Commit():
//   Open(path, mode)   creates the file; no bytes reach |path| yet
//   Write(bytes, n)    appends (buffered); a failure sticks until Commit
//   Commit()           flushes, fsyncs, renames over |path|, fsyncs the folder
// Whatever sits at |path| (a file, a symbolic link, a FIFO) is replaced, never
// followed or written through. The file gets exactly |mode|, whatever the
// umask. An AtomicFile dropped without a successful Commit leaves |path| as
// it was and no file behind; its buffer is wiped, so it may carry secrets.
class AtomicFile {
 public:
  AtomicFile() = default;
  ~AtomicFile();
  AtomicFile(const AtomicFile&) = delete;
  AtomicFile& operator=(const AtomicFile&) = delete;

  // Open fails when the new file cannot be created (for example the folder
  // is missing).
  Status Open(const char* path, mode_t mode);
  void Write(const void* bytes, std::size_t size);
  // Commit succeeds once the new contents are durably at |path|.
  Status Commit();

 private:
  Status Flush();
  Status Link();
  void Discard();

  // Room for a fixed path of the system and the temporary name beside it.
  static constexpr std::size_t kNameSize = 160;
  Descriptor fd_;
  Descriptor dirFd_;
  bool anonymous_ = false;  // O_TMPFILE: no name until Link()
  Status failed_;           // the first failed write, kept until Commit
  std::array<char, kNameSize> path_{};
  std::array<char, kNameSize> tempPath_{};
  const char* base_ = nullptr;  // the last component of path_
  std::size_t used_ = 0;
  std::array<std::uint8_t, 4096> buffer_{};
};

// ReplaceFile puts |size| bytes at |path| as one AtomicFile. On failure
// |path| is left as it was.
Status ReplaceFile(const char* path, const void* bytes, std::size_t size, mode_t mode);

}  // namespace keymgr
