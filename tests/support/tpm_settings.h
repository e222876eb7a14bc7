// The test-only settings of the platform key manager: which TPM its calls
// open, with what deadline, and the PCR its new keys are sealed to. Tests
// change them only through these.
#pragma once

#include <string>

namespace keymgr::test {

// UseTransport makes the key manager's calls open |tcti| (a tpm2-tss TCTI
// configuration; "swtpm:" is the key manager's own transport) with a
// deadline of |deadlineMs| on every command. A held connection keeps its own.
void UseTransport(const std::string& tcti, int deadlineMs);
// UseBuildTransport goes back to the build's transport and deadline.
void UseBuildTransport();
// UseSealPcr makes the keys created from now on require PCR |pcr| at the
// good boot verdict's value, as a build sealed to the verdict does; -1 makes
// them plain keys again.
void UseSealPcr(int pcr);

}  // namespace keymgr::test
