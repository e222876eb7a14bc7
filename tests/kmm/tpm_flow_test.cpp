// The module on the suite's swtpm, seen from the bus through a proxy: what
// each flow costs the TPM on either transport and what crosses in clear; a
// TPM that fails each command in turn, that is missing, or whose random
// draws fail; what another process left in it; and the key material that
// release 2.3 made. Every flow flushes what it loaded.
#include <signal.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <kmm/kmm.h>

#include <chrono>
#include <filesystem>

#include "keymgr_build_config.h"
#include "kmm/internal.h"
#include "support/sandbox.h"
#include "support/tpm_bus.h"
#include "support/tpm_settings.h"
#include "util/paths.h"

namespace keymgr::test {
namespace {

namespace fs = std::filesystem;
using Fault = TpmProxy::Fault;

// Manage runs KeyManage(|option|, 1), with what it printed in |out|, and
// expects it to end within one deadline of the TPM's last answer; a run that
// hangs is ended by the alarm.
const KeyContext* Manage(int option, std::string* out) {
  const auto start = std::chrono::steady_clock::now();
  const KeyContext* context = nullptr;
  alarm(10);
  *out = Output([&] { context = KeyManage(option, 1); });
  alarm(0);
  EXPECT_LT(std::chrono::steady_clock::now() - start,
            std::chrono::milliseconds(2 * kDeadlineMs + 1000))
      << *out;
  return context;
}

// Each test starts from an empty sandbox and a blank EEPROM with SFE_003 on.
class TpmFlow : public testing::Test {
 protected:
  void SetUp() override { ResetDevice(0x42, 4); }
  TpmClean clean_;
};
template <class Row>
class TpmFlowRows : public TpmFlow, public testing::WithParamInterface<Row> {};

// Each flow on the key manager's own transport and on tpm2-tss's through
// its loader, without and with a persistent SRK: few commands, one
// asymmetric operation at boot, and no secret in clear on the bus.
struct Transport {
  const char* name;
  const char* module;
  bool srk;
};
using Flows = TpmFlowRows<Transport>;
TEST_P(Flows, CostLittleAndKeepSecretsOffTheBus) {
  const Transport& row = GetParam();
  auto keep = clean_.keep;
  keep.erase("0x81000001");
  EvictAllBut(keep);
  OnProxy bus(row.module);
  ASSERT_TRUE(!row.srk || KmmPersistSrk() == 0);
  ASSERT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);  // a key to replace
  const auto before = PersistentHandles();
  bus.proxy.Arm(Fault::kNone, 0);
  std::string out = Output([] {
    EXPECT_GE(KmmSeedRandom(), 0);  // as a host does before regenerating
    EXPECT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);
  });
  EXPECT_NE(out.find("Successed to delete ID/PWD in TPM."), std::string::npos) << out;
  EXPECT_EQ(TpmLeftovers(), "");
  const Cost regeneration = CostOf(bus.proxy.Sent());
  EXPECT_LE(regeneration.commands, 16);
  EXPECT_EQ(std::tie(regeneration.primaries, regeneration.rsaKeys, regeneration.rsaEncrypts),
            std::tuple(row.srk ? 0 : 1, 1, 0));
  std::string traffic = bus.proxy.Traffic();
  bus.proxy.Arm(Fault::kNone, 0);
  const KeyContext* context = KeyManage(KMM_OPTION_NORMAL_BOOT, 1);
  ASSERT_NE(context, nullptr);
  const Cost boot = CostOf(bus.proxy.Sent());
  EXPECT_LE(boot.commands, 3);
  EXPECT_EQ(boot.asymmetric, 1);
  traffic += bus.proxy.Traffic();

