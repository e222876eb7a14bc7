// The TPM transport of the platform key manager. It lives in its own object
// so that a test program can link another definition in its place (a socket
// where nothing listens) without a second build of the key manager.
#pragma once

namespace keymgr {

// tpm2-tss TCTI configuration, "name:conf", handed to Tss2_TctiLdr_Initialize.
extern const char kPcpTcti[];

}  // namespace keymgr
