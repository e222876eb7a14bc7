// The platform key manager against the suite's swtpm. The calls in this
// program go through tpm2-tss's packet-capture transport, so that a test can
// search what crossed the bus for the secrets.
#include <gtest/gtest.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <set>
#include <sstream>
#include <string>
#include <string_view>

#include "keymgr_build_config.h"
#include "platform/pcp.h"
#include "platform/pcp_tcti.h"
#include "support/sandbox.h"
#include "util/bytes.h"
#include "util/secure.h"

namespace keymgr {
const char kPcpTcti[] = "pcap:" KEYMGR_TCTI;
}  // namespace keymgr

namespace {

using keymgr::ScopeExit;
using keymgr::test::Hex;
using Fragment = std::array<uint8_t, 284>;

const std::string kCapture = KEYMGR_ROOT "/run/pcp-tpm.pcap";
// The capture transport writes where TCTI_PCAP_FILE says, from the first call.
const int kCaptureSet = setenv("TCTI_PCAP_FILE", kCapture.c_str(), 1);

// An identity the way the module makes one: 20 random bytes as 40 hex
// digits, and the MD5 of that text.
struct Identity {
  uint8_t raw[20] = {};
  char hex[41] = {};
  uint8_t digest[16] = {};
};

Identity NewIdentity() {
  Identity id;
  EXPECT_EQ(pcp_getRandomBytes(sizeof(id.raw), id.raw), 0);
  BytesToHex(id.raw, sizeof(id.raw), id.hex, sizeof(id.hex));
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

std::string_view Bytes(const uint8_t* bytes, size_t n) {
  return {reinterpret_cast<const char*>(bytes), n};
}

TEST(PcpTpm, RandomBytesFillTheBufferAndDiffer) {
  std::array<uint8_t, 33> first{}, second{};
  first[32] = second[20] = 0xA5;
  ASSERT_EQ(pcp_getRandomBytes(32, first.data()), 0);
  ASSERT_EQ(pcp_getRandomBytes(20, second.data()), 0);
  EXPECT_EQ(first[32], 0xA5);
  EXPECT_EQ(second[20], 0xA5);
  EXPECT_NE(std::memcmp(first.data(), second.data(), 20), 0);
  EXPECT_NE(Bytes(first.data(), 32), std::string(32, '\0'));
  EXPECT_NE(pcp_getRandomBytes(4, nullptr), 0);
}

TEST(PcpTpm, SealsAndOpensWithSecretsKeptOffTheBus) {
  ASSERT_EQ(kCaptureSet, 0);
  std::remove(kCapture.c_str());
  Identity name = NewIdentity(), pass = NewIdentity();
  auto before = PersistentHandles();
  ASSERT_EQ(pcp_create_key(name.digest, pass.digest, 2048, 0), 0);
  ScopeExit cleanup([&] { pcp_delete_key(name.digest, 0); });
  EXPECT_EQ(PersistentHandles().size(), before.size() + 1);
  EXPECT_NE(pcp_create_key(name.digest, pass.digest, 2048, 0), 0) << "handle already taken";

  uint8_t ook[32], plain[32];
  ASSERT_EQ(pcp_getRandomBytes(sizeof(ook), ook), 0);
  Fragment sealed{};
  uint32_t size = sealed.size();
  ASSERT_EQ(pcp_encryptDataFragment(name.hex, pass.hex, ook, 32, sealed.data(), &size), 0);
  EXPECT_EQ(size, PCP_FRAGMENT_SIZE);
  size = sizeof(plain);
  ASSERT_EQ(pcp_decryptDataFragment(name.hex, pass.hex, sealed.data(), 268, plain, &size), 0);
  EXPECT_EQ(Bytes(plain, size), Bytes(ook, sizeof(ook)));
  std::string fragmentFile = keymgr::test::InRoot("/run/pcp-fragment");
  keymgr::test::WriteFile(fragmentFile, Bytes(sealed.data(), PCP_FRAGMENT_SIZE));
  auto opened = keymgr::test::Run({PCP_DECRYPT_HELPER_BIN, name.hex, pass.hex, fragmentFile});
  EXPECT_EQ(opened.status, 0) << opened.err;
  EXPECT_EQ(opened.out, Hex(Bytes(ook, sizeof(ook))));

  auto bus = keymgr::test::ReadFile(kCapture).value_or("");
  // The ciphertext is public and crosses as it is: the search works.
  EXPECT_NE(bus.find(Bytes(sealed.data() + 12, 256)), std::string::npos);
  EXPECT_EQ(bus.find(Bytes(ook, sizeof(ook))), std::string::npos);
  EXPECT_EQ(bus.find(Bytes(pass.raw, sizeof(pass.raw))), std::string::npos);
  EXPECT_EQ(bus.find(Bytes(pass.digest, sizeof(pass.digest))), std::string::npos);

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
  auto open = [&](const char* nameHex, const char* passHex, const Fragment& fragment,
                  uint32_t length, uint32_t capacity) {
    uint32_t plainSize = capacity;
    return pcp_decryptDataFragment(nameHex, passHex, fragment.data(), length, plain, &plainSize);
  };

  testing::internal::CaptureStderr();
  Fragment spare{};
  size = PCP_FRAGMENT_SIZE - 1;
  EXPECT_NE(pcp_encryptDataFragment(name.hex, pass.hex, data, 32, spare.data(), &size), 0);
  size = spare.size();
  EXPECT_NE(pcp_encryptDataFragment(name.hex, pass.hex, data, 191, spare.data(), &size), 0);
  EXPECT_NE(pcp_encryptDataFragment(other.hex, pass.hex, data, 32, spare.data(), &size), 0);
  EXPECT_NE(pcp_encryptDataFragment(nullptr, pass.hex, data, 32, spare.data(), &size), 0);

  EXPECT_NE(open(name.hex, other.hex, sealed, PCP_FRAGMENT_SIZE, 32), 0) << "wrong password";
  EXPECT_NE(open(other.hex, pass.hex, sealed, PCP_FRAGMENT_SIZE, 32), 0) << "unknown identity";
  EXPECT_NE(open(name.hex, pass.hex, sealed, PCP_FRAGMENT_SIZE - 1, 32), 0) << "truncated";
  EXPECT_NE(open(name.hex, pass.hex, sealed, 11, 32), 0) << "shorter than the header";
  EXPECT_NE(open(name.hex, pass.hex, sealed, PCP_FRAGMENT_SIZE, 31), 0) << "small output";
  for (size_t at : {0u, 7u, 10u, 100u}) {
    Fragment corrupt = sealed;
    corrupt[at] ^= 0x01;
    EXPECT_NE(open(name.hex, pass.hex, corrupt, PCP_FRAGMENT_SIZE, 32), 0) << "byte " << at;
  }
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");

  // None of the failures left a transient object behind or locked the key.
  EXPECT_EQ(open(name.hex, pass.hex, sealed, PCP_FRAGMENT_SIZE, 32), 0);
  EXPECT_EQ(std::memcmp(plain, data, 32), 0);
}

}  // namespace
