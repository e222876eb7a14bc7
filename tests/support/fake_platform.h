// Fakes of the platform layer. A test program that links keymgr_fake_platform
// gets these in place of the EEPROM library and the platform key manager:
// they define every function of those archive members, which are then never
// pulled in.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <string>

#include "eeprom/eeprom_map.h"

namespace keymgr::test {

// FakeEeprom is the part in memory. Reads and writes that touch
// [fault.begin, fault.end) fail with -5 (EIO), fault.count times.
struct FakeEeprom {
  std::array<std::uint8_t, eeprom::kSize> image{};
  struct Fault {
    std::uint32_t begin = 0, end = 0;
    int count = 0;
  } fault;
  std::array<std::uint32_t, 2> lastSection{};  // of the last WriteSectionEEPROM

  // Reset blanks the part (all 0xFF) and clears the fault.
  void Reset();
};

// FakeKeyManager keeps the TPM's keys as the MD5 of a name mapped to the MD5
// of its password. A fragment holds its data in the clear; only the key's
// password opens it. Bit n of fail[op] fails the (n+1)th call of op.
enum PcpOp { kRandom, kCreateKey, kEncrypt, kDecrypt };
struct FakeKeyManager {
  std::map<std::string, std::string> keys;
  std::array<unsigned, 4> fail{};
  std::array<unsigned, 4> calls{};
  void Reset() { *this = {}; }
};

// The instances the fake functions use.
FakeEeprom& Eeprom();
FakeKeyManager& KeyManager();

}  // namespace keymgr::test
