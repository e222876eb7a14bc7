// Fake platform layers for unit tests: an in-memory EEPROM and an in-memory
// TPM key manager, linked in place of keymgr_platform. Both can be told to
// fail, and both record what they were asked to do.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace keymgr::fake {

// --- EEPROM: a 32 KiB image, blank (0xFF) after ResetEeprom. ---------------
inline constexpr std::size_t kEepromSize = 32768;
enum class EepromOp { kRead, kWrite };
struct EepromCall {
  EepromOp op;
  std::uint32_t offset;
  std::uint32_t length;
  std::uint32_t sectionStart;  // WriteSectionEEPROM only
  std::uint32_t sectionLength;
  int result;
};

void ResetEeprom();
std::array<std::uint8_t, kEepromSize>& EepromImage();
std::vector<std::uint8_t> EepromBytes(std::uint32_t offset, std::uint32_t length);
// InjectEepromError makes the next |count| calls of |op| whose range touches
// [begin, end) return |result| without moving a byte.
void InjectEepromError(EepromOp op, std::uint32_t begin, std::uint32_t end, int count,
                       int result = -5);
const std::vector<EepromCall>& EepromCalls();

// --- Key manager: persistent keys by name digest, each with the digest of
// its password. A sealed fragment opens only with that key's password. -----
enum class PcpOp { kGetRandom, kCreateKey, kDeleteKey, kEncrypt, kDecrypt, kCount };
struct PcpCall {
  PcpOp op;
  int result;
  std::vector<std::uint8_t> data;  // random bytes drawn, key digest, or data sealed/unsealed
  std::string nameHex;             // fragment calls
  std::string passHex;
  std::uint32_t length;  // count, bits or fragment length
};

void ResetPcp();
// FailPcp lets the next |skip| calls of |op| pass and fails the |count|
// calls after them.
void FailPcp(PcpOp op, int count = 1, int skip = 0);
const std::vector<PcpCall>& PcpCalls();
std::size_t PcpKeyCount();

}  // namespace keymgr::fake
