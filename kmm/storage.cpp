// Where the module keeps its state: the store key and the SC digest in
// EEPROM, and the disk copy of the digest in "keymgr.cs".
#include <array>
#include <cstring>

#include "eeprom/eeprom.h"
#include "kmm/internal.h"
#include "util/atomic_file.h"
#include "util/debug_print.h"
#include "util/paths.h"
#include "util/secure.h"

using namespace keymgr::kmm;

namespace eeprom = keymgr::eeprom;

int ReadStoreKey(std::uint32_t* length, std::uint8_t* dst) {
  if (dst == nullptr) {
    DebugPrint("Read Error [NULL] - Store Key from EEPROM !!!\n");
    return 1;
  }
  std::array<std::uint8_t, kSealedKeySize> buffer{};
  int result =
      ReadEEPROM_msok(eeprom::kDevice, eeprom::kStoreKeyOffset, kSealedKeySize, buffer.data());
  if (result < 0) {
    DebugPrint("Read Error [%d] - Store Key from EEPROM !!!\n", result);
    return 1;
  }
  *length = kSealedKeySize;
  std::memcpy(dst, buffer.data(), buffer.size());
  return 0;
}

int WriteStoreKey(std::uint32_t /*length*/, const std::uint8_t* src) {
  if (src == nullptr) {
    DebugPrint("Write Error [NULL] - Store Key to EEPROM !!!\n");
    return 1;
  }
  // The store key always fills its whole region, whatever length is claimed.
  std::array<std::uint8_t, kSealedKeySize> buffer{};
  std::memcpy(buffer.data(), src, buffer.size());
  int result = WriteSectionEEPROM(eeprom::kDevice, eeprom::kStoreKeyOffset, kSealedKeySize,
                                  buffer.data(), eeprom::kSectionStart, eeprom::kSectionLength);
  if (result < 0) {
    DebugPrint("Write Error [%d] - Store Key to EEPROM !!!\n", result);
    return 1;
  }
  return 0;
}

int ReadDigestEEPROM(std::uint8_t* dst) {
  if (ReadEEPROM_msok(eeprom::kDevice, eeprom::kScDigestOffset, kScDigestSize, dst) < 0) {
    DebugPrint("Read Error - Message Digest from EEPROM !!!\n");
    return 1;
  }
  return 0;
}

int WriteDigestHDD(const std::uint8_t* digest) {
  // Replaced whole, so a crash never leaves a torn copy beside the EEPROM's.
  if (!keymgr::ReplaceFile(keymgr::kScDigestPath, digest, kScDigestSize, keymgr::kSecretFileMode)
           .ok()) {
    DebugPrint("%s open error!!!\n", keymgr::kScDigestPath);
    return 1;
  }
  return 0;
}

int ReadDigestHDD(std::uint8_t* dst) {
  keymgr::File file = keymgr::OpenFile(keymgr::kScDigestPath, "r");
  if (!file) {
    DebugPrint("%s open error!!!\n", keymgr::kScDigestPath);
    return 1;
  }
  // A short file leaves the caller's zeros, which then fail the comparison.
  std::size_t got = std::fread(dst, 1, kScDigestSize, file.get());
  (void)got;
  return 0;
}
