// A TPM that stops answering, one that is killed, and a peer that hangs up at
// once: each fails the boot's TPM call within the command deadline, with the
// module's usual lines, and no signal reaches the process.
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <kmm/kmm.h>

#include <chrono>
#include <thread>

#include "keymgr_build_config.h"
#include "platform/pcp_tcti.h"
#include "support/sandbox.h"

#define FAULT_SOCKET KEYMGR_ROOT "/fault/tpm.sock"
const char keymgr::kPcpTcti[] = "swtpm:path=" FAULT_SOCKET;
const int keymgr::kPcpDeadlineMs = 1000;

namespace keymgr::test {
namespace {

const std::string kFixture = KEYMGR_TEST_SOURCE_DIR "/scripts/swtpm-fixture.sh";

// Boot runs a normal boot that must fail, within a few deadlines.
std::string Boot() {
  const auto start = std::chrono::steady_clock::now();
  testing::internal::CaptureStdout();
  EXPECT_EQ(KeyManage(KMM_OPTION_NORMAL_BOOT, 1), nullptr);
  const std::string out = testing::internal::GetCapturedStdout();
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(4)) << out;
  return out;
}

// HangUp accepts connections at the TPM's socket and closes each at once.
class HangUp {
 public:
  HangUp() : listener_(socket(AF_UNIX, SOCK_STREAM, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", FAULT_SOCKET);
    unlink(FAULT_SOCKET);
    EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
    EXPECT_EQ(listen(listener_, 8), 0);
    thread_ = std::thread([this] {
      for (int peer; (peer = accept(listener_, nullptr, nullptr)) >= 0;) {
        close(peer);
      }
    });
  }
  ~HangUp() {
    shutdown(listener_, SHUT_RDWR);
    thread_.join();
    close(listener_);
  }

 private:
  int listener_;
  std::thread thread_;
};

TEST(KmmTpmFaults, StoppedKilledAndHangingUpTpmsFailTheBootInTime) {
  ResetSandbox();
  MakeEeprom(0x42, 4);
  const std::string tcti = "swtpm:path=" FAULT_SOCKET;
  ASSERT_EQ(test::Run({kFixture, "start", tcti}).status, 0);
  testing::internal::CaptureStdout();
  ASSERT_NE(KeyManage(KMM_OPTION_REGENERATE, 0), nullptr);
  testing::internal::GetCapturedStdout();
  const pid_t tpm = std::stoi(ReadFile(InRoot("/fault/swtpm.pid")).value_or("0"));
  ASSERT_GT(tpm, 0);

  const std::string kFailed = "Failed to decrypt OOK.\n";
  const std::string kEnd = "SFE_003 - [4]\nDT=FAIL\nNormal Boot Error!!\n";
  kill(tpm, SIGSTOP);  // it takes the command and never answers
  std::string out = Boot();
  EXPECT_NE(out.find(kFailed), std::string::npos) << out;
  EXPECT_TRUE(out.ends_with(kEnd)) << out;
  kill(tpm, SIGKILL);
  kill(tpm, SIGCONT);
  for (int i = 0; i < 100 && kill(tpm, 0) == 0; ++i) {
    usleep(10000);
  }
  out = Boot();
  EXPECT_NE(out.find(kFailed), std::string::npos) << "killed: " << out;
  {
    HangUp peer;
    out = Boot();
  }
  EXPECT_NE(out.find(kFailed), std::string::npos) << "hung up: " << out;
  EXPECT_TRUE(out.ends_with(kEnd)) << out;
  test::Run({kFixture, "stop", tcti});
}

}  // namespace
}  // namespace keymgr::test
