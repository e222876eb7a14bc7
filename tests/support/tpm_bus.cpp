#include "support/tpm_bus.h"

#include <cstring>
#include <filesystem>

#include "crypto/dtc.h"
#include "support/tpm_settings.h"

namespace keymgr::test {

const std::string kSwtpm = std::string(KEYMGR_TCTI).substr(std::strlen("swtpm:path="));
namespace {
const std::string kProxy = KEYMGR_ROOT "/run/proxy.sock";
}  // namespace

// tpm2-tss's own transport also opens the simulator's control socket.
OnProxy::OnProxy(const std::string& module)
    : proxy(kProxy, kSwtpm), tcti(module + ":path=" + kProxy) {
  std::filesystem::remove(kProxy + ".ctrl");
  std::filesystem::create_symlink(kSwtpm + ".ctrl", kProxy + ".ctrl");
  Deadline(kDeadlineMs);
}

void OnProxy::Deadline(int ms) const {
  UseTransport(tcti, ms);
}

OnProxy::~OnProxy() {
  UseBuildTransport();
}

Cost CostOf(const std::vector<TpmProxy::Command>& sent) {
  Cost cost;
  for (const auto& [code, handle] : sent) {
    const bool primary = code == 0x131, key = code == 0x153 || code == 0x191;
    const bool salted = code == 0x176 && handle != 0x40000007;  // TPM2_StartAuthSession
    ++cost.commands;
    cost.asymmetric += primary || key || salted || code == 0x159 || code == 0x174;
    cost.primaries += primary;
    cost.rsaKeys += key;
    cost.rsaEncrypts += code == 0x174;
  }
  return cost;
}

std::string OneOffKey(const KeyContext* context) {
  std::string ook;
  for (std::uint32_t i = 0; i < 32; ++i) {
    ook += static_cast<char>(ProtectedKey_ByteAt(context->oneOffKeyRef, i));
  }
  return ook;
}

}  // namespace keymgr::test
