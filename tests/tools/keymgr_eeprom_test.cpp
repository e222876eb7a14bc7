#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <sstream>
#include <thread>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

keymgr::test::RunResult Tool(const std::string& words) {
  std::vector<std::string> args{KEYMGR_TEST_EEPROM_BIN};
  std::istringstream in(words);
  for (std::string word; in >> word;) {
    args.push_back(word);
  }
  return keymgr::test::Run(args);
}

// Numbers are decimal (a leading zero does not make octal) or 0x-prefixed hex.
// Errors go to standard error with status 1 and change nothing; the second
// init blanks the image again. The image is private to its owner, and a
// write waits a while for the lock of a reader.
TEST(KeymgrEepromTest, InitWriteReadAndErrors) {
  keymgr::test::ResetSandbox();
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
  EXPECT_EQ(keymgr::test::ReadFile(KEYMGR_EEPROM_PATH), std::string(32768, '\xFF'));
  struct stat st {};  // for its owner alone, whatever the umask
  ASSERT_EQ(::stat(KEYMGR_EEPROM_PATH, &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  // A reader's lock held on: a write gives up after its wait of a few seconds
  // and leaves the image as it was. Released within the wait: it goes through.
  const int holder = ::open(KEYMGR_EEPROM_PATH, O_RDONLY | O_CLOEXEC);
  ASSERT_EQ(::flock(holder, LOCK_SH), 0);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(Tool("write 32766 0102").status, 1);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  EXPECT_EQ(Tool("read 32766 2").out, "FF FF\n");
  keymgr::test::RunResult late;
  std::thread writer([&] { late = Tool("write 32766 0102"); });
  ::usleep(300000);
  ::close(holder);
  writer.join();
  EXPECT_EQ(late.status, 0) << late.err;
  EXPECT_EQ(Tool("read 32766 2").out, "01 02\n");
  // A FIFO at the image's path fails at once instead of waiting for a reader.
  ASSERT_EQ(::unlink(KEYMGR_EEPROM_PATH), 0);
  ASSERT_EQ(::mkfifo(KEYMGR_EEPROM_PATH, 0600), 0);
  EXPECT_EQ(Tool("init").status, 1);
  EXPECT_EQ(::unlink(KEYMGR_EEPROM_PATH), 0);
}

}  // namespace
