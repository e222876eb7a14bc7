#include <cstring>
#include <map>

#include "fake_platform.h"
#include "platform/pcp.h"
#include "util/bytes.h"

namespace keymgr::fake {
namespace {

using Digest = std::array<std::uint8_t, 16>;
constexpr std::uint8_t kTag[4] = {'F', 'K', 'S', 'L'};
constexpr std::size_t kHeader = 12;

struct Switch {
  int skip = 0;
  int count = 0;
};

std::map<Digest, Digest> g_keys;  // name digest -> password digest
std::array<Switch, static_cast<std::size_t>(PcpOp::kCount)> g_switches;
std::vector<PcpCall> g_calls;
std::uint32_t g_random = 1;

Digest DigestOf(const std::uint8_t* bytes) {
  Digest d;
  std::memcpy(d.data(), bytes, d.size());
  return d;
}

Digest Md5(const char* text) {
  Digest d;
  Md5OfString(text, d.data());
  return d;
}

// Failing consumes one armed failure of |op|, after its skips.
bool Failing(PcpOp op) {
  Switch& s = g_switches[static_cast<std::size_t>(op)];
  if (s.skip > 0) {
    --s.skip;
    return false;
  }
  if (s.count > 0) {
    --s.count;
    return true;
  }
  return false;
}

int Record(PcpCall call) {
  g_calls.push_back(std::move(call));
  return g_calls.back().result;
}

// The keystream of a sealed fragment depends on the key's name and password,
// so only the right key opens it.
std::uint8_t Stream(const Digest& name, const Digest& pass, std::size_t i) {
  return static_cast<std::uint8_t>(name[i % 16] ^ pass[(i + 7) % 16] ^ (i * 151));
}

}  // namespace

void ResetPcp() {
  g_keys.clear();
  g_switches = {};
  g_calls.clear();
  g_random = 1;
}
void FailPcp(PcpOp op, int count, int skip) {
  g_switches[static_cast<std::size_t>(op)] = {skip, count};
}
const std::vector<PcpCall>& PcpCalls() {
  return g_calls;
}
std::size_t PcpKeyCount() {
  return g_keys.size();
}

}  // namespace keymgr::fake

using namespace keymgr::fake;

extern "C" {

int pcp_getRandomBytes(uint32_t count, uint8_t* dst) {
  if (Failing(PcpOp::kGetRandom)) {
    return Record({PcpOp::kGetRandom, 1, {}, {}, {}, count});
  }
  for (uint32_t i = 0; i < count; ++i) {
    g_random = g_random * 1103515245u + 12345u;
    dst[i] = static_cast<uint8_t>(g_random >> 16);
  }
  return Record({PcpOp::kGetRandom, 0, {dst, dst + count}, {}, {}, count});
}

int pcp_create_key(const uint8_t* nameDigest, const uint8_t* passwordDigest, uint32_t bits,
                   uint32_t) {
  Digest name = DigestOf(nameDigest);
  bool ok = !Failing(PcpOp::kCreateKey) && g_keys.emplace(name, DigestOf(passwordDigest)).second;
  return Record({PcpOp::kCreateKey, ok ? 0 : 1, {name.begin(), name.end()}, {}, {}, bits});
}

int pcp_delete_key(const uint8_t* nameDigest, uint32_t) {
  Digest name = DigestOf(nameDigest);
  bool ok = !Failing(PcpOp::kDeleteKey) && g_keys.erase(name) == 1;
  return Record({PcpOp::kDeleteKey, ok ? 0 : 1, {name.begin(), name.end()}, {}, {}, 0});
}

int pcp_encryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* data,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  PcpCall call{PcpOp::kEncrypt, 1, {data, data + length}, nameHex, passHex, length};
  auto key = g_keys.find(Md5(nameHex));
  if (Failing(PcpOp::kEncrypt) || key == g_keys.end() || *outSize < PCP_FRAGMENT_SIZE ||
      length > PCP_FRAGMENT_SIZE - kHeader) {
    return Record(std::move(call));
  }
  std::memset(out, 0, PCP_FRAGMENT_SIZE);
  std::memcpy(out, kTag, sizeof(kTag));
  std::memcpy(out + 4, &length, sizeof(length));
  for (uint32_t i = 0; i < length; ++i) {
    out[kHeader + i] = data[i] ^ Stream(key->first, key->second, i);
  }
  *outSize = PCP_FRAGMENT_SIZE;
  call.result = 0;
  return Record(std::move(call));
}

int pcp_decryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* fragment,
                            uint32_t length, uint8_t* out, uint32_t* outSize) {
  PcpCall call{PcpOp::kDecrypt, 1, {}, nameHex, passHex, length};
  auto key = g_keys.find(Md5(nameHex));
  uint32_t plain = 0;
  std::memcpy(&plain, fragment + 4, sizeof(plain));
  if (Failing(PcpOp::kDecrypt) || key == g_keys.end() || key->second != Md5(passHex) ||
      length != PCP_FRAGMENT_SIZE || std::memcmp(fragment, kTag, sizeof(kTag)) != 0 ||
      plain > *outSize || plain > PCP_FRAGMENT_SIZE - kHeader) {
    return Record(std::move(call));
  }
  for (uint32_t i = 0; i < plain; ++i) {
    out[i] = fragment[kHeader + i] ^ Stream(key->first, key->second, i);
  }
  *outSize = plain;
  call.result = 0;
  call.data.assign(out, out + plain);
  return Record(std::move(call));
}

}  // extern "C"
