// keymgr-eeprom: prepares and inspects the EEPROM image for development and
// tests.
//   keymgr-eeprom init                  a blank 32 KiB image (all 0xFF)
//   keymgr-eeprom read OFFSET LENGTH    the bytes as upper-case hex
//   keymgr-eeprom read REGION           a region of the map, by name
//   keymgr-eeprom write OFFSET HEX      HEX is a string of hex digit pairs
//   keymgr-eeprom write REGION HEX      exactly the region's length
// OFFSET and LENGTH are decimal or 0x-prefixed hexadecimal; REGION is
// store-key, sfe-conf, control, sc-digest or storage-key-pin.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "eeprom/eeprom.h"
#include "eeprom/eeprom_map.h"
#include "tools/eeprom_args.h"
#include "util/owned.h"
#include "util/paths.h"

namespace {

constexpr std::size_t kImageSize = keymgr::eeprom::kSize;
constexpr int kErrorStatus = 1;

int Fail(const char* what) {
  (void)std::fprintf(stderr, "keymgr-eeprom: %s\n", what);
  return kErrorStatus;
}

int Usage() {
  (void)std::fprintf(stderr,
                     "usage: keymgr-eeprom init | read OFFSET LENGTH | read REGION |\n"
                     "       keymgr-eeprom write OFFSET HEX | write REGION HEX\n"
                     "  OFFSET and LENGTH are decimal or 0x-prefixed hexadecimal;\n"
                     "  REGION is store-key, sfe-conf, control, sc-digest or storage-key-pin\n");
  return kErrorStatus;
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
  // A FIFO or device planted at the path fails instead of blocking or
  // taking the blank bytes.
  const keymgr::Descriptor image =
      keymgr::OpenRegular(keymgr::kEepromPath, O_WRONLY | O_CREAT | O_TRUNC);
  // Only its owner may read it: a reader can hold a lock that holds up the
  // module's writes, and the image holds the sealed store key.
  if (!image || ::fchmod(image.get(), 0600) != 0) {
    return Fail("cannot create the EEPROM image");
  }
  const int fd = image.get();
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

int Read(std::uint32_t offset, std::size_t length) {
  // The image bounds any valid request, so a larger one fails without
  // allocating for it.
  if (length > kImageSize) {
    return Fail("read failed: the range lies outside the EEPROM image");
  }
  static std::uint8_t bytes[kImageSize];
  if (ReadEEPROM(0, offset, static_cast<std::uint32_t>(length), bytes) < 0) {
    return Fail("read failed: no EEPROM image, or the range lies outside it");
  }
  for (std::size_t i = 0; i < length; ++i) {
    std::printf(i == 0 ? "%02X" : " %02X", bytes[i]);
  }
  std::printf("\n");
  return std::fflush(stdout) == 0 ? 0 : kErrorStatus;
}

int Write(std::uint32_t offset, const std::uint8_t* bytes, std::size_t length) {
  if (length > kImageSize) {
    return Fail("write failed: the range lies outside the EEPROM image");
  }
  if (WriteEEPROM_Bytes_Sema(0, offset, static_cast<std::uint32_t>(length), bytes) < 0) {
    return Fail("write failed: no EEPROM image, or the range lies outside it");
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  using Action = keymgr::tools::EepromArgs::Action;
  static std::uint8_t bytes[kImageSize];
  const keymgr::tools::EepromArgs args = keymgr::tools::ParseEepromArgs(argc, argv, bytes);
  switch (args.action) {
    case Action::kInit:
      return Init();
    case Action::kRead:
      return Read(args.offset, args.length);
    case Action::kWrite:
      return Write(args.offset, bytes, args.length);
    case Action::kUsage:
      break;
  }
  return Usage();
}
