// The platform key manager on the suite's swtpm: what it refuses, and whose
// keys it evicts.
#include "tpm/pcp.h"

#include <gtest/gtest.h>

#include "crypto/hash.h"
#include "support/sandbox.h"
#include "util/bytes.h"

namespace keymgr::test {
namespace {

// The key manager's refusals, each quiet on standard error and leaving the
// key usable; and only keys it made are ever evicted: an object of other
// software at the handle of a name stays, asked for by name or swept.
TEST(Pcp, RefusesQuietlyAndEvictsOnlyItsOwn) {
  const TpmClean clean;
  struct Identity {
    std::uint8_t raw[20] = {}, digest[16] = {};
    char hex[41] = {};
    Identity() {
      EXPECT_EQ(pcp_getRandomBytes(sizeof(raw), raw), 0);
      EXPECT_EQ(BytesToHex(raw, sizeof(raw), hex, sizeof(hex)), 0);
      (void)Md5OfString(hex, digest);
    }
  } name, pass, other, stale;
  std::uint8_t ook[32] = {}, plain[32];
  ASSERT_EQ(pcp_getRandomBytes(sizeof(ook), ook), 0);
  ASSERT_EQ(pcp_create_key(name.digest, pass.digest, 2048, 0), 0);
  std::vector<std::uint8_t> sealed(PCP_FRAGMENT_SIZE);
  std::uint32_t size = PCP_FRAGMENT_SIZE;
  ASSERT_EQ(pcp_encryptDataFragment(name.hex, pass.hex, ook, 32, sealed.data(), &size), 0);

  testing::internal::CaptureStderr();
  EXPECT_NE(pcp_create_key(name.digest, pass.digest, 2048, 0), 0) << "handle taken";
  const auto open = [&](const char* n, const char* p, std::uint32_t length = PCP_FRAGMENT_SIZE,
                        std::uint32_t capacity = 32, std::uint8_t flip = 0) {
    auto fragment = sealed;
    fragment[100] ^= flip;  // inside the ciphertext
    std::uint32_t got = capacity;
    const int rc = pcp_decryptDataFragment(n, p, fragment.data(), length, plain, &got);
    return rc == 0 ? std::string(reinterpret_cast<char*>(plain), got) : "refused";
  };
  EXPECT_EQ(open(name.hex, other.hex), "refused") << "wrong password";
  EXPECT_EQ(open(other.hex, pass.hex), "refused") << "unknown identity";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE - 1), "refused") << "truncated";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE, 31), "refused") << "small output";
  EXPECT_EQ(open(name.hex, pass.hex, PCP_FRAGMENT_SIZE, 32, 1), "refused") << "damaged";
  EXPECT_EQ(open(name.hex, pass.hex), std::string(reinterpret_cast<char*>(ook), 32));

  // Another's object at the handle of |other| (its first three digest bytes).
  const std::string context = InRoot("/run/foreign.ctx"), handle = "0x81021234";
  ASSERT_EQ(Tpm2({"tpm2_createprimary", "-C", "o", "-G", "rsa2048", "-c", context}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_evictcontrol", "-C", "o", "-c", context, handle}).status, 0);
  ASSERT_EQ(Tpm2({"tpm2_flushcontext", "-t"}).status, 0);
  const std::uint8_t foreign[16] = {0x00, 0x12, 0x34};
  ASSERT_EQ(pcp_create_key(stale.digest, stale.digest, 2048, 0), 0);
  EXPECT_NE(pcp_delete_key(foreign, 0), 0);
  EXPECT_EQ(pcp_evict_stale_keys(name.digest), 0);
  EXPECT_NE(pcp_delete_key(stale.digest, 0), 0) << "swept already";
  EXPECT_EQ(pcp_delete_key(name.digest, 0), 0);
  EXPECT_NE(pcp_delete_key(name.digest, 0), 0) << "no key left to delete";
  auto left = clean.keep;
  left.insert(handle);
  EXPECT_EQ(PersistentHandles(), left);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

}  // namespace
}  // namespace keymgr::test