  const std::string pwd = *ReadFile(kKeyPwdPath), sealed = *ReadFile(kStoredOokPath);
  // The ciphertext crosses as it is, so the search works.
  EXPECT_NE(traffic.find(sealed.substr(12, 256)), std::string::npos);
  for (const std::string& secret : {OneOffKey(context), pwd, KeyAuth(pwd)}) {
    EXPECT_EQ(traffic.find(secret), std::string::npos);
  }
  EXPECT_EQ(PersistentHandles().size(), before.size()) << "a regeneration replaces its key";
}
const Transport kTransports[] = {
    {"own transport", "swtpm", false},
    {"own transport, persistent SRK", "swtpm", true},
    {"tpm2-tss loader", "libtss2-tcti-swtpm.so.0", false},
    {"tpm2-tss loader, persistent SRK", "libtss2-tcti-swtpm.so.0", true},
};
INSTANTIATE_TEST_SUITE_P(Rows, Flows, testing::ValuesIn(kTransports), RowName());

// A TPM that leaves a command unanswered, answers it with an error code, or
// hangs up on it, at every command of a regeneration or of a boot: each run
// ends within one deadline of the TPM's last answer with the module's lines,
// and a clean regeneration afterwards leaves exactly one key of this system.
// An error answer leaves the module its connection: it flushes what it
// loaded, unless the error answered the flush.
struct FaultRow {
  const char* name;
  Fault fault;
  int option;
  int first = 1, last = 99;  // the commands to fail
};
using FailedCommands = TpmFlowRows<FaultRow>;
TEST_P(FailedCommands, EndInTimeAndLeaveOneKey) {
  const FaultRow& row = GetParam();
  std::string out;
  OnProxy bus;
  ASSERT_GE(KmmSeedRandom(), 0);  // seeded once, so each flow sends the same commands
  ASSERT_NE(Manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;
  for (int nth = row.first; nth <= row.last; ++nth) {
    SCOPED_TRACE(testing::Message() << "command " << nth);
    bus.proxy.Arm(row.fault, nth);
    const KeyContext* context = Manage(row.option, &out);
    const auto sent = bus.proxy.Sent();
    const bool reached = static_cast<int>(sent.size()) >= nth;
    bus.proxy.Arm(Fault::kNone, 0);
    EXPECT_EQ(context == nullptr,
              out.ends_with(row.option == KMM_OPTION_REGENERATE ? "Regenerate Key Error!!\n"
                                                                : "DT=FAIL\nNormal Boot Error!!\n"))
        << out;
    if (row.fault == Fault::kError && (!reached || sent[nth - 1].code != 0x165)) {
      EXPECT_EQ(TpmLeftovers(), "") << "not a refused TPM2_FlushContext";
    }
    // What the TPM did for a command whose answer never came stays loaded.
    FlushTpm();
    if (row.option == KMM_OPTION_REGENERATE) {
      // A deadline of its own: key generation may outlast the short one.
      bus.Deadline(30000);
      ASSERT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);
      bus.Deadline(kDeadlineMs);
      EXPECT_EQ(PersistentHandles().size(), clean_.keep.size() + 1) << "one key of its own";
    }
    if (!reached) {
      EXPECT_NE(context, nullptr) << out;
      break;
    }
  }
}
const FaultRow kFaults[] = {
    // clang-format off
    {"regeneration unanswered at its first 8 commands", Fault::kWithhold, KMM_OPTION_REGENERATE, 1, 8},
    {"regeneration unanswered at a later command", Fault::kWithhold, KMM_OPTION_REGENERATE, 9},
    {"regeneration answered with an error", Fault::kError, KMM_OPTION_REGENERATE},
    {"regeneration hung up on", Fault::kHangUp, KMM_OPTION_REGENERATE},
    {"boot unanswered", Fault::kWithhold, KMM_OPTION_NORMAL_BOOT},
    {"boot answered with an error", Fault::kError, KMM_OPTION_NORMAL_BOOT},
    {"boot hung up on", Fault::kHangUp, KMM_OPTION_NORMAL_BOOT},
    // clang-format on
};
INSTANTIATE_TEST_SUITE_P(Rows, FailedCommands, testing::ValuesIn(kFaults), RowName());

