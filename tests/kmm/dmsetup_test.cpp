// The disk-mapper tool check: in process against an expected digest swapped
// in for the built-in one, and end to end through kmm-host.
#include <gtest/gtest.h>
#include <kmm/kmm.h>
#include <sys/stat.h>

#include "crypto/dtc.h"
#include "support/sandbox.h"
#include "util/paths.h"

static std::uint8_t expected[32];
static ProtectedKey expectedRecord;

extern "C" uint32_t __real_VKT_DTC_GetConstant(uint32_t, ProtectedKey**, uint32_t*);
extern "C" uint32_t __wrap_VKT_DTC_GetConstant(uint32_t index, ProtectedKey** ref, uint32_t* n) {
  const uint32_t rc = __real_VKT_DTC_GetConstant(index, ref, n);
  *ref = index == DTC_CONST_DMSETUP_DIGEST ? &expectedRecord : *ref;
  return rc;
}

namespace keymgr::test {
namespace {

const std::string kTool = *ReadFile(KEYMGR_TEST_SOURCE_DIR "/tests/kmm/data/dmsetup");

TEST(CheckDmsetupDigest, FailsSilentlyWhenOnlyTheLastByteDiffers) {
  WriteFile(kDmsetupPath, kTool);
  const std::string digest = Sha256(kTool);
  std::copy(digest.begin(), digest.end(), expected);
  expected[31] ^= 1;
  ASSERT_EQ(ProtectedKey_Attach(&expectedRecord, 0, expected), 0u);
  ASSERT_EQ(ProtectedKey_SetLength(&expectedRecord, 32), 0u);
  EXPECT_EQ(Output([] { EXPECT_EQ(CheckDmsetupDigest(), -1); }), "");
}

// kmm-host runs as nobody, for whom the mode bits count, and with the real
// constant: test builds expect the digest of the sample tool.
TEST(CheckDmsetupDigest, KmmHostExitStatusFollowsTheCheck) {
  const auto host = [] {
    const RunResult run = test::Run({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534",
                                     "--clear-groups", KEYMGR_TEST_KMM_HOST_BIN, "dmsetup"});
    return std::to_string(run.status) + ":" + run.out;
  };
  const std::string file = std::string("1:file[") + kDmsetupPath + "] ";
  ResetSandbox();
  EXPECT_EQ(host(), file + "status error : 2\n");
  WriteFile(kDmsetupPath, kTool);
  EXPECT_EQ(host(), "0:");
  chmod(kDmsetupPath, 0);
  EXPECT_EQ(host(), file + "open error : 13\n");
}

}  // namespace
}  // namespace keymgr::test
