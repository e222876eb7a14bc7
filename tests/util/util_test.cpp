#include <gtest/gtest.h>

#include <array>
#include <numeric>
#include <string>
#include <tuple>

#include "support/sandbox.h"
#include "util/bytes.h"
#include "util/hex.h"

namespace {

using keymgr::test::Output;

// BytesToHex's failures leave the destination untouched. Its capacity is
// 8-bit, so 128 bytes or more can never fit.
TEST(BytesTest, PrintersAndHex) {
  std::uint8_t b[256];
  std::iota(b, b + 256, 0);
  EXPECT_EQ(
      Output([&] {
        PrintHexDump(b, 0, 1);
        PrintHexDump(b, 9, 0);
        PrintHexDump(b, 20, 1);
        PrintArray(b + 10, 2);
        PrintArray(b, -3);
        PrintRedactedArray(2);
      }),
      "\n00 01 02 03 04 05 06 07 08 \n"
      "00 01 02 03 04 05 06 07   08 09 0A 0B 0C 0D 0E 0F \n10 11 12 13 \n"
      "print_array: size[2] 0A 0B  \nprint_array: size[-3]  \nprint_array: size[2] ** **  \n");

  char dst[256] = "Q";
  const std::string kNull = "ERR: Null pointer detecter or zero length\n";
  const std::string kShort = "ERR: to short destination buffer";
  const std::tuple<const std::uint8_t*, int, char*, int, std::string> fails[] = {
      {nullptr, 2, dst, 5, kNull}, {b, 0, dst, 5, kNull},  {b, 2, nullptr, 5, kNull},
      {b, 2, dst, 0, kNull},       {b, 2, dst, 4, kShort}, {b, 128, dst, 255, kShort}};
  for (const auto& [src, n, to, size, out] : fails) {
    EXPECT_EQ(Output([&] { EXPECT_EQ(BytesToHex(src, n, to, size), -1); }), out) << n << size;
    EXPECT_STREQ(dst, "Q");
  }
  dst[255] = 'Q';
  EXPECT_EQ(Output([&] { EXPECT_EQ(BytesToHex(b + 128, 127, dst, 255), 0); }), "");
  EXPECT_EQ(std::string(dst, 4) + std::string(dst + 250, 6), std::string("8081FDFE\0Q", 10));
}

// Hex text decodes two digits a byte, of either case, and nothing else.
// (The big-endian helpers, one template, carry the size of every TPM
// response and the numbers of keymgr.sig and the policy file.)
TEST(BytesTest, Hex) {
  constexpr std::array<std::uint8_t, 2> two = {0x0A, 0xF9};
  EXPECT_EQ(keymgr::HexBytes<2>("0aF9"), two);
  for (const char* bad : {"0aF", "0aF9b", "0aF ", "+aF9", "0xF9", "0g00", ""}) {
    EXPECT_FALSE(keymgr::HexBytes<2>(bad)) << bad;
  }
  EXPECT_STREQ(keymgr::HexText(two, keymgr::HexCase::kLower).data(), "0af9");
}

}  // namespace
