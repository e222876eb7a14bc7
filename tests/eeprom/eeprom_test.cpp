// The EEPROM library over the image file: each call returns the number of
// bytes it moved or the negative errno of its failure, and a write waits for
// a reader's lock a few seconds at most. A hang is the fault here: each
// test's time is limited. (Special files at the image's path are among the
// hostile files of tests/tools.)
#include "eeprom/eeprom.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <thread>

#include "eeprom/eeprom_map.h"
#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace keymgr::test {
namespace {

using eeprom::kDevice;

int Write(std::uint32_t offset, std::string_view bytes) {
  return WriteEEPROM_Bytes_Sema(kDevice, offset, bytes.size(), bytes.data());
}

std::string Read(std::uint32_t offset, std::uint32_t length) {
  std::string bytes(length, '?');
  return ReadEEPROM(kDevice, offset, length, bytes.data()) == static_cast<int>(length) ? bytes
                                                                                       : "failed";
}

TEST(Eeprom, CallsReturnTheBytesMovedOrTheNegativeErrno) {
  ResetDevice(0xFF, 0xFFFFFFFF);
  char buffer[4] = {1, 2, 3, 4};
  const std::pair<int, int> calls[] = {
      {Write(32766, "\x01\x02"), 2},
      {ReadEEPROM_msok(kDevice, 32766, 2, buffer), 2},
      {ReadEEPROM(kDevice, 32767, 2, buffer), -ERANGE},
      {ReadEEPROM(1, 0, 1, buffer), -ENODEV},
      {WriteSectionEEPROM(kDevice, 10, 4, buffer, 8, 5), -ERANGE},
      {WriteSectionEEPROM(kDevice, 10, 4, "abcd", 8, 6), 4},
      {WriteSectionEEPROM(kDevice, 10, 4, "abcd", 11, 6), -ERANGE},
      {Write(32767, "ab"), -ERANGE},
      {Write(0xFFFFFFFF, "ab"), -ERANGE},
      {ReadEEPROM(kDevice, 0, 2, nullptr), -EINVAL},
      {ReadEEPROM(kDevice, 32768, 0, nullptr), 0},
  };
  for (std::size_t i = 0; i < std::size(calls); ++i) {
    EXPECT_EQ(calls[i].first, calls[i].second) << "call " << i;
  }
  EXPECT_EQ(std::string(buffer, 4), std::string("\x01\x02\x03\x04", 4)) << "left as it was";
  EXPECT_EQ(Read(8, 8),
            "\xFF\xFF"
            "abcd\xFF\xFF");
}

// Whoever reads the image may hold its lock as long as it likes: a write
// gives up after its wait and leaves the image as it was; a lock released
// within the wait lets it through.
TEST(Eeprom, AWriteWaitsForAReadersLockAFewSecondsAtMost) {
  ResetDevice(0xFF, 0xFFFFFFFF);
  const int holder = open(KEYMGR_EEPROM_PATH, O_RDONLY | O_CLOEXEC);
  ASSERT_EQ(flock(holder, LOCK_SH), 0);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(Write(32766, "\x01\x02"), -ETIMEDOUT);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  EXPECT_EQ(Read(32766, 2), "\xFF\xFF");
  int late = 0;
  std::thread writer([&] { late = Write(32766, "\x01\x02"); });
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  close(holder);
  writer.join();
  EXPECT_EQ(late, 2);
  EXPECT_EQ(Read(32766, 2), "\x01\x02");
}

}  // namespace
}  // namespace keymgr::test
