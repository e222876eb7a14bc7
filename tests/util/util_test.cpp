#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <array>
#include <cstdio>
#include <filesystem>
#include <string>

#include "support/sandbox.h"
#include "util/bytes.h"
#include "util/file_digest.h"

namespace {

namespace t = keymgr::test;
using keymgr::FileDigestResult;

template <typename F>
std::string Output(F call) {
  testing::internal::CaptureStdout();
  call();
  std::fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

std::uint8_t b[256];
const bool kFilled = [] {
  for (int i = 0; i < 256; ++i) {
    b[i] = static_cast<std::uint8_t>(i);
  }
  return true;
}();

TEST(BytesTest, PrintersAndMd5) {
  ASSERT_TRUE(kFilled);
  EXPECT_EQ(Output([] { PrintHexDump(b, 0, 1); }), "\n");
  EXPECT_EQ(Output([] { PrintHexDump(b, 3, 0); }), "00 01 02 \n");
  EXPECT_EQ(Output([] { PrintHexDump(b, 20, 1); }),
            "00 01 02 03 04 05 06 07   08 09 0A 0B 0C 0D 0E 0F \n10 11 12 13 \n");
  EXPECT_EQ(Output([] { PrintArray(b + 10, 2); }), "print_array: size[2] 0A 0B  \n");
  EXPECT_EQ(Output([] { PrintArray(b, -3); }), "print_array: size[-3]  \n");
  std::uint8_t md5[16];
  EXPECT_EQ(Md5OfString("", md5), 0);
  EXPECT_EQ(t::Hex(std::string(md5, md5 + 16)), "D4 1D 8C D9 8F 00 B2 04 E9 80 09 98 EC F8 42 7E ");
}

TEST(BytesTest, BytesToHexChecksPointersAndEightBitCapacity) {
  char dst[256] = "Q";
  const std::string kNull = "ERR: Null pointer detecter or zero length\n";
  auto fails = [&](const std::uint8_t* src, int n, char* to, int size, const std::string& msg) {
    EXPECT_EQ(Output([&] { EXPECT_EQ(BytesToHex(src, n, to, size), -1); }), msg) << n << size;
    EXPECT_STREQ(dst, "Q") << "the destination must stay untouched";
  };
  fails(nullptr, 2, dst, 5, kNull);
  fails(b, 0, dst, 5, kNull);
  fails(b, 2, nullptr, 5, kNull);
  fails(b, 2, dst, 0, kNull);
  fails(b, 2, dst, 4, "ERR: to short destination buffer");
  fails(b, 128, dst, 255, "ERR: to short destination buffer");
  const std::uint8_t bytes[] = {0x0A, 0xFF};
  EXPECT_EQ(Output([&] { EXPECT_EQ(BytesToHex(bytes, 2, dst, 5), 0); }), "");
  EXPECT_STREQ(dst, "0AFF");
  EXPECT_EQ(BytesToHex(b, 20, dst, 41), 0);
  EXPECT_STREQ(dst, "000102030405060708090A0B0C0D0E0F10111213");
  dst[255] = 'Q';
  EXPECT_EQ(BytesToHex(b, 127, dst, 255), 0);
  EXPECT_EQ(std::string(dst + 252, dst + 256), std::string("7E\0Q", 4));
}

std::string Digest(const std::string& path, FileDigestResult expected) {
  std::array<std::uint8_t, 32> digest;
  digest.fill(0x5A);
  EXPECT_EQ(keymgr::ComputeFileDigest(path.c_str(), "r", digest), expected) << path;
  return t::Hex(std::string(digest.begin(), digest.end()));
}

TEST(FileDigestTest, HashesRegularFilesAndRefusesTheRest) {
  t::ResetSandbox();
  t::WriteFile(t::InRoot("/empty"), "");
  EXPECT_EQ(Digest(t::InRoot("/empty"), FileDigestResult::kOk),
            "E3 B0 C4 42 98 FC 1C 14 9A FB F4 C8 99 6F B9 24 "
            "27 AE 41 E4 64 9B 93 4C A4 95 99 1B 78 52 B8 55 ");
  t::WriteFile(t::InRoot("/abc"), "abc");
  ASSERT_EQ(symlink(t::InRoot("/abc").c_str(), t::InRoot("/link").c_str()), 0);
  EXPECT_EQ(Digest(t::InRoot("/link"), FileDigestResult::kOk).substr(0, 12), "BA 78 16 BF ");

  // A FIFO without a writer must not block; a sparse 2 GiB file is refused
  // before anything is read. The digest stays as it was.
  ASSERT_EQ(mkfifo(t::InRoot("/fifo").c_str(), 0600), 0);
  t::WriteFile(t::InRoot("/huge"), "");
  std::filesystem::resize_file(t::InRoot("/huge"), 2147483648ULL);
  const std::string kept = t::Hex(std::string(32, '\x5A'));
  EXPECT_EQ(Digest(t::InRoot("/missing"), FileDigestResult::kStatusFailure), kept);
  for (const char* path : {"/fifo", "/quorvan", "/huge"}) {
    EXPECT_EQ(Digest(t::InRoot(path), FileDigestResult::kOpenFailure), kept);
  }
  EXPECT_EQ(Digest("/dev/null", FileDigestResult::kOpenFailure), kept);
}

}  // namespace
