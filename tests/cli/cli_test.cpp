// End-to-end runs of the built keymgr in the sandbox root.
#include <sys/stat.h>

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <functional>

#include "keymgr_build_config.h"
#include "support/sandbox.h"
#include "util/paths.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;

const std::string kLog = keymgr::kBootLogPath, kDigests = keymgr::kDigestFilePath,
                  kManifest = keymgr::kManifestPath;
const std::string kOn = "SFE_003 - [4]\n", kOff = "SFE_003 - [0]\n";
const std::string a = t::InRoot("/d/a"), b = t::InRoot("/d/b"), c = t::InRoot("/d/c");

std::string Block(const std::string& entry, const std::string& md, const std::string& rd) {
  return "md_sha: " + t::Hex(md) + "\nrd_sha: " + t::Hex(rd) + "\n[" + entry +
         (md == rd ? "] has integrity!!\n\n" : "] is corrupted!!\n\n");
}

// Put writes |bytes| at |path|, or removes it when none are given.
std::function<void()> Put(const std::string& path, std::optional<std::string> bytes = {}) {
  return [=] { bytes ? t::WriteFile(path, *bytes) : void(fs::remove(path)); };
}

// EioOn runs |program| with every read of |path| failing with EIO.
std::vector<std::string> EioOn(const std::string& path, const std::string& program) {
  return t::Traced(
      {"-o", "/dev/null", "-P", path, "-e", "trace=read", "-e", "inject=read:error=EIO"},
      {program});
}

