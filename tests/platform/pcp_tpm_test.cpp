// The platform key manager against the suite's swtpm. The calls in this
// program go through tpm2-tss's packet-capture transport, so that the test
// can search what crossed the bus for the secrets.
#include <gtest/gtest.h>

#include <cstdlib>

#include "crypto/hash.h"
#include "keymgr_build_config.h"
#include "platform/pcp.h"
#include "platform/pcp_tcti.h"
#include "support/sandbox.h"
#include "util/bytes.h"

const char keymgr::kPcpTcti[] = "pcap:" KEYMGR_TCTI;

static std::string_view View(const uint8_t* bytes, size_t n) {
  return {reinterpret_cast<const char*>(bytes), n};
}

// An identity the way the module makes one: 20 random bytes as 40 hex
// digits, and the MD5 of that text.
struct Identity {
  uint8_t raw[20] = {}, digest[16] = {};
  char hex[41] = {};
  Identity() {
    EXPECT_EQ(pcp_getRandomBytes(sizeof(raw), raw), 0);
    EXPECT_EQ(BytesToHex(raw, sizeof(raw), hex, sizeof(hex)), 0);
    Md5OfString(hex, digest);
  }
};

TEST(PcpTpm, RoundTripRefusalsAndNoSecretOnTheBus) {
  // The capture transport writes where TCTI_PCAP_FILE says when it starts.
  const char* bus = KEYMGR_ROOT "/run/pcp-tpm.pcap";
  std::remove(bus);
  setenv("TCTI_PCAP_FILE", bus, 1);
  // Three draws of 20 bytes: equal draws would let the refusals below succeed.
  Identity name, pass, other;
  uint8_t ook[32] = {}, plain[32];
  ASSERT_EQ(pcp_getRandomBytes(sizeof(ook), ook), 0);
  EXPECT_NE(View(ook + 24, 8), std::string(8, '\0')) << "tail not drawn";
  // The persistent handles as an independent client lists them.
  const std::vector<std::string> getcap{TPM2_GETCAP_BIN, "handles-persistent", "-T", KEYMGR_TCTI};
  const std::string before = keymgr::test::Run(getcap).out;
  ASSERT_EQ(pcp_create_key(name.digest, pass.digest, 2048, 0), 0);
  std::vector<uint8_t> sealed(PCP_FRAGMENT_SIZE);
  uint32_t size = PCP_FRAGMENT_SIZE;
  EXPECT_EQ(pcp_encryptDataFragment(name.hex, pass.hex, ook, 32, sealed.data(), &size), 0);

  testing::internal::CaptureStderr();
  EXPECT_NE(pcp_create_key(name.digest, pass.digest, 2048, 0), 0) << "handle taken";
  auto open = [&](const char* n, const char* p, uint32_t length = PCP_FRAGMENT_SIZE,
                  uint32_t capacity = 32, size_t at = 0, uint8_t flip = 0) {
    auto fragment = sealed;
    fragment[at] ^= flip;
    uint32_t got = capacity;
    int rc = pcp_decryptDataFragment(n, p, fragment.data(), length, plain, &got);
    return rc == 0 ? std::string(View(plain, got)) : "refused";
  };
  EXPECT_EQ(open(name.hex, other.hex), "refused") << "wrong password";
  EXPECT_EQ(open(other.hex, pass.hex), "refused") << "unknown identity";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE - 1), "refused") << "truncated";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE, 31), "refused") << "small output";
  for (size_t at : {0u, 7u, 10u, 100u}) {
    EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE, 32, at, 1), "refused") << at;
  }
  // None of the failures left an object behind or locked the key.
  EXPECT_EQ(open(name.hex, pass.hex), View(ook, 32));
  auto fresh = keymgr::test::Run({PCP_DECRYPT_HELPER_BIN, name.hex, pass.hex,
                                  keymgr::test::Hex(View(sealed.data(), PCP_FRAGMENT_SIZE))});
  EXPECT_EQ(fresh.out, View(ook, 32)) << "opened in a process of its own";

  const std::string sniffed = keymgr::test::ReadFile(bus).value_or("");
  // The ciphertext is public and crosses as it is: the search works.
  EXPECT_NE(sniffed.find(View(sealed.data() + 12, 256)), std::string::npos);
  for (auto secret : {View(ook, 32), View(pass.raw, 20), View(pass.digest, 16)}) {
    EXPECT_EQ(sniffed.find(secret), std::string::npos);
  }
  EXPECT_EQ(pcp_delete_key(name.digest, 0), 0);
  EXPECT_EQ(keymgr::test::Run(getcap).out, before);
  EXPECT_NE(pcp_delete_key(name.digest, 0), 0) << "no key left to delete";
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

// Only keys this key manager made are ever evicted: an object of other
// software at the handle of a name is left alone, whether asked for by name
// or swept with the stale keys.
TEST(PcpTpm, OnlyOwnKeysAreEvicted) {
  const std::string tcti = KEYMGR_TCTI, context = KEYMGR_ROOT "/run/foreign.ctx";
  const uint8_t foreign[16] = {0x00, 0x12, 0x34};  // its handle is 0x81021234
  ASSERT_EQ(keymgr::test::Run(
                {"tpm2_createprimary", "-C", "o", "-G", "rsa2048", "-c", context, "-T", tcti})
                .status,
            0);
  ASSERT_EQ(
      keymgr::test::Run({"tpm2_evictcontrol", "-C", "o", "-c", context, "0x81021234", "-T", tcti})
          .status,
      0);
  const std::vector<std::string> getcap{TPM2_GETCAP_BIN, "handles-persistent", "-T", tcti};
  const std::string withForeign = keymgr::test::Run(getcap).out;
  Identity kept, stale;
  ASSERT_EQ(pcp_create_key(kept.digest, kept.digest, 2048, 0), 0);
  ASSERT_EQ(pcp_create_key(stale.digest, stale.digest, 2048, 0), 0);
  EXPECT_NE(pcp_delete_key(foreign, 0), 0);
  EXPECT_EQ(pcp_evict_stale_keys(kept.digest), 0);
  EXPECT_EQ(pcp_delete_key(kept.digest, 0), 0);
  EXPECT_NE(pcp_delete_key(stale.digest, 0), 0) << "swept already";
  EXPECT_EQ(keymgr::test::Run(getcap).out, withForeign);
  keymgr::test::Run({"tpm2_evictcontrol", "-C", "o", "-c", "0x81021234", "-T", tcti});
}
