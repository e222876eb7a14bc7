// Loops for system calls that may move fewer bytes than asked, and the one
// reader of a whole file.
#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstdio>

#include "util/owned.h"

namespace keymgr {

// MoveAll calls |io(done, left)| until |size| bytes have moved, where |io|
// moves up to |left| bytes after the first |done| and returns the count or
// -1 with errno, like read(2). An interrupted call is repeated. Returns false
// on an error, or when a call moves nothing (end of file).
template <class Io>
bool MoveAll(Io io, std::size_t size) {
  std::size_t done = 0;
  while (done < size) {
    const ssize_t moved = io(done, size - done);
    if (moved < 0 && errno == EINTR) {
      continue;
    }
    if (moved <= 0) {
      return false;
    }
    done += static_cast<std::size_t>(moved);
  }
  return true;
}

// WriteAll writes the |size| bytes at |bytes| to |fd|; false with errno
// when they could not all be written.
inline bool WriteAll(int fd, const void* bytes, std::size_t size) {
  const auto* at = static_cast<const char*>(bytes);
  return MoveAll([&](std::size_t done, std::size_t left) { return ::write(fd, at + done, left); },
                 size);
}

// ReadWhole reads |stream| to its end into |bytes|, grown from malloc as it
// fills, and sets |*size|. False with errno on a read error, when memory runs
// out, or with EFBIG when the stream holds more than |limit| bytes.
bool ReadWhole(std::FILE* stream, std::size_t limit, HeapBytes& bytes, std::size_t* size);

}  // namespace keymgr
