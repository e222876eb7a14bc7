// A TPM that leaves a command unanswered, answers it with an error code, or
// hangs up on it, at every command of a regeneration and of a boot: each run
// ends within the deadline's bound with the module's lines, and a clean
// regeneration afterwards leaves exactly one key of this system. A TPM whose
// every random draw fails never gets a store key sealed under a constant.
#include <gtest/gtest.h>
#include <kmm/kmm.h>

#include <chrono>
#include <regex>

#include "keymgr_build_config.h"
#include "kmm/internal.h"
#include "platform/pcp_tcti.h"
#include "support/sandbox.h"
#include "support/tpm_proxy.h"

#define FAULT_DIR KEYMGR_ROOT "/fault"
const char keymgr::kPcpTcti[] = "swtpm:path=" FAULT_DIR "/proxy.sock";
const int keymgr::kPcpDeadlineMs = 1500;

namespace keymgr::test {
namespace {

const std::string kFixture = KEYMGR_TEST_SOURCE_DIR "/scripts/swtpm-fixture.sh";
const std::string kTpm = "swtpm:path=" FAULT_DIR "/tpm/swtpm.sock";

// Manage runs KeyManage with its output captured, and says how long it took.
KeyContext* Manage(int option, std::string* out, std::chrono::milliseconds* took = nullptr) {
  const auto start = std::chrono::steady_clock::now();
  testing::internal::CaptureStdout();
  KeyContext* context = KeyManage(option, 1);
  *out = testing::internal::GetCapturedStdout();
  if (took != nullptr) {
    *took = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() -
                                                                  start);
  }
  return context;
}

// OwnKeys counts the persistent keys in the owner range past the SRK's.
int OwnKeys() {
  const std::string handles = test::Run({"tpm2_getcap", "handles-persistent", "-T", kTpm}).out;
  const std::regex own("0x81(?!000001)[0-7][0-9a-fA-F]{5}");
  return static_cast<int>(std::distance(std::sregex_iterator(handles.begin(), handles.end(), own),
                                        std::sregex_iterator()));
}

TEST(KmmTpmFaults, EveryCommandFailedEndsInTimeAndLeavesOneKey) {
  ResetSandbox();
  MakeEeprom(0x42, 4);
  ASSERT_EQ(test::Run({kFixture, "start", kTpm}).status, 0);
  TpmProxy proxy(FAULT_DIR "/proxy.sock", FAULT_DIR "/tpm/swtpm.sock");
  ASSERT_GE(KmmSeedRandom(), 0);  // seeded once, so each flow sends the same commands
  std::string out;
  ASSERT_NE(Manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;

  // One deadline for the command left unanswered, and nothing sent after it.
  const auto bound = std::chrono::milliseconds(2 * kPcpDeadlineMs + 1000);
  using Fault = TpmProxy::Fault;
  for (Fault fault : {Fault::kWithhold, Fault::kError, Fault::kHangUp}) {
    for (int option : {KMM_OPTION_REGENERATE, KMM_OPTION_NORMAL_BOOT}) {
      for (int nth = 1;; ++nth) {
        SCOPED_TRACE(testing::Message() << "fault " << static_cast<int>(fault) << " option "
                                        << option << " command " << nth);
        proxy.Arm(fault, nth);
        std::chrono::milliseconds took{};
        const KeyContext* context = Manage(option, &out, &took);
        const bool reached = proxy.Commands() >= nth;
        proxy.Arm(Fault::kNone, 0);
        EXPECT_LT(took, bound) << out;
        EXPECT_EQ(context == nullptr,
                  out.ends_with(option == KMM_OPTION_REGENERATE ? "Regenerate Key Error!!\n"
                                                                : "DT=FAIL\nNormal Boot Error!!\n"))
            << out;
        if (option == KMM_OPTION_REGENERATE) {
          ASSERT_NE(Manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;
          EXPECT_EQ(OwnKeys(), 1);
        }
        if (!reached) {
          EXPECT_NE(context, nullptr) << out;
          break;
        }
      }
    }
  }

  // Every random draw refused: the kernel's bytes seal the store key, never
  // the built-in initial one-off key.
  proxy.Arm(Fault::kError, 0, 0x17B);  // TPM2_GetRandom
  ASSERT_NE(Manage(KMM_OPTION_REGENERATE, &out), nullptr) << out;
  proxy.Arm(Fault::kNone, 0);
  ASSERT_NE(Manage(KMM_OPTION_NORMAL_BOOT, &out), nullptr) << out;
  const auto& initial = kmm::kInitialOneOffKey;
  EXPECT_EQ(out.find("size[32] " + Hex({reinterpret_cast<const char*>(initial.data()), 8})),
            std::string::npos)
      << out;
  test::Run({kFixture, "stop", kTpm});
}

}  // namespace
}  // namespace keymgr::test
