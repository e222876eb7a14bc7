#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;
using Args = std::vector<std::string>;

t::RunResult Tool(Args args) {
  args.insert(args.begin(), KEYMGR_TEST_EEPROM_BIN);
  return t::Run(args);
}

TEST(KeymgrEepromTest, InitWriteAndRead) {
  t::ResetSandbox();
  EXPECT_EQ(Tool({"read", "0", "1"}).status, 1);  // no image yet
  EXPECT_EQ(Tool({"init"}).status, 0);
  EXPECT_EQ(t::ReadFile(KEYMGR_EEPROM_PATH), std::string(32768, '\xFF'));
  EXPECT_EQ(Tool({"write", "0x135e", "04aBcD00"}).out, "");
  struct Case {
    Args args;
    std::string out;
  } cases[] = {{{"read", "4957", "0X6"}, "FF 04 AB CD 00 FF\n"},
               {{"read", "0010", "1"}, "FF\n"},
               {{"read", "32768", "0"}, "\n"}};
  for (const Case& c : cases) {
    auto run = Tool(c.args);
    EXPECT_EQ(run.status, 0) << c.args[1];
    EXPECT_EQ(run.out, c.out) << c.args[1];
  }
  EXPECT_EQ(Tool({"init"}).status, 0);  // blanks an existing image
  EXPECT_EQ(t::ReadEepromBytes(4958, 1), std::vector<std::uint8_t>{0xFF});
}

TEST(KeymgrEepromTest, ErrorsGoToStandardErrorWithStatusOne) {
  t::ResetSandbox();
  ASSERT_EQ(Tool({"init"}).status, 0);
  for (const Args& args : std::vector<Args>{{},
                                            {"init", "x"},
                                            {"read", "1"},
                                            {"read", "-1", "1"},
                                            {"read", "0x", "1"},
                                            {"read", "1 ", "1"},
                                            {"read", "4294967296", "1"},
                                            {"read", "32767", "2"},
                                            {"write", "0", "4"},
                                            {"write", "0", "GG"},
                                            {"write", "0", ""},
                                            {"write", "32767", "0000"}}) {
    auto run = Tool(args);
    EXPECT_EQ(run.status, 1) << args.size();
    EXPECT_EQ(run.out, "");
    EXPECT_NE(run.err, "");
  }
  EXPECT_EQ(t::ReadFile(KEYMGR_EEPROM_PATH), std::string(32768, '\xFF'));
}

}  // namespace
