#include "support/tpm_capture.h"

#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>

namespace keymgr::test {

namespace {

constexpr std::uint32_t kEnhancedPacket = 6;
constexpr std::uint16_t kTpmPort = 2321;
constexpr std::uint32_t kRhNull = 0x40000007;

std::uint32_t Little(const unsigned char* p) {
  return p[0] | p[1] << 8 | p[2] << 16 | static_cast<std::uint32_t>(p[3]) << 24;
}
std::uint32_t Big(const unsigned char* p) {
  return static_cast<std::uint32_t>(p[0]) << 24 | p[1] << 16 | p[2] << 8 | p[3];
}

}  // namespace

TpmCost CaptureCost(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  const std::string file((std::istreambuf_iterator<char>(in)), {});
  const auto* bytes = reinterpret_cast<const unsigned char*>(file.data());
  TpmCost cost;
  // Blocks: type, length, body. An enhanced packet holds the IPv4 and TCP
  // headers the transport makes up, then the TPM command or response.
  for (std::size_t at = 0; at + 12 <= file.size();) {
    const std::uint32_t type = Little(bytes + at), length = Little(bytes + at + 4);
    if (length < 12 || at + length > file.size()) {
      break;
    }
    const unsigned char* ip = bytes + at + 28;
    if (type == kEnhancedPacket && length > 28 + 40) {
      const unsigned char* tcp = ip + (ip[0] & 0x0F) * 4;
      const unsigned char* tpm = tcp + (tcp[12] >> 4) * 4;
      const bool toTpm = (tcp[2] << 8 | tcp[3]) == kTpmPort;
      if (toTpm && tpm + 14 <= bytes + at + length) {
        const std::uint32_t code = Big(tpm + 6);
        ++cost.commands;
        char hex[12];
        std::snprintf(hex, sizeof(hex), "%03X ", code);
        cost.codes += hex;
        const bool salted = code == 0x176 && Big(tpm + 10) != kRhNull;
        const bool keyGeneration = code == 0x131 || code == 0x153 || code == 0x191;
        cost.asymmetric += salted || keyGeneration || code == 0x159 || code == 0x174;
        cost.primaries += code == 0x131;
        cost.rsaKeys += code == 0x153 || code == 0x191;
        cost.rsaEncrypts += code == 0x174;
      }
    }
    at += length;
  }
  return cost;
}

}  // namespace keymgr::test
