// kmm-host and keymgr end to end: a real EEPROM image, the real crypto
// services and the real key manager on the suite's swtpm. Each run is a new
// process, as at boot.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <map>
#include <regex>
#include <utility>

#include "keymgr_build_config.h"
#include "support/sandbox.h"
#include "util/paths.h"

namespace keymgr::test {
namespace {

namespace fs = std::filesystem;

const std::string K = KEYMGR_TEST_KEYMGR_BIN, H = KEYMGR_TEST_KMM_HOST_BIN;
const std::string kOn = "SFE_003 - [4]\n", kDtFail = kOn + "DT=FAIL\nNormal Boot Error!!\n";
// A log left by an earlier boot, longer than a line that replaces it.
const std::string kOld = "OLD " + std::string(40, '.') + "\n";

// Each test starts from an empty sandbox and a blank EEPROM with SFE_003 on
// (so that boots log their DT line), evicts the TPM keys it made, and leaves
// no transient object or session in the TPM.
class KmmHostE2e : public testing::Test {
 protected:
  void SetUp() override { ResetDevice(0xFF, 4); }
  const TpmClean clean_;
};

// Regenerated under umask 000, the key material is private, each file synced,
// renamed into place and its folder synced, in order, as keymgr hash replaces
// the digest file. A boot proves it; with a password that the TPM refuses it
// fails, and on request the failing TPM call is named on standard error,
// once, standard output staying as it is.
// (The tamperings, a link planted at a key file among them, are the hostile
// files' rows; the log lines, the flow tests'.)
TEST_F(KmmHostE2e, RegenerationIsProvedAtBootAndAWrongPasswordFails) {
  EXPECT_EQ(SyncTrace({"sh", "-c", "umask 0 && exec \"$@\"", "sh", H, "3"}),
            "F L R:keymgr.cs D F L R:keymgr.hddkeyid D F L R:keymgr.hddpwd D F L R:keymgr.ook D ");
  WriteFile(kManifestPath, kKeyIdPath);
  EXPECT_EQ(SyncTrace({K, "hash"}), "F L R:keymgr.cb D ");
  for (const char* path : {kKeyIdPath, kKeyPwdPath, kStoredOokPath, kScDigestPath}) {
    struct stat st {};
    ASSERT_EQ(lstat(path, &st), 0) << path;
    EXPECT_EQ(st.st_mode, S_IFREG | 0600) << path;
  }
  EXPECT_EQ(test::Run({H, "1", "1"}).status, 0);
  WriteFile(kKeyPwdPath, std::string(20, 'Z'));
  const RunResult quiet = test::Run({H, "1"}), told = test::Run({"env", "KEYMGR_DEBUG=1", H, "1"});
  static const std::regex kClock(" (Start|End) KMM : .*\n");
  EXPECT_EQ(std::regex_replace(told.out, kClock, ""), std::regex_replace(quiet.out, kClock, ""));
  EXPECT_EQ(quiet.err, "");
  EXPECT_TRUE(std::regex_search(told.err, std::regex("^keymgr: Esys_RSA_Decrypt failed: tpm:")))
      << told.err;
}

// A FIFO, a folder, a link to /dev/zero and a dangling link at each fixed
// path: every run ends by itself at once, with the exit status, lines and log
// of a file that cannot be opened. A file the programs replace is replaced
// whatever stands at its path, except a folder, which fails that step.
struct Kind {
  const char* name;
  int error;  // what a read of it fails with
  void (*plant)(const std::string& path);
};
const std::string kGone = InRoot("/gone");
class HostileFiles : public KmmHostE2e, public testing::WithParamInterface<Kind> {};
TEST_P(HostileFiles, FailLikeUnopenableOnes) {
  const Kind& kind = GetParam();
  WriteFile(InRoot("/d/a"), "a");
  WriteFile(kManifestPath, InRoot("/d/a") + "\n");
  WriteFile(kDmsetupPath, *ReadFile(KEYMGR_TEST_SOURCE_DIR "/tests/kmm/data/dmsetup"));
  ASSERT_EQ(test::Run({H, "dmsetup"}).status, 0);  // test builds expect the sample tool
  ASSERT_EQ(test::Run({K, "hash"}).status, 0);
  std::map<std::string, std::string> healthy = {{kBootLogPath, kOld}};
  const auto restore = [&] {
    for (const auto& [path, bytes] : healthy) {
      fs::remove_all(path);
      WriteFile(path, bytes);
    }
  };
  const auto snapshot = [&] {
    for (const char* path : {KEYMGR_EEPROM_PATH, kManifestPath, kDigestFilePath, kKeyIdPath,
                             kKeyPwdPath, kStoredOokPath, kScDigestPath, kDmsetupPath}) {
      healthy[path] = *ReadFile(path);
    }
  };
  ASSERT_EQ(test::Run({H, "3"}).status, 0);
  snapshot();

  const bool folder = kind.error == EISDIR;
  const std::string e = std::to_string(kind.error);
  // A key file that cannot be replaced fails the regeneration at its step.
  const auto written = [&](const char* name) {
    return folder ? std::string("Failed to open ") + name + "\nGenerate Store Key Error!!!\n"
                  : std::string("Successed to open ") + name + "\n";
  };
  const struct {
    const char* name;
    std::string path;
    std::vector<std::string> args;
    int status;
    std::string out, log;  // |out| appears in the output; |log| is the log after
  } rows[] = {
      // clang-format off
      {"manifest", kManifestPath, {K}, 1, kOn + kManifestPath + " open error!!!\nBN=FAIL\n", "BN=FAIL\n"},
      {"digest file", kDigestFilePath, {K}, 1, kOn + kDigestFilePath + " open error!!!\nBN=FAIL\n", "BN=FAIL\n"},
      {"digest file rebuilt", kDigestFilePath, {K, "hash"}, 0, folder ? kDigestFilePath + std::string(" open error!!!\n") : "", kOld},
      {"EEPROM image", KEYMGR_EEPROM_PATH, {K}, 0, "Read Error [-" + e + "] - SFE CONF from EEPROM !!!\n", kOld},
      {"EEPROM image written", KEYMGR_EEPROM_PATH, {H, "3"}, 1, "Write error - Message Digest to EEPROM !!!\n", kOld},
      {"key identity", kKeyIdPath, {H, "1", "1"}, 1, "=\n\nVKT_DTC_AES_Init Failed.\nDecrypt Store Key Error!!\n" + kDtFail, kOld + "DT=FAIL\n"},
      {"key identity written", kKeyIdPath, {H, "3"}, folder ? 1 : 0, written("keymgr.hddkeyid"), kOld},
      {"key password", kKeyPwdPath, {H, "1", "1"}, 1, "Failed to decrypt OOK.\n", kOld + "DT=FAIL\n"},
      {"key password written", kKeyPwdPath, {H, "3"}, folder ? 1 : 0, written("keymgr.hddpwd"), kOld},
      {"sealed one-off key", kStoredOokPath, {H, "1", "1"}, 1, "Failed to open keymgr.ook\nDecrypt Store Key Error!!\n" + kDtFail, kOld + "DT=FAIL\n"},
      {"sealed one-off key written", kStoredOokPath, {H, "3"}, folder ? 1 : 0, written("keymgr.ook"), kOld},
      {"SC digest copy", kScDigestPath, {H, "1", "1"}, 1, kScDigestPath + std::string(" open error!!!\nGet Message Digest Error from HDD!!\n") + kDtFail, kOld + "DT=FAIL\n"},
      {"SC digest copy written", kScDigestPath, {H, "3"}, 0, (folder ? kScDigestPath + std::string(" open error!!!\n") : "") + "SC Digest is created!!\n", kOld},
      {"disk-mapper tool", kDmsetupPath, {H, "dmsetup"}, 1, std::string("file[") + kDmsetupPath + (kind.error == ENOENT ? "] status error : " : "] open error : ") + e + "\n", kOld},
      // clang-format on
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(std::string("at the ") + row.name);
    restore();
    fs::remove(row.path);
    kind.plant(row.path);
    std::vector<std::string> args = {"timeout", "10"};
    args.insert(args.end(), row.args.begin(), row.args.end());
    const RunResult run = test::Run(args);
    EXPECT_EQ(run.status, row.status) << run.out;
    EXPECT_NE(run.out.find(row.out), std::string::npos) << run.out;
    EXPECT_EQ(ReadFile(kBootLogPath), row.log);
    // Replaced, or left as it was; nothing is written through a link.
    const bool writes = row.args.back() == "hash" || row.args.back() == "3";
    EXPECT_EQ(fs::is_regular_file(fs::symlink_status(row.path)),
              writes && !folder && row.path != KEYMGR_EEPROM_PATH);
    EXPECT_FALSE(fs::exists(kGone));
    // A regeneration that went through is the healthy state from now on.
    if (row.args.back() == "3" && (run.status != 0 || folder)) {
      restore();
      ASSERT_EQ(test::Run({H, "3"}).status, 0);
    }
    if (row.args.back() == "3") {
      snapshot();
    }
  }
}
const Kind kKinds[] = {
    {"FIFO", EINVAL, [](const std::string& p) { mkfifo(p.c_str(), 0600); }},
    {"folder", EISDIR, [](const std::string& p) { fs::create_directory(p); }},
    {"link to dev zero", EINVAL, [](const std::string& p) { fs::create_symlink("/dev/zero", p); }},
    {"dangling link", ENOENT, [](const std::string& p) { fs::create_symlink(kGone, p); }},
};
INSTANTIATE_TEST_SUITE_P(Rows, HostileFiles, testing::ValuesIn(kKinds), RowName());

// The boot status log's folder may be writable by other accounts. A link,
// another name of a file, or a special file planted at the log's path is
// never opened for writing (a FIFO not even with a reader waiting), its
// target is left as it was, and the run ends as with a log that cannot be
// opened.
TEST_F(KmmHostE2e, BootLogIsNeverWrittenThroughALinkOrASpecialFile) {
  // No key yet: the boot proof fails at once, with its DT line.
  WriteFile(kManifestPath, "");
  WriteFile(kDigestFilePath, "");
  const std::string target = InRoot("/outside"), trace = InRoot("/trace");
  int reader = -1;
  const std::pair<const char*, std::function<void()>> kinds[] = {
      {"link to a file", [&] { fs::create_symlink(target, kBootLogPath); }},
      {"second name of a file", [&] { fs::create_hard_link(target, kBootLogPath); }},
      {"FIFO with a reader",
       [&] {
         mkfifo(kBootLogPath, 0600);
         reader = open(kBootLogPath, O_RDONLY | O_NONBLOCK);
       }},
      {"folder", [] { fs::create_directory(kBootLogPath); }},
  };
  const std::string openError = std::string("file[") + kBootLogPath + "] open error!!\n";
  const std::regex written(
      R"re((keymgr\.log|outside|/dev/null|/proc/self/fd/\d+)", O_(WRONLY|RDWR)[^=]*= \d)re");
  for (const auto& [kind, plant] : kinds) {
    for (const auto& [program, status] :
         {std::pair<std::vector<std::string>, int>{{K}, 0}, {{H, "1", "1"}, 1}}) {
      SCOPED_TRACE(std::string(kind) + " for " + program[0]);
      fs::remove_all(kBootLogPath);
      WriteFile(target, "another file\n");
      plant();
      const RunResult run = test::Run(Traced({"-o", trace, "-e", "trace=%file"}, program));
      close(std::exchange(reader, -1));
      EXPECT_EQ(run.status, status) << run.out;
      EXPECT_NE(run.out.find(openError), std::string::npos) << run.out;
      EXPECT_EQ(ReadFile(target), "another file\n");
      EXPECT_FALSE(std::regex_search(ReadFile(trace).value_or(""), written)) << *ReadFile(trace);
    }
  }
}

}  // namespace
}  // namespace keymgr::test
