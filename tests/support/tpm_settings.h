// The TPM connection options of a test program: it links these in place of
// the build's (tpm/options.cpp), so that a test can point the key manager at
// another transport, deadline or seal PCR. Connections opened afterwards take
// them; a connection already held keeps its own.
#pragma once

#include <string>

namespace keymgr::test {

// UseTransport makes connections open |tcti| (a tpm2-tss TCTI configuration;
// "swtpm:" takes the key manager's own transport) with a deadline of
// |deadlineMs| on every command.
void UseTransport(const std::string& tcti, int deadlineMs);
// UseBuildTransport restores the build's transport and deadline.
void UseBuildTransport();
// UseSealPcr makes keys created from then on require PCR |pcr| at the good
// boot verdict's value, as a build with KEYMGR_SEAL_TO_VERDICT does; -1 for
// plain keys.
void UseSealPcr(int pcr);

}  // namespace keymgr::test
