// The secrets of a key manager call never cross the TPM bus in clear: this
// program puts tpm2-tss's packet-capture transport in front of the suite's
// swtpm and searches the capture for them.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
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

bool Contains(std::string_view capture, const uint8_t* bytes, size_t n) {
  return capture.find(std::string_view(reinterpret_cast<const char*>(bytes), n)) !=
         std::string_view::npos;
}

TEST(PcpBus, SecretsNeverCrossInClear) {
  std::string capture = keymgr::test::InRoot("/run/pcp-bus.pcap");
  std::remove(capture.c_str());
  setenv("TCTI_PCAP_FILE", capture.c_str(), 1);

  uint8_t nameRaw[20], passRaw[20], ook[32];
  ASSERT_EQ(pcp_getRandomBytes(sizeof(nameRaw), nameRaw), 0);
  ASSERT_EQ(pcp_getRandomBytes(sizeof(passRaw), passRaw), 0);
  ASSERT_EQ(pcp_getRandomBytes(sizeof(ook), ook), 0);
  char nameHex[41], passHex[41];
  uint8_t nameDigest[16], passDigest[16];
  BytesToHex(nameRaw, 20, nameHex, sizeof(nameHex));
  BytesToHex(passRaw, 20, passHex, sizeof(passHex));
  Md5OfString(nameHex, nameDigest);
  Md5OfString(passHex, passDigest);
  ASSERT_EQ(pcp_create_key(nameDigest, passDigest, 2048, 0), 0);
  keymgr::ScopeExit cleanup([&] { pcp_delete_key(nameDigest, 0); });
  uint8_t sealed[284];
  uint32_t size = sizeof(sealed);
  ASSERT_EQ(pcp_encryptDataFragment(nameHex, passHex, ook, 32, sealed, &size), 0);
  uint8_t plain[32];
  size = sizeof(plain);
  ASSERT_EQ(pcp_decryptDataFragment(nameHex, passHex, sealed, 268, plain, &size), 0);
  ASSERT_EQ(std::memcmp(plain, ook, 32), 0);

  auto bytes = keymgr::test::ReadFile(capture);
  ASSERT_TRUE(bytes.has_value());
  // The ciphertext is public and goes to the TPM as it is: the search works.
  EXPECT_TRUE(Contains(*bytes, sealed + 12, 256));
  EXPECT_FALSE(Contains(*bytes, ook, sizeof(ook)));
  EXPECT_FALSE(Contains(*bytes, passRaw, sizeof(passRaw)));
  EXPECT_FALSE(Contains(*bytes, passDigest, sizeof(passDigest)));
}

}  // namespace
