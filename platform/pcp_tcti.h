// The TPM transport of the platform key manager and the deadline of its
// commands. Each lives in an object of its own so that a test program can
// link another definition in its place (a socket where nothing listens, a
// shorter deadline) without a second build of the key manager.
#pragma once

namespace keymgr {

// TCTI configuration, "name:conf": swtpm's socket through this key
// manager's own transport, anything else through Tss2_TctiLdr_Initialize.
extern const char kPcpTcti[];

// Milliseconds a TPM command may take before the call fails.
extern const int kPcpDeadlineMs;

}  // namespace keymgr