// Every run starts from a (empty), b, and c, a link to a file whose path has
// 99 characters (the most an entry may hold), listed with mixed white space,
// b twice; their records followed by bytes never read; a log left by an
// earlier boot; and an EEPROM whose control byte alone opens the gate.
TEST(KeymgrTest, CommandsGateOutcomeAndExitStatus) {
  const std::string K = KEYMGR_TEST_KEYMGR_BIN, E = t::Sha256(""), B = t::Sha256("b"),
                    Z = t::Sha256("z");
  const std::string l99 = t::InRoot("/" + std::string(98 - t::Root().size(), 'z'));
  const std::string pass = kOff + "BN=OK\n", fail = "BN=FAIL\n", records = E + B + B + Z;
  const std::string first3 = kOff + Block(a, E, E) + Block(b, B, B) + Block(b, B, B);
  const std::string tooLong = "file[" + l99.substr(0, 40) + "...] name too long!!\n";
  const std::string aOpen = kOff + "file[" + a + "] open error!!\n" + fail;
  struct Case {
    const char* name;
    std::vector<std::string> args;
    std::string out;
    std::function<void()> change = [] {};
    int status = 0;
    std::optional<std::string> digests = {};  // what hash leaves; others leave it alone
  } cases[] = {
      // clang-format off
      {"verbose verification by prefix", {K, "logall"}, first3 + Block(c, Z, Z) + "BN=OK\n"},
      {"a word shorter than file", {K, "fil"}, pass},
      {"a lone dash", {K, "-"}, pass},
      {"SFE_003 alone opens the gate", {K, "has"}, kOn + "BN=OK\n", [] { t::MakeEeprom(0x00, 4); }},
      {"mode 3 keeps the gate closed", {K}, kOff, [] { t::MakeEeprom(0x43, 0xFFFFFFFB); }},
      {"the enable bit missing", {K, "log"}, kOff, [] { t::MakeEeprom(0x02, 0); }},
      {"no EEPROM image", {K}, "Read Error [-2] - SFE CONF from EEPROM !!!\n", Put(KEYMGR_EEPROM_PATH)},
      {"version by prefix", {K, "-vx"}, "Version: 2.3\n"},
      {"file without a path", {K, "file"}, ""},
      {"file by prefix", {K, "filecheck", b, "x"}, Block(b, B, B), Put(kDigests, E + B + t::Sha256("x"))},
      {"file by another spelling", {K, "file", "d/b"}, ""},
      {"file of a missing entry", {K, "file", b}, "file[" + b + "] status error!!\n", Put(b)},
      {"file without a digest file", {K, "file", b}, kDigests + " open error!!!\n", Put(kDigests)},
      {"hash by prefix", {K, "hashes"}, "", Put(kDigests), 0, records},
      {"hash stops at a missing entry", {K, "hash"}, "file[" + b + "] status error!!\n", Put(b), 0, E},
      {"hash without a manifest", {K, "hash"}, kManifest + " open error!!!\n", Put(kManifest), 0, ""},
      {"hash stops at an entry too long", {K, "hash"}, tooLong, Put(kManifest, l99 + " " + l99 + "z " + c), 0, Z},
      {"a corrupted entry", {K, "log"}, kOff + Block(a, E, E) + Block(b, t::Sha256("altered"), B) + fail, Put(b, "altered")},
      {"a missing entry", {K}, kOff + "file[" + b + "] status error!!\n" + fail, Put(b)},
      {"a short digest file", {K, "log"}, first3 + Block(c, Z, std::string(32, '\0')) + fail, Put(kDigests, E + B + B)},
      {"an empty manifest", {K}, pass, Put(kManifest, " \n\t")},
      {"no digest file", {K, "log"}, kOff + kDigests + " open error!!!\n" + fail, Put(kDigests), 1},
      {"no manifest", {K}, kOff + kManifest + " open error!!!\n" + fail, Put(kManifest), 1},
      {"an entry too long", {K}, kOff + tooLong + fail, Put(kManifest, l99 + "z")},
      {"a FIFO listed", {K}, aOpen, [] { fs::remove(a); mkfifo(a.c_str(), 0600); }},
      {"a file of 2 GiB", {K}, aOpen, [] { fs::resize_file(a, 1ULL << 31); }},
      {"a file of 4 GiB and a byte", {K}, aOpen, [] { fs::resize_file(a, (1ULL << 32) + 1); }},
      {"an entry with a NUL byte", {K}, kOff + "file[" + a + "] open error!!\n" + fail,
       Put(kManifest, a + std::string("\0x ", 3) + b)},
      {"a manifest that cannot be read", EioOn(kManifest, K), kOff + kManifest + " open error!!!\n" + fail, [] {}, 1},
      {"a digest file that cannot be read", EioOn(kDigests, K), kOff + kDigests + " open error!!!\n" + fail, [] {}, 1},
      // clang-format on
  };
  const auto setUp = [&] {
    t::ResetDevice(0x42, 0);
    t::WriteFile(a, "");
    t::WriteFile(b, "b");
    t::WriteFile(l99, "z");
    fs::create_symlink(l99, c);
    t::WriteFile(kManifest, a + " \t" + b + "\n\n" + b + "\t" + c + "\n");
    t::WriteFile(kDigests, records + "junk");
    t::WriteFile(kLog, "OLD\n");
  };
  for (const Case& k : cases) {
    SCOPED_TRACE(k.name);
    setUp();
    k.change();
    const auto digests = t::ReadFile(kDigests);
    auto run = t::Run(k.args);
    EXPECT_EQ(std::to_string(run.status) + run.out, std::to_string(k.status) + k.out);
    // A BN line starts the log anew; nothing else touches it.
    const auto bn = k.out.find("BN=");
    EXPECT_EQ(t::ReadFile(kLog), bn == std::string::npos ? "OLD\n" : k.out.substr(bn)) << k.out;
    EXPECT_EQ(t::ReadFile(kDigests), k.digests ? k.digests : digests) << k.out;
  }
}

