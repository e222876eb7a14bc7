// The boot status lines that follow the BN line, over a real EEPROM image.
#include "bootlog/boot_status.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "support/sandbox.h"
#include "util/paths.h"

namespace keymgr::test {
namespace {

std::string Status(std::initializer_list<unsigned int> codes) {
  return Output([&] {
    for (unsigned int code : codes) {
      WriteBootStatus(code);
    }
  });
}

TEST(BootStatusTest, LaterLinesAreAppendedOnlyWithSfe003) {
  const std::string on = "SFE_003 - [4]\n";
  ResetDevice(0x00, 4);
  EXPECT_EQ(Status({2, 3, 4, 5, 0xFFFFFFFF}), on + "DT=OK\n" + on + "DT=FAIL\n" + on + "ST=OK\n" +
                                                  on + "ST=FAIL\n" + on + "Unknown flag!!\n");
  MakeEeprom(0x42, 0);
  EXPECT_EQ(Status({3}), "SFE_003 - [0]\n");
  EXPECT_EQ(ReadFile(kBootLogPath), "DT=OK\nDT=FAIL\nST=OK\nST=FAIL\n");
  std::filesystem::remove_all(InRoot("/quorvan/spool"));
  EXPECT_EQ(Status({1}), std::string("file[") + kBootLogPath + "] open error!!\n");
}

}  // namespace
}  // namespace keymgr::test
