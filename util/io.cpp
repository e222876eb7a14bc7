#include "util/io.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>

namespace keymgr {

bool ReadWhole(std::FILE* stream, std::size_t limit, HeapBytes& bytes, std::size_t* size) {
  *size = 0;
  for (std::size_t capacity = 0;;) {
    if (*size == capacity) {
      if (capacity > limit) {
        errno = EFBIG;
        return false;
      }
      // Doubled, and at most one byte past |limit|: enough to see a longer
      // stream.
      capacity = std::min(capacity == 0 ? std::size_t{4096} : 2 * capacity, limit) + 1;
      auto* grown = static_cast<std::uint8_t*>(std::realloc(bytes.get(), capacity));
      if (grown == nullptr) {
        return false;
      }
      (void)bytes.release();
      bytes.reset(grown);
    }
    const std::size_t got = std::fread(bytes.get() + *size, 1, capacity - *size, stream);
    *size += got;
    if (got == 0) {
      return std::ferror(stream) == 0;
    }
  }
}

}  // namespace keymgr