// keymgr hash killed anywhere leaves the old digest file or the new one,
// never a torn or empty one, and the boot after it ends cleanly.
TEST(KeymgrTest, KilledHashLeavesTheOldOrTheNewDigestFile) {
  const std::string K = KEYMGR_TEST_KEYMGR_BIN;
  t::ResetDevice(0x42, 0);
  std::string list;
  for (int i = 0; i < 3000; ++i) {
    list += t::InRoot("/f/" + std::to_string(i)) + "\n";
    t::WriteFile(t::InRoot("/f/" + std::to_string(i)), std::to_string(i));
  }
  t::WriteFile(kManifest, list);
  t::Run({K, "hash"});
  const std::string old = *t::ReadFile(kDigests);
  t::WriteFile(t::InRoot("/f/2999"), "altered");
  // Synced, renamed into place, and the folder synced.
  EXPECT_EQ(t::SyncTrace({K, "hash"}), "F L R:keymgr.cb D ");
  const std::string fresh = *t::ReadFile(kDigests);
  ASSERT_EQ(fresh.size(), old.size());

  std::vector<std::pair<std::string, int>> points = {
      {"fsync", 1}, {"fsync", 2}, {"linkat", 1}, {"renameat", 1}};
  for (int n = 1; n <= 24; n += 3) {
    points.emplace_back("write", n);
  }
  for (int n = 100; n <= 3000; n += 450) {
    points.emplace_back("openat", n);
  }
  for (const auto& [call, n] : points) {
    SCOPED_TRACE(call + std::to_string(n));
    t::WriteFile(kDigests, old);
    EXPECT_TRUE(t::RunKilledAt(call, n, {K, "hash"}));
    for (const auto& entry : fs::directory_iterator(t::InRoot("/quorvan/hidden"))) {
      const std::string name = entry.path().filename(), bytes = *t::ReadFile(entry.path());
      EXPECT_TRUE(name == "keymgr.list" || (name == "keymgr.cb" && bytes == old) || bytes == fresh)
          << name;
    }
    const auto boot = t::Run({K});
    EXPECT_EQ(boot.out, kOff + (*t::ReadFile(kDigests) == fresh ? "BN=OK\n" : "BN=FAIL\n"));
  }
}

// Runs with one hashing thread and with four print, log and leave the same,
// failures included; the boot outcome is also checked on its own, so that a
// fault common to both is caught. Every fifth file spans several reads and
// goes to the workers; the caller hashes the others.
TEST(KeymgrTest, ThreadedRunsMatchOneAtATime) {
  const std::string K = KEYMGR_TEST_KEYMGR_BIN;
  const auto path = [](int i) { return t::InRoot("/h/" + std::to_string(i)); };
  const auto grow = [&](int i) { std::ofstream(path(i), std::ios::app) << "more"; };
  const std::pair<std::string, std::function<void()>> cases[] = {
      {"intact", [] {}},
      {"first corrupted", Put(path(0), "x")},
      {"middle corrupted", Put(path(31), "x")},
      {"last corrupted", Put(path(59), "x")},
      {"missing", Put(path(22))},
      {"large shrinks", [&] { fs::resize_file(path(10), 1000); }},
      {"large grows", [&] { grow(15); }},
      {"small grows", [&] { grow(16); }},
      {"fifo",
       [&] {
         fs::remove(path(25));
         mkfifo(path(25).c_str(), 0600);
       }},
      {"folder",
       [&] {
         fs::remove(path(35));
         fs::create_directory(path(35));
       }},
  };
  for (const auto& [name, change] : cases) {
    SCOPED_TRACE(name);
    t::ResetDevice(0x42, 0);
    std::string list;
    for (int i = 0; i < 60; ++i) {
      t::WriteFile(path(i), std::string(i % 5 == 0 ? 300000 + i : 10 + i, char('a' + i % 26)));
      list += path(i) + "\n";
    }
    t::WriteFile(kManifest, list);
    t::Run({"/usr/bin/env", "KEYMGR_HASH_THREADS=1", K, "hash"});
    change();
    const auto digests = t::ReadFile(kDigests);
    for (const char* command : {"", "log", "hash"}) {
      std::string seen[2];
      for (int threads : {1, 4}) {
        t::WriteFile(kDigests, *digests);
        t::WriteFile(kLog, "OLD\n");
        const auto run =
            t::Run({"/usr/bin/env", "KEYMGR_HASH_THREADS=" + std::to_string(threads), K, command});
        EXPECT_EQ(run.err, "") << command << threads;  // where a sanitizer reports
        seen[threads > 1] = std::to_string(run.status) + run.out + "|" + *t::ReadFile(kLog) + "|" +
                            t::Hex(*t::ReadFile(kDigests));
      }
      EXPECT_EQ(seen[0], seen[1]) << command;
      if (*command != 'h') {
        EXPECT_EQ(t::ReadFile(kLog), name == "intact" ? "BN=OK\n" : "BN=FAIL\n") << command;
      }
    }
  }
}

}  // namespace
