// End-to-end runs of the built keymgr in the sandbox root.
#include <sys/stat.h>

#include <gtest/gtest.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "keymgr_build_config.h"
#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;

const std::string kLog = t::InRoot("/quorvan/spool/log/keymgr.log");
const std::string kDigests = t::InRoot("/quorvan/hidden/keymgr.cb");
const std::string kManifest = t::InRoot("/quorvan/hidden/keymgr.list");
const std::string kZeros = t::Hex(std::string(32, '\0'));

std::string Data(const std::string& name) {
  return t::InRoot("/data/" + name);
}

t::RunResult Keymgr(std::vector<std::string> args) {
  args.insert(args.begin(), KEYMGR_TEST_KEYMGR_BIN);
  return t::Run(args);
}

// Sha asks the sha256sum command, so the digest file is checked against an
// independent implementation; it returns the "%02X " text the program prints.
std::string Sha(const std::string& path) {
  std::string hex = t::Run({"/usr/bin/sha256sum", path}).out.substr(0, 64);
  std::string raw;
  for (std::size_t i = 0; i < hex.size(); i += 2) {
    raw += static_cast<char>(std::stoi(hex.substr(i, 2), nullptr, 16));
  }
  return t::Hex(raw);
}

std::string Block(const std::string& entry, const std::string& md, const std::string& rd) {
  return "md_sha: " + md + "\nrd_sha: " + rd + "\n[" + entry +
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
    a_ = Sha(Data("a"));
    b_ = Sha(Data("b"));
    c_ = Sha(Data("c"));
  }
  std::string a_, b_, c_;
};

TEST_F(KeymgrTest, HashBuildsDigestsThatTheBootRunAccepts) {
  EXPECT_EQ(t::Hex(*t::ReadFile(kDigests)), a_ + b_ + c_);
  t::WriteFile(kLog, "BN=FAIL\nDT=OK\n");
  auto run = Keymgr({"log"});
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(run.out, "SFE_003 - [0]\n" + Block(Data("a"), a_, a_) + Block(Data("b"), b_, b_) +
                         Block(Data("c"), c_, c_) + "BN=OK\n");
  EXPECT_EQ(t::ReadFile(kLog), "BN=OK\n");
}

TEST_F(KeymgrTest, EitherEepromTestOpensTheGate) {
  struct Case {
    std::uint8_t control;
    std::uint32_t sfe;
    std::vector<std::string> args;
    bool runs;
  };
  for (const Case& c : std::vector<Case>{{0x42, 0, {}, true},
                                         {0xC2, 0, {}, true},
                                         {0x43, 0, {}, false},
                                         {0x02, 0, {}, false},
                                         {0x40, 0, {}, false},
                                         {0x41, 0, {}, false},
                                         {0x00, 4, {}, true},
                                         {0x43, 4, {}, true},
                                         {0x00, 0xFFFFFFFB, {}, false},
                                         {0x00, 0, {"log"}, false},
                                         {0x42, 0, {"v"}, true},
                                         {0x42, 0, {"-"}, true},
                                         {0x42, 0, {"has"}, true},
                                         {0x42, 0, {"other", "words"}, true}}) {
    t::MakeEeprom(c.control, c.sfe);
    t::WriteFile(kLog, "OLD\n");
    auto run = Keymgr(c.args);
    std::string sfe = (c.sfe & 4) != 0 ? "SFE_003 - [4]\n" : "SFE_003 - [0]\n";
    EXPECT_EQ(run.status, 0);
    EXPECT_EQ(run.out, sfe + (c.runs ? "BN=OK\n" : "")) << int(c.control) << " " << c.sfe;
    EXPECT_EQ(t::ReadFile(kLog), std::string(c.runs ? "BN=OK\n" : "OLD\n")) << int(c.control);
  }
  fs::remove(KEYMGR_EEPROM_PATH);
  t::WriteFile(kLog, "OLD\n");
  auto run = Keymgr({});
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(run.out, "Read Error [-2] - SFE CONF from EEPROM !!!\n");
  EXPECT_EQ(t::ReadFile(kLog), "OLD\n");
}

