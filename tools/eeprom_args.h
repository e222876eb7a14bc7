// The keymgr-eeprom command line, read without side effects.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "eeprom/eeprom_map.h"

namespace keymgr::tools {

struct EepromArgs {
  enum class Action { kUsage, kInit, kRead, kWrite };
  Action action = Action::kUsage;
  std::uint32_t offset = 0;
  // The bytes to read or to write. A count larger than the image is given
  // as it is (and for a write nothing is decoded), for the caller to refuse.
  std::size_t length = 0;
};

// ParseEepromArgs reads "init", "read OFFSET LENGTH", "read REGION",
// "write OFFSET HEX" or "write REGION HEX", OFFSET and LENGTH decimal or
// 0x-prefixed hexadecimal, REGION a name of eeprom::kRegions, HEX pairs of
// hex digits of either case (for a region, exactly its length), which are
// decoded into |bytes|. Anything else is a usage error.
EepromArgs ParseEepromArgs(int argc, const char* const* argv,
                           std::span<std::uint8_t, eeprom::kSize> bytes);

}  // namespace keymgr::tools
