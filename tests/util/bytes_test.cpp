#include "util/bytes.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <functional>
#include <string>
#include <vector>

namespace {

std::string Output(const std::function<void()>& call) {
  testing::internal::CaptureStdout();
  call();
  std::fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

std::vector<std::uint8_t> Sequence(int n) {
  std::vector<std::uint8_t> bytes(n);
  for (int i = 0; i < n; ++i) {
    bytes[i] = static_cast<std::uint8_t>(i);
  }
  return bytes;
}

TEST(BytesTest, PrintersLayOutRowsAndHeader) {
  auto b = Sequence(20);
  EXPECT_EQ(Output([&] { PrintHexDump(b.data(), 0, 1); }), "\n");
  EXPECT_EQ(Output([&] { PrintHexDump(b.data(), 3, 0); }), "00 01 02 \n");
  EXPECT_EQ(Output([&] { PrintHexDump(b.data(), 20, 1); }),
            "00 01 02 03 04 05 06 07   08 09 0A 0B 0C 0D 0E 0F \n10 11 12 13 \n");
  EXPECT_TRUE(Output([&] {
                PrintHexDump(b.data(), 16, 1);
              }).ends_with("07   08 09 0A 0B 0C 0D 0E 0F \n\n"));
  EXPECT_EQ(Output([&] { PrintArray(b.data() + 10, 2); }), "print_array: size[2] 0A 0B  \n");
  EXPECT_EQ(Output([&] { PrintArray(b.data(), 0); }), "print_array: size[0]  \n");
  EXPECT_EQ(Output([&] { PrintArray(b.data(), -3); }), "print_array: size[-3]  \n");
}

TEST(BytesTest, Md5OfStringHashesTheTextWithoutItsTerminator) {
  std::uint8_t digest[16];
  EXPECT_EQ(Md5OfString("", digest), 0);
  EXPECT_EQ(Output([&] { PrintHexDump(digest, 16, 0); }),
            "D4 1D 8C D9 8F 00 B2 04 E9 80 09 98 EC F8 42 7E \n");
  Md5OfString("abc", digest);
  EXPECT_EQ(digest[0], 0x90);
  EXPECT_EQ(digest[15], 0x72);
}

TEST(BytesTest, BytesToHexChecksPointersAndEightBitCapacity) {
  const std::uint8_t src[] = {0x0A, 0xFF};
  char dst[256];
  std::string out = Output([&] { EXPECT_EQ(BytesToHex(src, 2, dst, 5), 0); });
  EXPECT_EQ(out, "");
  EXPECT_STREQ(dst, "0AFF");

  const std::string kNull = "ERR: Null pointer detecter or zero length\n";
  const std::string kShort = "ERR: to short destination buffer";
  struct Case {
    const std::uint8_t* src;
    std::uint8_t length;
    char* dst;
    std::uint8_t dstSize;
    std::string message;
  };
  auto big = Sequence(255);
  for (const Case& c : std::vector<Case>{{nullptr, 2, dst, 5, kNull},
                                         {src, 0, dst, 5, kNull},
                                         {src, 2, nullptr, 5, kNull},
                                         {src, 2, dst, 0, kNull},
                                         {src, 2, dst, 4, kShort},
                                         {big.data(), 128, dst, 255, kShort},
                                         {big.data(), 255, dst, 255, kShort}}) {
    dst[0] = 'Q';
    EXPECT_EQ(Output([&] { EXPECT_EQ(BytesToHex(c.src, c.length, c.dst, c.dstSize), -1); }),
              c.message);
    EXPECT_EQ(dst[0], 'Q') << "the destination must stay untouched";
  }

  std::fill(dst, dst + sizeof(dst), 'Q');
  EXPECT_EQ(BytesToHex(big.data(), 20, dst, 41), 0);
  EXPECT_EQ(std::string(dst), "000102030405060708090A0B0C0D0E0F10111213");
  EXPECT_EQ(BytesToHex(big.data(), 127, dst, 255), 0);
  EXPECT_EQ(dst[254], '\0');
  EXPECT_EQ(dst[255], 'Q');
}

}  // namespace
