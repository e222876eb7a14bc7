// The module on the suite's swtpm through tpm2-tss's packet-capture
// transport: what each flow costs the TPM, and that tpm2-tools opens what a
// regeneration sealed. Without and with a persistent SRK.
#include <gtest/gtest.h>
#include <kmm/kmm.h>

#include <cstdlib>
#include <regex>

#include "crypto/hash.h"
#include "keymgr_build_config.h"
#include "platform/pcp_tcti.h"
#include "support/sandbox.h"
#include "support/tpm_capture.h"
#include "util/bytes.h"
#include "util/paths.h"

const char keymgr::kPcpTcti[] = "pcap:" KEYMGR_TCTI;

namespace keymgr::test {
namespace {

// Flow runs the host's seeding and one KeyManage with the transport writing
// to a fresh capture, and gives its cost and what the flow printed.
TpmCost Flow(int option, std::string* out) {
  const std::string capture = InRoot("/run/flow.pcap");
  std::remove(capture.c_str());
  setenv("TCTI_PCAP_FILE", capture.c_str(), 1);
  testing::internal::CaptureStdout();
  EXPECT_GE(KmmSeedRandom(), 0);
  EXPECT_NE(KeyManage(option, 1), nullptr);
  *out = testing::internal::GetCapturedStdout();
  return CaptureCost(capture);
}

std::string Persistent() {
  return test::Run({"tpm2_getcap", "handles-persistent", "-T", KEYMGR_TCTI}).out;
}

TEST(KmmTpm, FlowsStayWithinTheirTpmBudgetAndTpmToolsOpenTheSeal) {
  for (bool srk : {false, true}) {
    SCOPED_TRACE(srk ? "persistent SRK" : "no SRK");
    ResetSandbox();
    MakeEeprom(0x42, 4);
    test::Run({"tpm2_evictcontrol", "-C", "o", "-c", "0x81000001", "-T", KEYMGR_TCTI});
    if (srk) {
      ASSERT_EQ(KmmPersistSrk(), 0);
    }
    std::string out;
    Flow(KMM_OPTION_REGENERATE, &out);  // the first has no previous key to delete
    const std::string before = Persistent();
    const TpmCost regeneration = Flow(KMM_OPTION_REGENERATE, &out);
    EXPECT_NE(out.find("Successed to delete ID/PWD in TPM."), std::string::npos) << out;
    EXPECT_LE(regeneration.commands, 16) << regeneration.codes;
    EXPECT_EQ(regeneration.primaries, srk ? 0 : 1) << regeneration.codes;
    EXPECT_EQ(regeneration.rsaKeys, 1) << regeneration.codes;
    EXPECT_EQ(regeneration.rsaEncrypts, 0) << regeneration.codes;
    const TpmCost boot = Flow(KMM_OPTION_NORMAL_BOOT, &out);
    EXPECT_LE(boot.commands, 5) << boot.codes;
    EXPECT_LE(boot.asymmetric, 1) << boot.codes;

    // The key the regeneration made, its password digest and the sealed
    // fragment's ciphertext, as tpm2_rsadecrypt takes them.
    std::smatch key, ook;
    const std::string after = Persistent();
    ASSERT_TRUE(std::regex_search(after, key, std::regex("0x81(?!000001)[0-7][0-9a-fA-F]{5}")))
        << after;
    ASSERT_TRUE(std::regex_search(out, ook, std::regex("size\\[32\\] ((?:[0-9A-F]{2} ){32})")));
    const std::string pwd = *ReadFile(kKeyPwdPath), sealed = *ReadFile(kStoredOokPath);
    char passHex[41];
    ASSERT_EQ(BytesToHex(reinterpret_cast<const std::uint8_t*>(pwd.data()), 20, passHex, 41), 0);
    std::uint8_t passDigest[16];
    (void)Md5OfString(passHex, passDigest);
    std::string auth = "hex:" + Hex({reinterpret_cast<const char*>(passDigest), 16});
    std::erase(auth, ' ');
    const std::string in = InRoot("/run/cipher"), plain = InRoot("/run/plain");
    WriteFile(in, sealed.substr(12, 256));
    const RunResult decrypted = test::Run({"tpm2_rsadecrypt", "-c", key.str(), "-p", auth, "-s",
                                           "oaep", "-o", plain, in, "-T", KEYMGR_TCTI});
    EXPECT_EQ(decrypted.status, 0) << decrypted.err;
    EXPECT_EQ(Hex(ReadFile(plain).value_or("")), ook[1].str());
    EXPECT_EQ(before.size(), after.size()) << "a regeneration replaces its key";
    test::Run({"tpm2_evictcontrol", "-C", "o", "-c", key.str(), "-T", KEYMGR_TCTI});
  }
  test::Run({"tpm2_evictcontrol", "-C", "o", "-c", "0x81000001", "-T", KEYMGR_TCTI});
}

}  // namespace
}  // namespace keymgr::test
