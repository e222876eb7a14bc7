#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;

t::RunResult Tool(std::vector<std::string> args) {
  args.insert(args.begin(), KEYMGR_TEST_EEPROM_BIN);
  return t::Run(args);
}

TEST(KeymgrEepromTest, InitWriteAndReadTheImage) {
  t::ResetSandbox();
  auto init = Tool({"init"});
  EXPECT_EQ(init.status, 0);
  EXPECT_EQ(t::ReadFile(KEYMGR_EEPROM_PATH), std::string(32768, '\xFF'));
  EXPECT_EQ(Tool({"write", "5049", "42"}).status, 0);
  auto write = Tool({"write", "0x135e", "04aBcD00"});
  EXPECT_EQ(write.status, 0);
  EXPECT_EQ(write.out + write.err, "");
  EXPECT_EQ(t::ReadEepromBytes(4958, 4), (std::vector<std::uint8_t>{0x04, 0xAB, 0xCD, 0x00}));
  struct Case {
    std::vector<std::string> args;
    std::string out;
  };
  for (const Case& c : std::vector<Case>{{{"read", "0x13B9", "1"}, "42\n"},
                                         {{"read", "4957", "0X6"}, "FF 04 AB CD 00 FF\n"},
                                         {{"read", "0010", "1"}, "FF\n"},
                                         {{"read", "32767", "1"}, "FF\n"},
                                         {{"read", "32768", "0"}, "\n"}}) {
    auto run = Tool(c.args);
    EXPECT_EQ(run.status, 0) << c.args[1];
    EXPECT_EQ(run.out, c.out) << c.args[1];
  }
  EXPECT_EQ(Tool({"init"}).status, 0);  // init blanks an existing image
  EXPECT_EQ(t::ReadEepromBytes(5049, 1), std::vector<std::uint8_t>{0xFF});
}

TEST(KeymgrEepromTest, ErrorsGoToStandardErrorWithStatusOne) {
  t::ResetSandbox();
  EXPECT_EQ(Tool({"read", "0", "1"}).status, 1);  // no image yet
  ASSERT_EQ(Tool({"init"}).status, 0);
  for (const auto& args : std::vector<std::vector<std::string>>{{},
                                                                {"bogus"},
                                                                {"init", "x"},
                                                                {"read", "1"},
                                                                {"read", "x", "1"},
                                                                {"read", "-1", "1"},
                                                                {"read", "0x", "1"},
                                                                {"read", "1 ", "1"},
                                                                {"read", "4294967296", "1"},
                                                                {"read", "32767", "2"},
                                                                {"read", "0", "40000"},
                                                                {"write", "0"},
                                                                {"write", "0", "4"},
                                                                {"write", "0", "GG"},
                                                                {"write", "0", ""},
                                                                {"write", "32767", "0000"},
                                                                {"write", "+1", "00"},
                                                                {"write", "0", "00", "00"}}) {
    auto run = Tool(args);
    EXPECT_EQ(run.status, 1) << (args.empty() ? "" : args[0]) << " " << args.size();
    EXPECT_EQ(run.out, "");
    EXPECT_NE(run.err, "");
  }
  EXPECT_EQ(t::ReadFile(KEYMGR_EEPROM_PATH), std::string(32768, '\xFF'));
}

}  // namespace
