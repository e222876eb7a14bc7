// The boot status log in process, and end-to-end runs of the built keymgr in
// the sandbox root.
#include "cli/boot_status.h"

#include <sys/stat.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;
using Args = std::vector<std::string>;
using Text = std::optional<std::string>;

const std::string kLog = t::InRoot("/quorvan/spool/log/keymgr.log");
const std::string kDigests = t::InRoot("/quorvan/hidden/keymgr.cb");
const std::string kManifest = t::InRoot("/quorvan/hidden/keymgr.list");
const std::string kOn = "SFE_003 - [4]\n";
const std::string kOff = "SFE_003 - [0]\n";
const std::string kReadError = "Read Error [-2] - SFE CONF from EEPROM !!!\n";

template <typename F>
std::string Output(F call) {
  testing::internal::CaptureStdout();
  call();
  std::fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

TEST(BootStatusTest, WriteBootStatusStartsOrAppendsTheLog) {
  const Text none;
  const std::string kUnknown = kOn + "Unknown flag!!\n";
  struct Case {
    unsigned int code;
    std::uint32_t sfe;
    Text before;
    std::string out;
    Text after;
  } cases[] = {{0, 0, "BN=FAIL\nDT=OK\n", "BN=OK\n", "BN=OK\n"},
               {1, 4, none, "BN=FAIL\n", "BN=FAIL\n"},
               {2, 0, "BN=OK\n", kOff, "BN=OK\n"},
               {2, 4, "BN=OK\n", kOn + "DT=OK\n", "BN=OK\nDT=OK\n"},
               {3, 4, none, kOn + "DT=FAIL\n", "DT=FAIL\n"},
               {4, 4, "X\n", kOn + "ST=OK\n", "X\nST=OK\n"},
               {5, 4, "X\n", kOn + "ST=FAIL\n", "X\nST=FAIL\n"},
               {6, 4, "X\n", kUnknown, "X\n"},
               {0xFFFFFFFF, 4, none, kUnknown, ""},
               {9, 0, none, kOff, none}};
  for (const Case& c : cases) {
    t::ResetSandbox();
    t::MakeEeprom(0x00, c.sfe);
    if (c.before) {
      t::WriteFile(kLog, *c.before);
    }
    EXPECT_EQ(Output([&] { WriteBootStatus(c.code); }), c.out) << c.code;
    EXPECT_EQ(t::ReadFile(kLog), c.after) << c.code;
  }
  t::MakeEeprom(0x00, 4);
  std::filesystem::remove_all(t::InRoot("/quorvan/spool"));
  EXPECT_EQ(Output([] { WriteBootStatus(3); }), kOn + "file[" + kLog + "] open error!!\n");
  std::filesystem::remove(KEYMGR_EEPROM_PATH);
  EXPECT_EQ(Output([] { WriteBootStatus(2); }), kReadError);
}

std::string Data(const std::string& name) {
  return t::InRoot("/data/" + name);
}

t::RunResult Keymgr(Args args) {
  args.insert(args.begin(), KEYMGR_TEST_KEYMGR_BIN);
  return t::Run(args);
}

// Sha asks the sha256sum command, an implementation independent of ours, and
// returns the "%02X " text the program prints.
std::string Sha(const std::string& path) {
  std::string hex = t::Run({"/usr/bin/sha256sum", path}).out, raw;
  for (std::size_t i = 0; i < 64; i += 2) {
    raw += static_cast<char>(std::stoi(hex.substr(i, 2), nullptr, 16));
  }
  return t::Hex(raw);
}

std::string Block(const std::string& name, const std::string& md, const std::string& rd) {
  return "md_sha: " + md + "\nrd_sha: " + rd + "\n[" + Data(name) +
         (md == rd ? "] has integrity!!\n\n" : "] is corrupted!!\n\n");
}

class KeymgrTest : public ::testing::Test {
 protected:
  void SetUp() override {
    t::ResetSandbox();
    t::MakeEeprom(0x42, 0);
    for (const char* name : {"a", "b", "c"}) {
      t::WriteFile(Data(name), std::string("contents of ") + name);
    }
    t::WriteFile(kManifest, Data("a") + "\n" + Data("b") + "\n" + Data("c") + "\n");
    ASSERT_EQ(Keymgr({"hash"}).status, 0);
    t::WriteFile(kLog, "OLD\n");
    a_ = Sha(Data("a")), b_ = Sha(Data("b")), c_ = Sha(Data("c"));
  }
  std::string a_, b_, c_;
};

TEST_F(KeymgrTest, HashBuildsDigestsThatTheVerboseBootRunAccepts) {
  EXPECT_EQ(t::Hex(*t::ReadFile(kDigests)), a_ + b_ + c_);
  auto run = Keymgr({"log"});
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(run.out,
            kOff + Block("a", a_, a_) + Block("b", b_, b_) + Block("c", c_, c_) + "BN=OK\n");
  EXPECT_EQ(t::ReadFile(kLog), "BN=OK\n");
}

TEST_F(KeymgrTest, EitherEepromTestOpensTheGate) {
  struct Case {
    std::uint8_t control;
    std::uint32_t sfe;
    Args args;
    bool runs;
  } cases[] = {{0x42, 0, {}, true},           {0x43, 0, {}, false},
               {0x02, 0, {}, false},          {0x00, 4, {}, true},
               {0x43, 0xFFFFFFFB, {}, false}, {0x00, 0x04040400, {}, false},
               {0x00, 0, {"log"}, false},     {0x42, 0, {"v"}, true},
               {0x42, 0, {"-"}, true},        {0x42, 0, {"has"}, true}};
  for (const Case& c : cases) {
    t::MakeEeprom(c.control, c.sfe);
    t::WriteFile(kLog, "OLD\n");
    auto run = Keymgr(c.args);
    EXPECT_EQ(run.status, 0);
    EXPECT_EQ(run.out, (c.sfe == 4 ? kOn : kOff) + (c.runs ? "BN=OK\n" : ""))
        << int(c.control) << " " << c.args.size();
    EXPECT_EQ(t::ReadFile(kLog), std::string(c.runs ? "BN=OK\n" : "OLD\n")) << int(c.control);
  }
  fs::remove(KEYMGR_EEPROM_PATH);
  t::WriteFile(kLog, "OLD\n");
  auto run = Keymgr({});
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(run.out, kReadError);
  EXPECT_EQ(t::ReadFile(kLog), "OLD\n");
}

TEST_F(KeymgrTest, MaintenanceWordsMatchAsPrefixesAndIgnoreTheGate) {
  t::MakeEeprom(0x00, 0);
  fs::remove(kLog);
  fs::remove(kDigests);
  struct Case {
    Args args;
    std::string out;
  } cases[] = {{{"-vx"}, "Version: 2.3\n"},
               {{"file"}, ""},
               {{"hashes"}, ""},
               {{"filecheck", Data("b"), "x"}, Block("b", b_, b_)}};
  for (const Case& c : cases) {
    auto run = Keymgr(c.args);
    EXPECT_EQ(run.status, 0) << c.args[0];
    EXPECT_EQ(run.out, c.out) << c.args[0];
  }
  EXPECT_EQ(t::Hex(*t::ReadFile(kDigests)), a_ + b_ + c_);
  EXPECT_FALSE(t::Exists(kLog));
}

TEST_F(KeymgrTest, OutcomeGoesToTheLogAndOnlyOpenErrorsToTheStatus) {
  const std::string zeros = t::Hex(std::string(32, '\0')), name(150, 'x');
  struct Case {
    std::function<std::string()> setup;  // returns the expected output
    Args args = {};
    int status = 0;
  } cases[] = {
      {[&] {
         t::WriteFile(Data("b"), "altered");
         return Block("a", a_, a_) + Block("b", Sha(Data("b")), b_) + "BN=FAIL\n";
       },
       {"log"}},
      {[] { return fs::remove(Data("b")), "file[" + Data("b") + "] status error!!\nBN=FAIL\n"; }},
      {[&] {
         fs::resize_file(kDigests, 64);
         return Block("a", a_, a_) + Block("b", b_, b_) + Block("c", c_, zeros) + "BN=FAIL\n";
       },
       {"log"}},
      {[] { return t::WriteFile(kDigests, *t::ReadFile(kDigests) + "junk"), "BN=OK\n"; }},
      {[] { return t::WriteFile(kManifest, " \n\t"), t::WriteFile(kDigests, ""), "BN=OK\n"; }},
      {[] { return fs::remove(kDigests), kDigests + " open error!!!\nBN=FAIL\n"; }, {"log"}, 1},
      {[] { return fs::remove(kManifest), kManifest + " open error!!!\nBN=FAIL\n"; }, {}, 1},
      {[&] {
        t::WriteFile(kManifest, Data("a") + " " + name + " " + Data("c"));
        return "file[" + name.substr(0, 40) + "...] name too long!!\nBN=FAIL\n";
      }},
      {[] {
        mkfifo(Data("fifo").c_str(), 0600);
        t::WriteFile(kManifest, Data("fifo"));
        return "file[" + Data("fifo") + "] open error!!\nBN=FAIL\n";
      }},
      {[] {
        return fs::remove_all(t::InRoot("/quorvan/spool")), "file[" + kLog + "] open error!!\n";
      }},
  };
  for (const Case& c : cases) {
    SetUp();
    std::string out = c.setup();
    auto run = Keymgr(c.args);
    EXPECT_EQ(run.status, c.status) << out;
    EXPECT_EQ(run.out, kOff + out);
    // The log holds the BN line alone, or is lost with its directory.
    auto bn = out.find("BN=");
    EXPECT_EQ(t::ReadFile(kLog),
              bn == std::string::npos ? std::nullopt : std::optional(out.substr(bn)));
  }
}

}  // namespace
