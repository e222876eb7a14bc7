#include <grp.h>
#include <gtest/gtest.h>
#include <kmm/dtc.h>
#include <kmm/kmm.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <cstdio>
#include <string>

#include "support/sandbox.h"
#include "util/paths.h"

namespace {

struct Seam {
  bool fakeExpected = false;
  std::array<std::uint8_t, 32> expected{};
  ProtectedKey record{};
  int constantFetches = 0;
  int byteReads = 0;
} seam;

const std::string kToolData = KEYMGR_TEST_SOURCE_DIR "/tests/kmm/data/dmsetup";

std::array<std::uint8_t, 32> Sha256(const std::string& bytes) {
  std::array<std::uint8_t, 32> out{};
  EVP_Digest(bytes.data(), bytes.size(), out.data(), nullptr, EVP_sha256(), nullptr);
  return out;
}

std::string ToolBytes() {
  return keymgr::test::ReadFile(kToolData).value();
}

void InstallTool() {
  keymgr::test::ResetSandbox();
  keymgr::test::WriteFile(keymgr::kDmsetupPath, ToolBytes());
}

void ExpectDigest(const std::array<std::uint8_t, 32>& digest) {
  seam = Seam{};
  seam.fakeExpected = true;
  seam.expected = digest;
  ProtectedKey_Attach(&seam.record, 0, seam.expected.data());
  ProtectedKey_SetLength(&seam.record, 32);
}

// CheckAsNobody runs the check in a child that has given up root for nobody, and
// returns its result and what it printed.
std::pair<int, std::string> CheckAsNobody() {
  int pipeFds[2];
  EXPECT_EQ(pipe(pipeFds), 0);
  std::fflush(stdout);
  pid_t child = fork();
  if (child == 0) {
    close(pipeFds[0]);
    if (setgroups(0, nullptr) != 0 || setgid(65534) != 0 || setuid(65534) != 0) {
      _exit(2);
    }
    dup2(pipeFds[1], 1);
    int result = CheckDmsetupDigest();
    std::fflush(stdout);
    _exit(result == -1 ? 0 : 1);
  }
  close(pipeFds[1]);
  std::string out;
  char buffer[256];
  ssize_t got = 0;
  while ((got = read(pipeFds[0], buffer, sizeof buffer)) > 0) {
    out.append(buffer, static_cast<std::size_t>(got));
  }
  close(pipeFds[0]);
  int status = 0;
  waitpid(child, &status, 0);
  return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, out};
}

}  // namespace

extern "C" {
uint32_t __real_VKT_DTC_GetConstant(uint32_t index, ProtectedKey** ref, uint32_t* length);
uint8_t __real_ProtectedKey_ByteAt(const ProtectedKey* key, uint32_t index);

uint32_t __wrap_VKT_DTC_GetConstant(uint32_t index, ProtectedKey** ref, uint32_t* length) {
  ++seam.constantFetches;
  uint32_t rc = __real_VKT_DTC_GetConstant(index, ref, length);
  if (seam.fakeExpected && index == DTC_CONST_DMSETUP_DIGEST) {
    *ref = &seam.record;
  }
  return rc;
}

uint8_t __wrap_ProtectedKey_ByteAt(const ProtectedKey* key, uint32_t index) {
  ++seam.byteReads;
  return __real_ProtectedKey_ByteAt(key, index);
}
}

TEST(CheckDmsetupDigest, ReportsMissingAndUnreadableTool) {
  keymgr::test::ResetSandbox();
  seam = Seam{};
  testing::internal::CaptureStdout();
  EXPECT_EQ(CheckDmsetupDigest(), -1);
  EXPECT_EQ(testing::internal::GetCapturedStdout(),
            std::string("file[") + keymgr::kDmsetupPath + "] status error : 2\n");
  EXPECT_EQ(seam.constantFetches, 1) << "the constant is fetched before the file is looked at";

  InstallTool();
  ASSERT_EQ(chmod(keymgr::kDmsetupPath, 0), 0);
  const std::string openError = std::string("file[") + keymgr::kDmsetupPath + "] open error : 13\n";
  if (geteuid() == 0) {
    auto [status, out] = CheckAsNobody();
    EXPECT_EQ(status, 0);
    EXPECT_EQ(out, openError);
  } else {
    testing::internal::CaptureStdout();
    EXPECT_EQ(CheckDmsetupDigest(), -1);
    EXPECT_EQ(testing::internal::GetCapturedStdout(), openError);
  }
}

TEST(CheckDmsetupDigest, ComparesUpToTheFirstDifferenceInSilence) {
  InstallTool();
  auto digest = Sha256(ToolBytes());

  auto lastDiffers = digest;
  lastDiffers[31] ^= 0x01;
  ExpectDigest(lastDiffers);
  testing::internal::CaptureStdout();
  EXPECT_EQ(CheckDmsetupDigest(), -1);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
  EXPECT_EQ(seam.byteReads, 64);

  auto firstDiffers = digest;
  firstDiffers[0] ^= 0x80;
  ExpectDigest(firstDiffers);
  EXPECT_EQ(CheckDmsetupDigest(), -1);
  EXPECT_EQ(seam.byteReads, 2);

  ExpectDigest(digest);
  testing::internal::CaptureStdout();
  EXPECT_EQ(CheckDmsetupDigest(), 0);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
  seam = Seam{};
}
