#include "util/bytes.h"

#include <cstddef>

#include "util/debug_print.h"
#include "util/hex.h"

void PrintHexDump(const std::uint8_t* bytes, std::uint32_t length, int grouped) {
  for (std::uint32_t i = 0; i < length; ++i) {
    DebugPrint("%02X ", bytes[i]);
    if (grouped != 0 && i % 16 == 7) {
      DebugPrint("  ");
    }
    if (grouped != 0 && i % 16 == 15) {
      DebugPrint("\n");
    }
  }
  DebugPrint("\n");
}

namespace {

// PrintArrayLine prints the bytes, or "**" for each when |bytes| is null.
void PrintArrayLine(const std::uint8_t* bytes, std::int32_t size) {
  DebugPrint("print_array: size[%d] ", size);
  for (std::int32_t i = 0; i < size; ++i) {
    if (bytes != nullptr) {
      DebugPrint("%02X ", bytes[i]);
    } else {
      DebugPrint("** ");
    }
  }
  DebugPrint(" \n");
}

}  // namespace

void PrintArray(const std::uint8_t* bytes, std::int32_t size) {
  PrintArrayLine(bytes, size);
}

void PrintRedactedArray(std::int32_t size) {
  PrintArrayLine(nullptr, size);
}

int BytesToHex(const std::uint8_t* src, std::uint8_t length, char* dst, std::uint8_t dstSize) {
  if (src == nullptr || length == 0 || dst == nullptr || dstSize == 0) {
    DebugPrint("ERR: Null pointer detecter or zero length\n");
    return -1;
  }
  // In int arithmetic: 2 * 255 + 1 does not fit the 8-bit capacity, so a
  // length of 128 or more can never pass.
  if (static_cast<int>(dstSize) < 2 * static_cast<int>(length) + 1) {
    DebugPrint("ERR: to short destination buffer");
    return -1;
  }
  keymgr::HexEncode({src, length}, dst, keymgr::HexCase::kUpper);
  dst[std::size_t{2} * length] = '\0';
  return 0;
}
