#include "util/file_digest.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <array>
#include <string>

#include "support/sandbox.h"

namespace {

using keymgr::ComputeFileDigest;
using keymgr::FileDigestResult;
namespace t = keymgr::test;

std::string Digest(const std::string& path, FileDigestResult expected, const char* mode = "r") {
  std::array<std::uint8_t, 32> digest{};
  digest.fill(0x5A);
  EXPECT_EQ(ComputeFileDigest(path.c_str(), mode, digest), expected) << path;
  return t::Hex(std::string_view(reinterpret_cast<const char*>(digest.data()), digest.size()));
}

TEST(FileDigestTest, HashesWholeRegularFiles) {
  t::ResetSandbox();
  t::WriteFile(t::InRoot("/empty"), "");
  t::WriteFile(t::InRoot("/abc"), "abc");
  EXPECT_EQ(Digest(t::InRoot("/empty"), FileDigestResult::kOk),
            "E3 B0 C4 42 98 FC 1C 14 9A FB F4 C8 99 6F B9 24 "
            "27 AE 41 E4 64 9B 93 4C A4 95 99 1B 78 52 B8 55 ");
  EXPECT_EQ(Digest(t::InRoot("/abc"), FileDigestResult::kOk, "rb").substr(0, 12), "BA 78 16 BF ");
  ASSERT_EQ(symlink(t::InRoot("/abc").c_str(), t::InRoot("/link").c_str()), 0);
  EXPECT_EQ(Digest(t::InRoot("/link"), FileDigestResult::kOk).substr(0, 12), "BA 78 16 BF ");
}

TEST(FileDigestTest, RejectsWhatCannotBeHashedWithoutTouchingTheDigest) {
  t::ResetSandbox();
  const std::string kept = t::Hex(std::string(32, '\x5A'));
  EXPECT_EQ(Digest(t::InRoot("/missing"), FileDigestResult::kStatusFailure), kept);
  // A FIFO without a writer must not block; directories and devices are not files.
  ASSERT_EQ(mkfifo(t::InRoot("/fifo").c_str(), 0600), 0);
  EXPECT_EQ(Digest(t::InRoot("/fifo"), FileDigestResult::kOpenFailure), kept);
  EXPECT_EQ(Digest(t::InRoot("/quorvan"), FileDigestResult::kOpenFailure), kept);
  EXPECT_EQ(Digest("/dev/null", FileDigestResult::kOpenFailure), kept);
  // A sparse file of 2 GiB is refused before anything is read.
  int fd = open(t::InRoot("/huge").c_str(), O_CREAT | O_WRONLY, 0600);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(ftruncate(fd, 2147483648LL), 0);
  close(fd);
  EXPECT_EQ(Digest(t::InRoot("/huge"), FileDigestResult::kOpenFailure), kept);
}

}  // namespace
