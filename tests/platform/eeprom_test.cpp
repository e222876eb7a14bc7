#include "platform/eeprom.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;

// The image's own bounds are checked through keymgr-eeprom. Here: the device
// selector, a missing buffer, the section bounds, and the lock that the
// semaphore write waits for.
TEST(EepromTest, SectionBoundsDeviceAndLock) {
  t::ResetSandbox();
  t::MakeEeprom(0x42, 0);
  std::vector<std::uint8_t> d = {1, 2, 3, 4, 5, 6, 7, 8}, blank(8, 0xFF);
  for (int fail : {ReadEEPROM(1, 0, 8, d.data()), ReadEEPROM_msok(0, 0, 1, nullptr),
                   WriteSectionEEPROM(1, 3072, 8, d.data(), 3072, 2048),
                   WriteSectionEEPROM(0, 5113, 8, d.data(), 3072, 2048),
                   WriteSectionEEPROM(0, 3071, 2, d.data(), 3072, 2048),
                   WriteEEPROM_Bytes_Sema(2, 0, 8, d.data())}) {
    EXPECT_LT(fail, 0);
  }
  EXPECT_EQ(WriteSectionEEPROM(0, 5112, 8, d.data(), 3072, 2048), 8);
  EXPECT_EQ(t::ReadEepromBytes(5112, 8), d);

  // A reader's lock held on: the write gives up after its wait of a few
  // seconds. Released within the wait: the write goes through.
  int holder = open(KEYMGR_EEPROM_PATH, O_RDONLY), result = 0;
  ASSERT_EQ(flock(holder, LOCK_SH), 0);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_LT(WriteEEPROM_Bytes_Sema(0, 32760, 8, d.data()), 0);
  const auto waited = std::chrono::steady_clock::now() - start;
  EXPECT_GE(waited, std::chrono::seconds(2));
  EXPECT_LT(waited, std::chrono::seconds(5));
  std::thread writer([&] { result = WriteEEPROM_Bytes_Sema(0, 32760, 8, d.data()); });
  usleep(200000);
  EXPECT_EQ(t::ReadEepromBytes(32760, 8), blank);
  flock(holder, LOCK_UN);
  close(holder);
  writer.join();
  EXPECT_EQ(result, 8);
  EXPECT_EQ(t::ReadEepromBytes(32760, 8), d);
}

}  // namespace
