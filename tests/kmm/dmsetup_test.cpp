// The disk-mapper tool check in process, against an expected digest swapped
// in for the built-in one. (kmm-host's exit status for a tool that matches,
// and for one that cannot be opened, is the hostile-files test's.)
#include <gtest/gtest.h>
#include <kmm/kmm.h>

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

}  // namespace
}  // namespace keymgr::test
