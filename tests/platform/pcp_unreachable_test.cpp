// Every key manager call fails, and quietly, when no TPM answers; random
// bytes still come, from the kernel alone.
#include <gtest/gtest.h>

#include "keymgr_build_config.h"
#include "platform/pcp.h"
#include "platform/pcp_tcti.h"

// Takes the place of the build's transport: nothing listens here.
const char keymgr::kPcpTcti[] = "swtpm:path=" KEYMGR_ROOT "/run/nobody.sock";

TEST(PcpUnreachable, EveryCallFailsQuietly) {
  // A well-formed fragment header, so that opening it needs the TPM.
  uint8_t buf[PCP_FRAGMENT_SIZE] = {'P', 'C', 'P', 'F', 0, 0, 0, 1, 0, 0, 1};
  uint32_t size = PCP_FRAGMENT_SIZE;
  testing::internal::CaptureStderr();
  EXPECT_EQ(pcp_getRandomBytes(32, buf + 12), 0);
  EXPECT_NE(pcp_create_key(buf, buf, 2048, 0), 0);
  EXPECT_NE(pcp_delete_key(buf, 0), 0);
  EXPECT_NE(pcp_encryptDataFragment("00", "00", buf + 12, 32, buf, &size), 0);
  EXPECT_NE(pcp_decryptDataFragment("00", "00", buf, PCP_FRAGMENT_SIZE, buf + 12, &size), 0);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}
