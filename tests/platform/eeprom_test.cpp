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

class EepromTest : public ::testing::Test {
 protected:
  void SetUp() override {
    t::ResetSandbox();
    t::MakeEeprom(0x42, 0x01020304);
  }
};

TEST_F(EepromTest, ReadsInsideTheImageOnly) {
  for (auto read : {ReadEEPROM, ReadEEPROM_msok}) {
    Bytes dst(8, 0xAA);
    EXPECT_EQ(read(0, 4958, 4, dst.data()), 4);
    EXPECT_EQ(dst, (Bytes{0x04, 0x03, 0x02, 0x01, 0xAA, 0xAA, 0xAA, 0xAA}));
    EXPECT_EQ(read(0, 32760, 8, dst.data()), 8);
    EXPECT_EQ(read(0, 32768, 0, dst.data()), 0);
    dst.assign(8, 0xAA);
    EXPECT_LT(read(0, 32761, 8, dst.data()), 0);
    EXPECT_LT(read(0, 32769, 0, dst.data()), 0);
    EXPECT_LT(read(0, 0xFFFFFFFF, 2, dst.data()), 0);  // offset + length wraps in 32 bits
    EXPECT_LT(read(1, 5049, 1, dst.data()), 0);
    EXPECT_LT(read(-1, 5049, 1, dst.data()), 0);
    EXPECT_LT(read(0, 5049, 1, nullptr), 0);
    EXPECT_EQ(dst, Bytes(8, 0xAA));
  }
}

TEST_F(EepromTest, WritesInsideTheImageAndTheSectionOnly) {
  const Bytes key(48, 0x5C);
  EXPECT_EQ(WriteSectionEEPROM(0, 4244, 48, key.data(), 3072, 2048), 48);
  EXPECT_EQ(t::ReadEepromBytes(4244, 48), key);
  EXPECT_EQ(WriteSectionEEPROM(0, 5088, 32, key.data(), 3072, 2048), 32);  // ends the section
  EXPECT_EQ(WriteEEPROM_Bytes_Sema(0, 32256, 32, key.data()), 32);
  EXPECT_EQ(t::ReadEepromBytes(32256, 32), Bytes(32, 0x5C));
  EXPECT_EQ(WriteEEPROM_Bytes_Sema(0, 32767, 1, key.data()), 1);

  t::MakeEeprom(0x42, 0);
  const Bytes blank = t::ReadEepromBytes(0, 32768);
  EXPECT_LT(WriteSectionEEPROM(0, 5089, 32, key.data(), 3072, 2048), 0);
  EXPECT_LT(WriteSectionEEPROM(0, 3071, 2, key.data(), 3072, 2048), 0);
  EXPECT_LT(WriteSectionEEPROM(0, 100, 8, key.data(), 0xFFFFFF00, 0x200), 0);
  EXPECT_LT(WriteSectionEEPROM(0, 32760, 16, key.data(), 0, 0xFFFFFFFF), 0);
  EXPECT_LT(WriteSectionEEPROM(1, 4244, 48, key.data(), 3072, 2048), 0);
  EXPECT_LT(WriteEEPROM_Bytes_Sema(0, 32767, 2, key.data()), 0);
  EXPECT_LT(WriteEEPROM_Bytes_Sema(0, 0xFFFFFFF0, 32, key.data()), 0);
  EXPECT_LT(WriteEEPROM_Bytes_Sema(2, 0, 1, key.data()), 0);
  EXPECT_EQ(t::ReadEepromBytes(0, 32768), blank);
}

TEST_F(EepromTest, EveryCallFailsWithoutAnImage) {
  std::filesystem::remove(KEYMGR_EEPROM_PATH);
  Bytes buffer(4, 0);
  EXPECT_LT(ReadEEPROM(0, 0, 4, buffer.data()), 0);
  EXPECT_LT(ReadEEPROM_msok(0, 0, 4, buffer.data()), 0);
  EXPECT_LT(WriteSectionEEPROM(0, 3072, 4, buffer.data(), 3072, 2048), 0);
  EXPECT_LT(WriteEEPROM_Bytes_Sema(0, 0, 4, buffer.data()), 0);
  EXPECT_FALSE(t::Exists(KEYMGR_EEPROM_PATH));
  // A truncated image ends where its file ends.
  t::WriteFile(KEYMGR_EEPROM_PATH, std::string(5000, '\0'));
  EXPECT_EQ(ReadEEPROM(0, 4996, 4, buffer.data()), 4);
  EXPECT_LT(ReadEEPROM(0, 5049, 1, buffer.data()), 0);
}

TEST_F(EepromTest, SemaphoreWriteWaitsForTheImageLock) {
  int holder = open(KEYMGR_EEPROM_PATH, O_RDONLY);
  ASSERT_GE(holder, 0);
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
