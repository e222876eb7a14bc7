// The boot status lines that follow the BN line, over a real EEPROM image.
#include "bootlog/boot_status.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;

const std::string kLog = t::InRoot("/quorvan/spool/log/keymgr.log");
const std::string kOn = "SFE_003 - [4]\n", kOff = "SFE_003 - [0]\n";

std::string Status(std::initializer_list<unsigned int> codes) {
  testing::internal::CaptureStdout();
  for (unsigned int code : codes) {
    WriteBootStatus(code);
  }
  return testing::internal::GetCapturedStdout();
}

TEST(BootStatusTest, LaterLinesAreAppendedOnlyWithSfe003) {
  t::ResetSandbox();
  t::MakeEeprom(0x00, 4);
  EXPECT_EQ(Status({2, 3, 4, 5, 0xFFFFFFFF}), kOn + "DT=OK\n" + kOn + "DT=FAIL\n" + kOn +
                                                  "ST=OK\n" + kOn + "ST=FAIL\n" + kOn +
                                                  "Unknown flag!!\n");
  t::MakeEeprom(0x42, 0);
  EXPECT_EQ(Status({3}), kOff);
  EXPECT_EQ(t::ReadFile(kLog), "DT=OK\nDT=FAIL\nST=OK\nST=FAIL\n");
  fs::remove_all(t::InRoot("/quorvan/spool"));
  EXPECT_EQ(Status({1}), "file[" + kLog + "] open error!!\n");
}

}  // namespace
