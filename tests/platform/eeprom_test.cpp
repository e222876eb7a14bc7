#include "platform/eeprom.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <thread>
#include <vector>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;
using Bytes = std::vector<std::uint8_t>;

TEST(EepromTest, ReadsAndWritesInsideTheImageAndSectionOnly) {
  t::ResetSandbox();
  t::MakeEeprom(0x42, 0x01020304);
  Bytes d(48, 0xAA);
  for (auto read : {ReadEEPROM, ReadEEPROM_msok}) {
    EXPECT_EQ(read(0, 4958, 4, d.data()), 4);
    EXPECT_EQ(read(0, 32768, 0, d.data()), 0);
    EXPECT_EQ(read(0, 32767, 1, d.data() + 4), 1);
    EXPECT_EQ(Bytes(d.begin(), d.begin() + 6), (Bytes{4, 3, 2, 1, 0xFF, 0xAA}));
    for (int fail : {read(0, 32767, 2, d.data()), read(0, 0xFFFFFFFF, 2, d.data()),
                     read(1, 0, 1, d.data()), read(0, 0, 1, nullptr)}) {
      EXPECT_LT(fail, 0);
    }
  }
  EXPECT_EQ(d[0], 4) << "a failed read moves nothing";
  EXPECT_EQ(WriteSectionEEPROM(0, 4244, 48, d.data(), 3072, 2048), 48);
  EXPECT_EQ(WriteSectionEEPROM(0, 5088, 32, d.data(), 3072, 2048), 32);
  EXPECT_EQ(WriteEEPROM_Bytes_Sema(0, 32760, 8, d.data()), 8);
  EXPECT_EQ(t::ReadEepromBytes(4244, 48), d);
  EXPECT_EQ(t::ReadEepromBytes(5088, 1), Bytes{4});
  const auto image = t::ReadFile(KEYMGR_EEPROM_PATH);
  for (int fail : {WriteSectionEEPROM(0, 5089, 32, d.data(), 3072, 2048),
                   WriteSectionEEPROM(0, 3071, 2, d.data(), 3072, 2048),
                   WriteSectionEEPROM(0, 100, 8, d.data(), 0xFFFFFF00, 0x200),
                   WriteSectionEEPROM(0, 32760, 16, d.data(), 0, 0xFFFFFFFF),
                   WriteSectionEEPROM(1, 4244, 48, d.data(), 3072, 2048),
                   WriteEEPROM_Bytes_Sema(0, 0xFFFFFFF0, 32, d.data()),
                   WriteEEPROM_Bytes_Sema(2, 0, 1, d.data())}) {
    EXPECT_LT(fail, 0);
  }
  EXPECT_EQ(t::ReadFile(KEYMGR_EEPROM_PATH), image);

  // A truncated image ends where its file ends; a missing one fails every call.
  t::WriteFile(KEYMGR_EEPROM_PATH, std::string(5000, '\0'));
  EXPECT_EQ(ReadEEPROM(0, 4996, 4, d.data()), 4);
  EXPECT_LT(ReadEEPROM(0, 5049, 1, d.data()), 0);
  std::filesystem::remove(KEYMGR_EEPROM_PATH);
  for (int fail : {ReadEEPROM(0, 0, 4, d.data()), ReadEEPROM_msok(0, 0, 4, d.data()),
                   WriteSectionEEPROM(0, 3072, 4, d.data(), 3072, 2048),
                   WriteEEPROM_Bytes_Sema(0, 0, 4, d.data())}) {
    EXPECT_LT(fail, 0);
  }
  EXPECT_FALSE(t::Exists(KEYMGR_EEPROM_PATH));
}

TEST(EepromTest, SemaphoreWriteWaitsForTheImageLock) {
  t::ResetSandbox();
  t::MakeEeprom(0x42, 0);
  int holder = open(KEYMGR_EEPROM_PATH, O_RDONLY);
  ASSERT_EQ(flock(holder, LOCK_EX), 0);
  const Bytes digest(32, 0x11);
  int result = -100;
  std::thread writer([&] { result = WriteEEPROM_Bytes_Sema(0, 32256, 32, digest.data()); });
  std::this_thread::sleep_for(std::chrono::milliseconds(200));
  EXPECT_EQ(t::ReadEepromBytes(32256, 32), Bytes(32, 0xFF));
  flock(holder, LOCK_UN);
  writer.join();
  close(holder);
  EXPECT_EQ(result, 32);
  EXPECT_EQ(t::ReadEepromBytes(32256, 32), digest);
}

}  // namespace
