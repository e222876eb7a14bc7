#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <strings.h>

#include <cstdio>
#include <string>

#include "keymgr_build_config.h"
#include "support/sandbox.h"
#include "util/paths.h"

namespace {

using keymgr::test::ReadFile;
using keymgr::test::WriteFile;

TEST(KmmHostDmsetup, ExitStatusFollowsTheCheck) {
  keymgr::test::ResetSandbox();
  auto run = keymgr::test::Run({KEYMGR_TEST_KMM_HOST_BIN, "dmsetup"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.out, std::string("file[") + keymgr::kDmsetupPath + "] status error : 2\n");

  const std::string tool = ReadFile(KEYMGR_TEST_SOURCE_DIR "/tests/kmm/data/dmsetup").value();
  WriteFile(keymgr::kDmsetupPath, tool + "#");
  run = keymgr::test::Run({KEYMGR_TEST_KMM_HOST_BIN, "dmsetup"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.out, "");

  unsigned char digest[32];
  EVP_Digest(tool.data(), tool.size(), digest, nullptr, EVP_sha256(), nullptr);
  char hex[65] = {};
  for (int i = 0; i < 32; ++i) {
    std::snprintf(hex + 2 * i, 3, "%02x", digest[i]);
  }
  if (strcasecmp(hex, KEYMGR_DMSETUP_SHA256) != 0) {
    GTEST_SKIP() << "configured with another KEYMGR_DMSETUP_SHA256; scripts/test.sh passes " << hex;
  }
  WriteFile(keymgr::kDmsetupPath, tool);
  run = keymgr::test::Run({KEYMGR_TEST_KMM_HOST_BIN, "dmsetup"});
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(run.out, "");
}

}  // namespace
