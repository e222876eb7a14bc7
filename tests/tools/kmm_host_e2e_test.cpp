// kmm-host end to end: a real EEPROM image, the real crypto services and the
// real key manager on the suite's swtpm. Each run is a new process, as at
// boot.
#include <gtest/gtest.h>

#include <filesystem>
#include <functional>
#include <regex>
#include <set>

#include "keymgr_build_config.h"
#include "support/sandbox.h"
#include "util/paths.h"

namespace keymgr::test {
namespace {

namespace fs = std::filesystem;
using Bytes = std::vector<std::uint8_t>;

const std::string kFail = "DT=FAIL\nNormal Boot Error!!\n";

RunResult Host(const std::vector<std::string>& args) {
  std::vector<std::string> argv{KEYMGR_TEST_KMM_HOST_BIN};
  argv.insert(argv.end(), args.begin(), args.end());
  return test::Run(argv);
}

// PersistentHandles lists the TPM's persistent handles.
std::set<std::string> PersistentHandles() {
  RunResult r = test::Run({KEYMGR_TEST_TPM2_GETCAP, "handles-persistent", "-T", KEYMGR_TCTI});
  EXPECT_EQ(r.status, 0) << r.err;
  std::set<std::string> handles;
  static const std::regex kHandle("0x8[0-9a-fA-F]{7}");
  for (std::sregex_iterator it(r.out.begin(), r.out.end(), kHandle), end; it != end; ++it) {
    handles.insert(it->str());
  }
  return handles;
}

std::set<std::string> Minus(const std::set<std::string>& a, const std::set<std::string>& b) {
  std::set<std::string> d;
  for (const auto& h : a) {
    if (b.count(h) == 0) {
      d.insert(h);
    }
  }
  return d;
}

std::string File(const char* path) {
  return ReadFile(path).value_or("<missing>");
}

TEST(KmmHostE2e, RegenerationIsProvedAtBootAndEveryTamperingFails) {
  ResetSandbox();
  ASSERT_EQ(test::Run({KEYMGR_TEST_EEPROM_BIN, "init"}).status, 0);
  ASSERT_EQ(test::Run({KEYMGR_TEST_EEPROM_BIN, "write", "4958", "04000000"}).status, 0);
  const auto before = PersistentHandles();

  RunResult r = Host({"3"});
  ASSERT_EQ(r.status, 0) << r.out;
  EXPECT_EQ(r.out,
            "Seed Key is created!!\nSecret Key is created!!\nSC Digest is created!!\n"
            "Successed to generate one_off_key by TPM.\nSuccessed to generate user_name_hex.\n"
            "Successed to generate user_pass_hex.\nSuccessed to create OOK.\n"
            "Successed to encrypt Stored-OOK.\nSuccessed to open keymgr.hddkeyid\n"
            "Successed to open keymgr.hddpwd\nSuccessed to open keymgr.ook\n"
            "ST Key is encrypted!!\n");
  const Bytes storeKey = ReadEepromBytes(4244, 48), digest = ReadEepromBytes(32256, 32);
  EXPECT_NE(storeKey, Bytes(48, 0xFF));
  EXPECT_EQ(File(kScDigestPath), std::string(digest.begin(), digest.end()));
  EXPECT_EQ(File(kKeyIdPath).size(), 20u);
  EXPECT_EQ(File(kKeyPwdPath).size(), 20u);
  EXPECT_EQ(File(kStoredOokPath).size(), 284u);
  const auto firstKey = Minus(PersistentHandles(), before);
  EXPECT_EQ(firstKey.size(), 1u);

  WriteFile(kBootLogPath, "BN=OK\n");
  r = Host({"1", "1"});
  EXPECT_EQ(r.status, 0) << r.out;
  EXPECT_NE(r.out.find("Successed to decrypt OOK.\n"), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("SC Digest Test Success [EEPROM]!!\nSC Digest Test Success [HDD]!!\n"
                       "SFE_003 - [4]\nDT=OK\n\n====="),
            std::string::npos)
      << r.out;
  EXPECT_EQ(File(kBootLogPath), "BN=OK\nDT=OK\n");

  // Each tampering fails the boot with its own message, then is undone.
  const std::string pwd = File(kKeyPwdPath), ook = File(kStoredOokPath);
  const std::string values = "Read Store Key but values are error [Retry:";
  struct Case {
    std::function<void()> tamper;
    std::function<void()> undo;
    std::string expect;
  } cases[] = {
      {[&] { WriteEepromBytes(32256 + 5, {static_cast<std::uint8_t>(digest[5] ^ 1)}); },
       [&] { WriteEepromBytes(32256, digest); }, "SC Digest Test Fail [EEPROM]!!\n"},
      {[&] { WriteFile(kScDigestPath, std::string(32, 'x')); },
       [&] { WriteFile(kScDigestPath, std::string(digest.begin(), digest.end())); },
       "SC Digest Test Success [EEPROM]!!\nSC Digest Test Fail [HDD]!!\n"},
      {[&] { WriteEepromBytes(4244 + 20, {static_cast<std::uint8_t>(storeKey[20] ^ 0x40)}); },
       [&] { WriteEepromBytes(4244, storeKey); }, "SC Digest Test Fail [EEPROM]!!\n"},
      {[&] { WriteEepromBytes(4244, Bytes(48, 0xFF)); }, [&] { WriteEepromBytes(4244, storeKey); },
       values + "2]!!!\n" + values + "1]!!!\n" + values + "0]!!!\n"},
      {[&] { fs::remove(kStoredOokPath); }, [&] { WriteFile(kStoredOokPath, ook); },
       "Failed to open keymgr.ook\nDecrypt Store Key Error!!\n"},
      // A wrong password cannot open the one-off key; the digest then fails.
      {[&] { WriteFile(kKeyPwdPath, std::string(20, '\x5A')); },
       [&] { WriteFile(kKeyPwdPath, pwd); }, "Failed to decrypt OOK.\n"},
  };
  std::string log = "BN=OK\nDT=OK\n";
  for (const Case& c : cases) {
    SCOPED_TRACE(c.expect);
    c.tamper();
    r = Host({"1", "1"});
    c.undo();
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.out.find(c.expect), std::string::npos) << r.out;
    EXPECT_EQ(r.out.substr(r.out.size() - kFail.size()), kFail);
    log += "DT=FAIL\n";
    EXPECT_EQ(File(kBootLogPath), log);
  }

  // A second regeneration replaces the TPM key, and the new material proves.
  r = Host({"3"});
  EXPECT_EQ(r.status, 0) << r.out;
  EXPECT_NE(r.out.find("SC Digest is created!!\nSuccessed to delete ID/PWD in TPM.\n"),
            std::string::npos)
      << r.out;
  const auto now = PersistentHandles();
  const auto secondKey = Minus(now, before);
  EXPECT_EQ(secondKey.size(), 1u);
  EXPECT_NE(secondKey, firstKey);
  r = Host({"1", "1"});
  EXPECT_EQ(r.status, 0) << r.out;
  EXPECT_EQ(File(kBootLogPath), log + "DT=OK\n");

  for (const auto& handle : secondKey) {
    test::Run({KEYMGR_TEST_TPM2_EVICTCONTROL, "-C", "o", "-c", handle, "-T", KEYMGR_TCTI});
  }
  EXPECT_TRUE(Minus(PersistentHandles(), before).empty());
}

}  // namespace
}  // namespace keymgr::test
