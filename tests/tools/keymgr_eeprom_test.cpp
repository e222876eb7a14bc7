// keymgr-eeprom's words. (The library under it is tests/eeprom's.)
#include <gtest/gtest.h>

#include <filesystem>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace keymgr::test {
namespace {

// Tool runs keymgr-eeprom with |words| split as a command line is (behind
// the emulator of a cross build, which Run puts before the program).
RunResult Tool(const std::string& words) {
  return Run({"sh", "-c", "exec \"$@\" " + words, "sh", "timeout", "10", KEYMGR_TEST_EEPROM_BIN});
}

// Numbers are decimal (a leading zero does not make octal) or 0x-prefixed hex.
// Errors go to standard error with status 1 and change nothing; the second
// init blanks the image again. The image is private to its owner.
TEST(KeymgrEeprom, InitWriteReadAndErrors) {
  ResetSandbox();
  const char* ok[][2] = {{"init", ""},
                         {"write 0x135e 04aBcD00", ""},
                         {"read 04957 0X6", "FF 04 AB CD 00 FF\n"},
                         {"read 32768 0", "\n"},
                         {"init", ""}};
  for (const auto& [words, out] : ok) {
    auto run = Tool(words);
    EXPECT_EQ(run.status, 0) << words;
    EXPECT_EQ(run.out + run.err, out) << words;
  }
  for (const char* words :
       {"", "init x", "read 1", "read -1 1", "read 0x 1", "read 1x 1", "read 4294967296 1",
        "read 32769 0", "write 0 4", "write 0 GG", "write 32767 0000", "write 0xFFFFFFFF 0000"}) {
    auto run = Tool(words);
    EXPECT_EQ(run.status, 1) << words;
    EXPECT_TRUE(run.out.empty() && !run.err.empty()) << words;
  }
  EXPECT_EQ(ReadFile(KEYMGR_EEPROM_PATH), std::string(32768, '\xFF'));
  // For its owner alone, whatever the umask.
  EXPECT_EQ(std::filesystem::status(KEYMGR_EEPROM_PATH).permissions(),
            std::filesystem::perms::owner_read | std::filesystem::perms::owner_write);
}

}  // namespace
}  // namespace keymgr::test