TEST_F(KeymgrTest, MaintenanceWordsMatchAsPrefixesAndIgnoreTheGate) {
  t::MakeEeprom(0x00, 0);
  fs::remove(kDigests);
  struct Case {
    std::vector<std::string> args;
    std::string out;
  };
  for (const Case& c : std::vector<Case>{{{"-v"}, "Version: 2.3\n"},
                                         {{"-vx"}, "Version: 2.3\n"},
                                         {{"-version", "x"}, "Version: 2.3\n"},
                                         {{"file"}, ""},
                                         {{"hashes"}, ""},
                                         {{"filecheck", Data("b"), "x"}, Block(Data("b"), b_, b_)},
                                         {{"file", "data/b"}, ""}}) {
    auto run = Keymgr(c.args);
    EXPECT_EQ(run.status, 0) << c.args[0];
    EXPECT_EQ(run.out, c.out) << c.args[0];
  }
  EXPECT_EQ(t::Hex(*t::ReadFile(kDigests)), a_ + b_ + c_);
  EXPECT_FALSE(t::Exists(kLog));
  // Open failures of hash still end with status 0, leaving an empty digest file.
  fs::remove(kManifest);
  auto run = Keymgr({"hash"});
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(run.out, kManifest + " open error!!!\n");
  EXPECT_EQ(t::ReadFile(kDigests), "");
}

TEST_F(KeymgrTest, FailuresReachTheLogAndOnlyOpenErrorsTheStatus) {
  const std::string longName(150, 'x');
  struct Case {
    std::string name;
    std::function<void()> setup;
    std::vector<std::string> args;
    std::string out;
    std::string log;
    int status;
  };
  std::vector<Case> cases = {
      {"second altered", [] { t::WriteFile(Data("b"), "altered"); }, {"log"}, "", "BN=FAIL\n", 0},
      {"deleted",
       [] { fs::remove(Data("b")); },
       {},
       "file[" + Data("b") + "] status error!!\nBN=FAIL\n",
       "BN=FAIL\n",
       0},
      {"short digests",
       [] { fs::resize_file(kDigests, 64); },
       {"log"},
       Block(Data("a"), a_, a_) + Block(Data("b"), b_, b_) + Block(Data("c"), c_, kZeros) +
           "BN=FAIL\n",
       "BN=FAIL\n",
       0},
      {"extra digest bytes",
       [] { t::WriteFile(kDigests, *t::ReadFile(kDigests) + "junk"); },
       {},
       "BN=OK\n",
       "BN=OK\n",
       0},
      {"empty manifest",
       [] { t::WriteFile(kManifest, " \n\t"), t::WriteFile(kDigests, ""); },
       {},
       "BN=OK\n",
       "BN=OK\n",
       0},
      {"no digest file",
       [] { fs::remove(kDigests); },
       {"log"},
       kDigests + " open error!!!\nBN=FAIL\n",
       "BN=FAIL\n",
       1},
      {"no manifest",
       [] { fs::remove(kManifest); },
       {},
       kManifest + " open error!!!\nBN=FAIL\n",
       "BN=FAIL\n",
       1},
      {"overlong entry",
       [&] { t::WriteFile(kManifest, Data("a") + " " + longName + " " + Data("c")); },
       {},
       "file[" + longName.substr(0, 40) + "...] name too long!!\nBN=FAIL\n",
       "BN=FAIL\n",
       0},
      {"fifo entry",
       [] {
         mkfifo(Data("fifo").c_str(), 0600);
         t::WriteFile(kManifest, Data("fifo"));
       },
       {},
       "file[" + Data("fifo") + "] open error!!\nBN=FAIL\n",
       "BN=FAIL\n",
       0},
  };
  for (Case& c : cases) {
    SetUp();
    t::WriteFile(kLog, "OLD\n");
    c.setup();
    if (c.name == "second altered") {  // its digest is known only now
      c.out = Block(Data("a"), a_, a_) + Block(Data("b"), Sha(Data("b")), b_) + "BN=FAIL\n";
    }
    auto run = Keymgr(c.args);
    EXPECT_EQ(run.status, c.status) << c.name;
    EXPECT_EQ(run.out, "SFE_003 - [0]\n" + c.out) << c.name;
    EXPECT_EQ(t::ReadFile(kLog), c.log) << c.name;
  }

  SetUp();
  fs::remove_all(t::InRoot("/quorvan/spool"));
  auto run = Keymgr({});
  EXPECT_EQ(run.status, 0);
  EXPECT_EQ(run.out, "SFE_003 - [0]\nfile[" + kLog + "] open error!!\n");
}

}  // namespace
