// keymgr-eeprom: prepares and inspects the EEPROM image for development and
// tests.
//   keymgr-eeprom init                  a blank 32 KiB image (all 0xFF)
//   keymgr-eeprom read OFFSET LENGTH    the bytes as upper-case hex
//   keymgr-eeprom write OFFSET HEX      HEX is a string of hex digit pairs
// OFFSET and LENGTH are decimal or 0x-prefixed hexadecimal.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/eeprom.h"
#include "platform/eeprom_map.h"
#include "util/bytes.h"
#include "util/paths.h"
#include "util/secure.h"

namespace {

constexpr std::size_t kImageSize = keymgr::eeprom::kSize;
constexpr int kErrorStatus = 1;

int Fail(const char* what) {
  std::fprintf(stderr, "keymgr-eeprom: %s\n", what);
  return kErrorStatus;
}

int Usage() {
  std::fprintf(stderr,
               "usage: keymgr-eeprom init | read OFFSET LENGTH | write OFFSET HEX\n"
               "  OFFSET and LENGTH are decimal or 0x-prefixed hexadecimal\n");
  return kErrorStatus;
}

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
  unsigned long long parsed = std::strtoull(text, &end, base);
  if (errno != 0 || *end != '\0' || parsed > UINT32_MAX) {
    return false;
  }
  *value = static_cast<std::uint32_t>(parsed);
  return true;
}

// MakeParents creates every missing directory above |path|.
bool MakeParents(const char (&path)[sizeof(keymgr::kEepromPath)]) {
  char dir[sizeof(keymgr::kEepromPath)] = {};
  std::memcpy(dir, path, sizeof(dir) - 1);
  for (char* p = dir + 1; *p != '\0'; ++p) {
    if (*p != '/') {
      continue;
    }
    *p = '\0';
    if (::mkdir(dir, 0755) != 0 && errno != EEXIST) {
      return false;
    }
    *p = '/';
  }
  return true;
}

int Init() {
  if (!MakeParents(keymgr::kEepromPath)) {
    return Fail("cannot create the directories of the EEPROM image");
  }
  int fd = ::open(keymgr::kEepromPath, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) {
    return Fail("cannot create the EEPROM image");
  }
  keymgr::ScopeExit closeFd([&] { ::close(fd); });
  static std::uint8_t blank[kImageSize];
  std::memset(blank, 0xFF, sizeof(blank));
  std::size_t done = 0;
  while (done < sizeof(blank)) {
    ssize_t put = ::write(fd, blank + done, sizeof(blank) - done);
    if (put < 0 && errno == EINTR) {
      continue;
    }
    if (put <= 0) {
      return Fail("cannot write the EEPROM image");
    }
    done += static_cast<std::size_t>(put);
  }
  if (::fdatasync(fd) != 0) {
    return Fail("cannot write the EEPROM image");
  }
  return 0;
}

int Read(const char* offsetText, const char* lengthText) {
  std::uint32_t offset = 0;
  std::uint32_t length = 0;
  if (!ParseNumber(offsetText, &offset) || !ParseNumber(lengthText, &length)) {
    return Usage();
  }
  // The image bounds any valid request, so a larger one fails without
  // allocating for it.
  if (length > kImageSize) {
    return Fail("read failed: the range lies outside the EEPROM image");
  }
  static std::uint8_t bytes[kImageSize];
  if (ReadEEPROM(0, offset, length, bytes) < 0) {
    return Fail("read failed: no EEPROM image, or the range lies outside it");
  }
  for (std::uint32_t i = 0; i < length; ++i) {
    std::printf(i == 0 ? "%02X" : " %02X", bytes[i]);
  }
  std::printf("\n");
  return std::fflush(stdout) == 0 ? 0 : kErrorStatus;
}

int Write(const char* offsetText, const char* hex) {
  std::uint32_t offset = 0;
  const std::size_t digits = std::strlen(hex);
  if (!ParseNumber(offsetText, &offset) || digits == 0 || digits % 2 != 0) {
    return Usage();
  }
  if (digits / 2 > kImageSize) {
    return Fail("write failed: the range lies outside the EEPROM image");
  }
  static std::uint8_t bytes[kImageSize];
  const auto length = static_cast<std::uint32_t>(digits / 2);
  for (std::uint32_t i = 0; i < length; ++i) {
    int high = HexDigitValue(hex[2 * i]);
    int low = HexDigitValue(hex[2 * i + 1]);
    if (high < 0 || low < 0) {
      return Usage();
    }
    bytes[i] = static_cast<std::uint8_t>(high << 4 | low);
  }
  if (WriteEEPROM_Bytes_Sema(0, offset, length, bytes) < 0) {
    return Fail("write failed: no EEPROM image, or the range lies outside it");
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 2 && std::strcmp(argv[1], "init") == 0) {
    return Init();
  }
  if (argc == 4 && std::strcmp(argv[1], "read") == 0) {
    return Read(argv[2], argv[3]);
  }
  if (argc == 4 && std::strcmp(argv[1], "write") == 0) {
    return Write(argv[2], argv[3]);
  }
  return Usage();
}
