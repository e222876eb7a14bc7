// Every key manager call fails cleanly, and quietly, when no TPM answers.
#include <gtest/gtest.h>

#include <algorithm>
#include <array>

#include "keymgr_build_config.h"
#include "platform/pcp.h"
#include "platform/pcp_tcti.h"

namespace keymgr {
// Takes the place of the build's transport: nothing listens here.
const char kPcpTcti[] = "swtpm:path=" KEYMGR_ROOT "/run/nobody.sock";
}  // namespace keymgr

namespace {

TEST(PcpUnreachable, EveryCallFailsQuietly) {
  std::array<uint8_t, PCP_FRAGMENT_SIZE> buf{};
  std::array<uint8_t, 16> digest{};
  const char* hex = "00112233445566778899AABBCCDDEEFF00112233";
  uint32_t size = PCP_FRAGMENT_SIZE;
  testing::internal::CaptureStderr();
  buf.fill(0xA5);
  EXPECT_NE(pcp_getRandomBytes(32, buf.data()), 0);
  EXPECT_EQ(buf[0], 0xA5) << "a failed draw leaves the buffer as it was";
  EXPECT_NE(pcp_create_key(digest.data(), digest.data(), 2048, 0), 0);
  EXPECT_NE(pcp_delete_key(digest.data(), 0), 0);
  EXPECT_NE(pcp_encryptDataFragment(hex, hex, buf.data(), 32, buf.data(), &size), 0);
  std::copy_n("PCPF\0\0\0\1\0\0\1\0", 12, buf.begin());
  std::array<uint8_t, 32> plain{};
  size = 32;
  EXPECT_NE(pcp_decryptDataFragment(hex, hex, buf.data(), PCP_FRAGMENT_SIZE, plain.data(), &size),
            0);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

}  // namespace
