// The platform key manager against the suite's swtpm.
#include <gtest/gtest.h>

#include <array>
#include <cstring>
#include <set>
#include <sstream>
#include <string>

#include "keymgr_build_config.h"
#include "platform/pcp.h"
#include "support/sandbox.h"
#include "util/bytes.h"
#include "util/secure.h"

namespace {

using keymgr::ScopeExit;
using Fragment = std::array<uint8_t, 284>;

// An identity the way the module makes one: 20 random bytes as 40 hex
// digits, and the MD5 of that text.
struct Identity {
  char hex[41] = {};
  uint8_t digest[16] = {};
};

Identity NewIdentity() {
  uint8_t raw[20];
  EXPECT_EQ(pcp_getRandomBytes(sizeof(raw), raw), 0);
  Identity id;
  BytesToHex(raw, sizeof(raw), id.hex, sizeof(id.hex));
  Md5OfString(id.hex, id.digest);
  return id;
}

// The persistent handles as an independent client lists them.
std::set<std::string> PersistentHandles() {
  auto listed = keymgr::test::Run({TPM2_GETCAP_BIN, "handles-persistent", "-T", KEYMGR_TCTI});
  EXPECT_EQ(listed.status, 0) << listed.err;
  std::set<std::string> handles;
  std::istringstream lines(listed.out);
  std::string dash, handle;
  while (lines >> dash >> handle) {
    handles.insert(handle);
  }
  return handles;
}

std::string HexOf(const uint8_t* bytes, size_t n) {
  std::string text;
  char digits[3];
  for (size_t i = 0; i < n; ++i) {
    std::snprintf(digits, sizeof(digits), "%02X", bytes[i]);
    text += digits;
  }
  return text;
}

TEST(PcpTpm, RandomBytesFillTheBufferAndDiffer) {
  std::array<uint8_t, 33> first{}, second{};
  first[32] = second[20] = 0xA5;
  ASSERT_EQ(pcp_getRandomBytes(32, first.data()), 0);
  ASSERT_EQ(pcp_getRandomBytes(20, second.data()), 0);
  EXPECT_EQ(first[32], 0xA5);
  EXPECT_EQ(second[20], 0xA5);
  EXPECT_NE(std::memcmp(first.data(), second.data(), 20), 0);
  EXPECT_NE(HexOf(first.data(), 32), std::string(64, '0'));
  EXPECT_NE(pcp_getRandomBytes(4, nullptr), 0);
}

TEST(PcpTpm, SealsAndOpensInAnotherProcess) {
  Identity name = NewIdentity(), pass = NewIdentity();
  auto before = PersistentHandles();
  ASSERT_EQ(pcp_create_key(name.digest, pass.digest, 2048, 0), 0);
  ScopeExit cleanup([&] { pcp_delete_key(name.digest, 0); });
  auto created = PersistentHandles();
  EXPECT_EQ(created.size(), before.size() + 1);
  EXPECT_NE(pcp_create_key(name.digest, pass.digest, 2048, 0), 0) << "handle already taken";

  uint8_t ook[32];
  ASSERT_EQ(pcp_getRandomBytes(sizeof(ook), ook), 0);
  Fragment sealed{};
  uint32_t size = sealed.size();
  ASSERT_EQ(pcp_encryptDataFragment(name.hex, pass.hex, ook, 32, sealed.data(), &size), 0);
  EXPECT_EQ(size, PCP_FRAGMENT_SIZE);
  auto opened = keymgr::test::Run(
      {PCP_DECRYPT_HELPER_BIN, name.hex, pass.hex, HexOf(sealed.data(), PCP_FRAGMENT_SIZE)});
  EXPECT_EQ(opened.status, 0) << opened.err;
  EXPECT_EQ(opened.out, HexOf(ook, sizeof(ook)));

  EXPECT_EQ(pcp_delete_key(name.digest, 0), 0);
  EXPECT_EQ(PersistentHandles(), before);
  EXPECT_NE(pcp_delete_key(name.digest, 0), 0) << "no key left to delete";
}

TEST(PcpTpm, RefusesBadRequestsQuietly) {
  Identity name = NewIdentity(), pass = NewIdentity(), other = NewIdentity();
  ASSERT_EQ(pcp_create_key(name.digest, pass.digest, 2048, 0), 0);
  ScopeExit cleanup([&] { pcp_delete_key(name.digest, 0); });
  uint8_t data[191] = {1, 2, 3};
  Fragment sealed{};
  uint32_t size = sealed.size();
  ASSERT_EQ(pcp_encryptDataFragment(name.hex, pass.hex, data, 32, sealed.data(), &size), 0);
  uint8_t plain[32];
  auto open = [&](const char* passHex, const Fragment& fragment, uint32_t length,
                  uint32_t capacity) {
    uint32_t plainSize = capacity;
    return pcp_decryptDataFragment(name.hex, passHex, fragment.data(), length, plain, &plainSize);
  };

  testing::internal::CaptureStderr();
  Fragment spare{};
  size = PCP_FRAGMENT_SIZE - 1;
  EXPECT_NE(pcp_encryptDataFragment(name.hex, pass.hex, data, 32, spare.data(), &size), 0);
  size = spare.size();
  EXPECT_NE(pcp_encryptDataFragment(name.hex, pass.hex, data, 191, spare.data(), &size), 0);
  EXPECT_NE(pcp_encryptDataFragment(other.hex, pass.hex, data, 32, spare.data(), &size), 0);
  EXPECT_NE(pcp_encryptDataFragment(nullptr, pass.hex, data, 32, spare.data(), &size), 0);

  EXPECT_NE(open(other.hex, sealed, PCP_FRAGMENT_SIZE, 32), 0) << "wrong password";
  uint32_t plainSize = 32;
  EXPECT_NE(pcp_decryptDataFragment(other.hex, pass.hex, sealed.data(), PCP_FRAGMENT_SIZE, plain,
                                    &plainSize),
            0)
      << "unknown identity";
  EXPECT_NE(open(pass.hex, sealed, PCP_FRAGMENT_SIZE - 1, 32), 0) << "truncated";
  EXPECT_NE(open(pass.hex, sealed, 11, 32), 0) << "shorter than the header";
  EXPECT_NE(open(pass.hex, sealed, PCP_FRAGMENT_SIZE, 31), 0) << "small output";
  for (size_t at : {0u, 7u, 10u, 100u}) {
    Fragment corrupt = sealed;
    corrupt[at] ^= 0x01;
    EXPECT_NE(open(pass.hex, corrupt, PCP_FRAGMENT_SIZE, 32), 0) << "byte " << at;
  }
  EXPECT_NE(pcp_create_key(name.digest, pass.digest, 2048, 0), 0);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");

  // None of the failures left a transient object behind or locked the key.
  EXPECT_EQ(open(pass.hex, sealed, PCP_FRAGMENT_SIZE, 32), 0);
  EXPECT_EQ(std::memcmp(plain, data, 32), 0);
}

}  // namespace
