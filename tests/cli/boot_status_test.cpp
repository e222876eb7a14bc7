#include "cli/boot_status.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;

const std::string kLog = t::InRoot("/quorvan/spool/log/keymgr.log");

template <typename F>
std::string Output(F call) {
  testing::internal::CaptureStdout();
  call();
  std::fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

TEST(BootStatusTest, CheckSecurityFeatureTestsOnlyBitTwoOfTheLowByte) {
  struct Case {
    std::uint32_t word;
    unsigned int result;
    std::string line;
  };
  for (const Case& c : std::vector<Case>{{4, 1, "SFE_003 - [4]\n"},
                                         {0xFFFFFFFF, 1, "SFE_003 - [4]\n"},
                                         {0, 0, "SFE_003 - [0]\n"},
                                         {0xFFFFFFFB, 0, "SFE_003 - [0]\n"},
                                         {0x04040400, 0, "SFE_003 - [0]\n"}}) {
    t::ResetSandbox();
    t::MakeEeprom(0x00, c.word);
    unsigned int result = 9;
    EXPECT_EQ(Output([&] { result = CheckSecurityFeature(); }), c.line) << c.word;
    EXPECT_EQ(result, c.result) << c.word;
  }
  std::filesystem::remove(KEYMGR_EEPROM_PATH);
  unsigned int result = 9;
  EXPECT_EQ(Output([&] { result = CheckSecurityFeature(); }),
            "Read Error [-2] - SFE CONF from EEPROM !!!\n");
  EXPECT_EQ(result, 0u);
}

TEST(BootStatusTest, WriteBootStatusStartsOrAppendsTheLog) {
  const std::optional<std::string> kNone;
  const std::string kOn = "SFE_003 - [4]\n";
  const std::string kOff = "SFE_003 - [0]\n";
  struct Case {
    unsigned int code;
    std::uint32_t sfe;
    std::optional<std::string> before;
    std::string out;
    std::optional<std::string> after;
  };
  for (const Case& c : std::vector<Case>{
           {0, 0, "BN=FAIL\nDT=OK\n", "BN=OK\n", "BN=OK\n"},
           {1, 0, kNone, "BN=FAIL\n", "BN=FAIL\n"},
           {1, 4, "BN=OK\nDT=OK\n", "BN=FAIL\n", "BN=FAIL\n"},
           {2, 0, "BN=OK\n", kOff, "BN=OK\n"},
           {2, 4, "BN=OK\n", kOn + "DT=OK\n", "BN=OK\nDT=OK\n"},
           {3, 4, kNone, kOn + "DT=FAIL\n", "DT=FAIL\n"},
           {4, 4, "BN=OK\n", kOn + "ST=OK\n", "BN=OK\nST=OK\n"},
           {5, 4, "BN=OK\n", kOn + "ST=FAIL\n", "BN=OK\nST=FAIL\n"},
           {6, 4, "BN=OK\n", kOn + "Unknown flag!!\n", "BN=OK\n"},
           {9, 4, kNone, kOn + "Unknown flag!!\n", ""},
           {0xFFFFFFFF, 4, "BN=OK\n", kOn + "Unknown flag!!\n", "BN=OK\n"},
           {9, 0, kNone, kOff, kNone},
       }) {
    t::ResetSandbox();
    t::MakeEeprom(0x00, c.sfe);
    if (c.before) {
      t::WriteFile(kLog, *c.before);
    }
    EXPECT_EQ(Output([&] { WriteBootStatus(c.code); }), c.out) << c.code;
    EXPECT_EQ(t::ReadFile(kLog), c.after) << c.code;
  }

  // Without the log directory the line is lost; the SFE read error drops DT lines.
  t::ResetSandbox();
  t::MakeEeprom(0x00, 4);
  std::filesystem::remove_all(t::InRoot("/quorvan/spool"));
  const std::string openError = "file[" + kLog + "] open error!!\n";
  EXPECT_EQ(Output([] { WriteBootStatus(1); }), openError);
  EXPECT_EQ(Output([] { WriteBootStatus(3); }), kOn + openError);
  t::ResetSandbox();
  t::WriteFile(kLog, "BN=OK\n");
  EXPECT_EQ(Output([] { WriteBootStatus(2); }), "Read Error [-2] - SFE CONF from EEPROM !!!\n");
  EXPECT_EQ(t::ReadFile(kLog), "BN=OK\n");
}

}  // namespace
