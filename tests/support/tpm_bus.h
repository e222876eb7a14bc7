// The key manager on the suite's swtpm behind a proxy that watches the bus
// and fails commands on cue, and what a flow costs a discrete TPM.
#pragma once

#include <kmm/kmm.h>

#include <string>
#include <vector>

#include "keymgr_build_config.h"
#include "support/tpm_proxy.h"

namespace keymgr::test {

// The suite's swtpm socket, and the deadline of each command on the proxy.
extern const std::string kSwtpm;
constexpr int kDeadlineMs = 1500;

// OnProxy puts a proxy in front of the suite's swtpm and the key manager on
// it, until it goes: through the TCTI |module| ("swtpm", the key manager's
// own transport, or a tpm2-tss module for its loader) at the proxy's socket.
struct OnProxy {
  explicit OnProxy(const std::string& module = "swtpm");
  ~OnProxy();
  // Deadline gives each command |ms| from now on (kDeadlineMs at first).
  void Deadline(int ms) const;
  TpmProxy proxy;
  const std::string tcti;
};

// What a flow costs a discrete TPM: its commands, and the asymmetric
// operations among them (key generation, ECDH for a salted session, RSA).
struct Cost {
  int commands = 0, asymmetric = 0, primaries = 0, rsaKeys = 0, rsaEncrypts = 0;
};
Cost CostOf(const std::vector<TpmProxy::Command>& sent);

// OneOffKey is the one-off key that a boot unsealed into |context|.
std::string OneOffKey(const KeyContext* context);

}  // namespace keymgr::test
