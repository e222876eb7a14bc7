#include "tools/eeprom_args.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "util/hex.h"

namespace keymgr::tools {

namespace {

// ParseNumber accepts a whole unsigned 32-bit number, decimal or with a 0x
// prefix, and nothing else (no sign, no blanks, no trailing text).
bool ParseNumber(const char* text, std::uint32_t* value) {
  int base = 10;
  if (text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text += 2;
  }
  const char* digits = base == 16 ? "0123456789abcdefABCDEF" : "0123456789";
  if (*text == '\0' || std::strspn(text, digits) != std::strlen(text)) {
    return false;
  }
  errno = 0;
  char* end = nullptr;
  const unsigned long long parsed = std::strtoull(text, &end, base);
  if (errno != 0 || *end != '\0' || parsed > UINT32_MAX) {
    return false;
  }
  *value = static_cast<std::uint32_t>(parsed);
  return true;
}

// FindRegion gives the region of the EEPROM map named |name|, or null.
const eeprom::Region* FindRegion(const char* name) {
  for (const eeprom::Region& region : eeprom::kRegions) {
    if (std::strcmp(region.name, name) == 0) {
      return &region;
    }
  }
  return nullptr;
}

}  // namespace

EepromArgs ParseEepromArgs(int argc, const char* const* argv,
                           std::span<std::uint8_t, eeprom::kSize> bytes) {
  using Action = EepromArgs::Action;
  EepromArgs args;
  if (argc == 2 && std::strcmp(argv[1], "init") == 0) {
    args.action = Action::kInit;
    return args;
  }
  // A region by name stands for its offset, and for a read its length too.
  const eeprom::Region* region = argc >= 3 ? FindRegion(argv[2]) : nullptr;
  if (region != nullptr && argc == 3 && std::strcmp(argv[1], "read") == 0) {
    args.action = Action::kRead;
    args.offset = region->offset;
    args.length = region->length;
    return args;
  }
  if (argc != 4) {
    return args;
  }
  if (std::strcmp(argv[1], "read") == 0) {
    std::uint32_t length = 0;
    if (!ParseNumber(argv[2], &args.offset) || !ParseNumber(argv[3], &length)) {
      return EepromArgs();
    }
    args.action = Action::kRead;
    args.length = length;
    return args;
  }
  if (std::strcmp(argv[1], "write") == 0) {
    const std::size_t digits = std::strlen(argv[3]);
    if (region != nullptr) {
      args.offset = region->offset;
    } else if (!ParseNumber(argv[2], &args.offset)) {
      return EepromArgs();
    }
    // A region takes exactly its own length.
    if (digits == 0 || digits % 2 != 0 || (region != nullptr && digits / 2 != region->length)) {
      return EepromArgs();
    }
    args.action = Action::kWrite;
    args.length = digits / 2;
    if (args.length <= bytes.size() && !HexDecode({argv[3], digits}, bytes.first(args.length))) {
      return EepromArgs();
    }
  }
  return args;
}

}  // namespace keymgr::tools
