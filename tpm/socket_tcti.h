// A TCTI for a TPM simulator's command socket (swtpm), used for "swtpm:"
// transports in place of tpm2-tss's own, which blocks for ever on a
// simulator that stops answering (its connect and its control channel have
// no timeout) and raises SIGPIPE when the simulator hangs up. Here every
// connect, send and receive has a deadline, sends cannot raise SIGPIPE, and
// the control channel is not used: the simulator's locality is 0 already.
// Private to tpm/.
#pragma once

#include <tss2/tss2_tcti.h>

#include "util/status.h"

namespace keymgr::tpm {

// InitSocketTcti makes a TCTI for |conf| ("path=SOCKET", or
// "host=HOST,port=PORT" for TCP) whose connects, sends and receives each
// take |deadlineMs| at most, sending nothing yet.
Status InitSocketTcti(const char* conf, int deadlineMs, TSS2_TCTI_CONTEXT** tcti);

// IsSocketTcti tells whether |tcti| was made by InitSocketTcti;
// FinalizeSocketTcti closes and frees such a TCTI.
bool IsSocketTcti(TSS2_TCTI_CONTEXT* tcti);
void FinalizeSocketTcti(TSS2_TCTI_CONTEXT* tcti);

}  // namespace keymgr::tpm