// With no TPM at all every call fails at once and quietly. What a killed
// process leaves in a TPM with no resource manager (three objects fill it,
// and a session) does not stop a regeneration, which flushes it; nor do
// random draws that all fail, and no store key is then sealed under the
// built-in initial one-off key.
TEST_F(TpmFlow, AMissingFullOrDrawlessTpm) {
  UseTransport("swtpm:path=" KEYMGR_ROOT "/run/nobody.sock", kDeadlineMs);
  testing::internal::CaptureStderr();
  std::string out;
  EXPECT_EQ(Manage(KMM_OPTION_REGENERATE, &out), nullptr);
  EXPECT_NE(out.find("Failed to create OOK.\n"), std::string::npos) << out;
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
  UseBuildTransport();
  for (const char* object : {"/run/left1", "/run/left2", "/run/left3"}) {
    ASSERT_EQ(Tpm2({"tpm2_createprimary", "-C", "o", "-c", InRoot(object)}).status, 0);
  }
  ASSERT_EQ(Tpm2({"tpm2_startauthsession", "-S", InRoot("/run/left.session")}).status, 0);
  OnProxy bus;
  bus.proxy.Arm(Fault::kError, 0, 0x17B);  // every TPM2_GetRandom
  ASSERT_NE(Manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;
  bus.proxy.Arm(Fault::kNone, 0);
  ASSERT_NE(Manage(KMM_OPTION_NORMAL_BOOT, &out), nullptr) << out;
  const auto& initial = kmm::kInitialOneOffKey;
  EXPECT_EQ(out.find(Hex({reinterpret_cast<const char*>(initial.data()), 8})), std::string::npos)
      << out;
}

// Key material that release 2.3 made, in that release's TPM (data/release-2.3,
// HOW.md there tells how): this build proves it at boot and unseals the same
// one-off key. A build that changed a constant or a format would lock every
// device out.
TEST(Release23, KeyMaterialIsProvedAtBoot) {
  ResetSandbox();
  const std::string data = KEYMGR_TEST_SOURCE_DIR "/tests/kmm/data/release-2.3/";
  const std::string state = InRoot("/run/release-2.3"), socket = state + "/tpm.sock";
  fs::remove_all(state);
  WriteFile(state + "/tpm2-00.permall", *ReadFile(data + "tpm2-00.permall"));
  WriteFile(KEYMGR_EEPROM_PATH, *ReadFile(data + "eeprom.img"));
  for (const std::string path : {kKeyIdPath, kKeyPwdPath, kStoredOokPath, kScDigestPath}) {
    WriteFile(path, *ReadFile(data + fs::path(path).filename().string()));
  }
  WriteFile(kBootLogPath, "BN=OK\n");
  ASSERT_EQ(test::Run({"swtpm", "socket", "--tpm2", "--server", "type=unixio,path=" + socket,
                       "--tpmstate", "dir=" + state, "--flags", "not-need-init,startup-clear",
                       "--pid", "file=" + state + "/pid", "--daemon"})
                .status,
            0);
  UseTransport("swtpm:path=" + socket, 10000);
  const KeyContext* context = nullptr;
  const std::string out = Output([&] { context = KeyManage(KMM_OPTION_NORMAL_BOOT, 1); });
  UseBuildTransport();
  if (const int pid = std::stoi(ReadFile(state + "/pid").value_or("0")); pid > 0) {
    kill(pid, SIGTERM);
  }
  EXPECT_NE(context, nullptr) << out;
  EXPECT_EQ(ReadFile(kBootLogPath), "BN=OK\nDT=OK\n") << out;
  std::string ook = *ReadFile(data + "one_off_key.txt");
  ook.pop_back();  // its newline
  EXPECT_NE(out.find("one_off_key: print_array: size[32] " + ook + " "), std::string::npos) << out;
}

}  // namespace
}  // namespace keymgr::test
