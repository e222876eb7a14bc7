#include "bootlog/boot_status.h"

#include <fcntl.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <iterator>

#include "eeprom/eeprom.h"
#include "eeprom/eeprom_map.h"
#include "util/debug_print.h"
#include "util/io.h"
#include "util/owned.h"
#include "util/paths.h"
#include "util/status.h"

namespace {

namespace eeprom = keymgr::eeprom;

struct StatusLine {
  const char* text;
  std::size_t length;
};

// One line per status code, written without a terminator.
constexpr StatusLine kStatusLines[] = {
    {"BN=OK\n", 6},   {"BN=FAIL\n", 8}, {"DT=OK\n", 6},
    {"DT=FAIL\n", 8}, {"ST=OK\n", 6},   {"ST=FAIL\n", 8},
};
constexpr unsigned int kLastStatusCode = 5;
static_assert(std::size(kStatusLines) == kLastStatusCode + 1);

static_assert(sizeof(keymgr::kBootLogPath) <= keymgr::kPathBufferSize);

}  // namespace

unsigned int CheckSecurityFeature() {
  std::uint8_t bytes[eeprom::kSfeConfLength] = {};
  int result = ReadEEPROM_msok(eeprom::kDevice, eeprom::kSfeConfOffset, sizeof(bytes), bytes);
  if (result < 0) {
    DebugPrint("Read Error [%d] - SFE CONF from EEPROM !!!\n", result);
    return 0;
  }
  // Assembled byte by byte so the word reads the same on any host.
  std::uint32_t word = 0;
  for (std::uint32_t i = 0; i < sizeof(bytes); ++i) {
    word |= static_cast<std::uint32_t>(bytes[i]) << (8 * i);
  }
  DebugPrint("SFE_003 - [%x]\n", word & eeprom::kSfe003Mask);
  return (word & eeprom::kSfe003Mask) != 0 ? 1 : 0;
}

void WriteBootStatus(unsigned int code) {
  // Only the manifest verification issues the BN codes, and it already runs
  // behind the EEPROM gate; every later line needs SFE_003 on.
  const bool startsLog = code == kBootStatusBnOk || code == kBootStatusBnFail;
  if (!startsLog && CheckSecurityFeature() != 1) {
    return;
  }
  char path[keymgr::kPathBufferSize] = {};
  std::memcpy(path, keymgr::kBootLogPath, sizeof(keymgr::kBootLogPath));

  // The log's folder may be writable by other accounts, so the log must be
  // a file of its own: a symbolic link or hard link planted there would
  // have a root boot write into another file, and a device or FIFO is never
  // opened at all.
  keymgr::Descriptor log = keymgr::OpenRegular(
      path, startsLog ? O_WRONLY | O_CREAT | O_TRUNC : O_RDWR | O_CREAT | O_APPEND, nullptr,
      keymgr::Look::kOwnName);
  if (!log) {
    keymgr::LogErrno("open");
    DebugPrint("file[%s] open error!!\n", path);
    return;
  }
  if (code <= kLastStatusCode) {
    const StatusLine& line = kStatusLines[code];
    DebugPrint("%s", line.text);
    // The boot script reads the outcome from here only: a line that did not
    // reach the file is named on request, though its result stays as it was.
    if (!keymgr::WriteAll(log.get(), line.text, line.length)) {
      keymgr::LogErrno("write");
    }
  } else {
    DebugPrint("Unknown flag!!\n");
  }
  if (::close(log.release()) != 0) {
    keymgr::LogErrno("close");
  }
}
