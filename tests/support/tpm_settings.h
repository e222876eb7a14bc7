// The TPM connection options of a test program: it links these in place of
// the build's (tpm/options.cpp), so that a test can point the key manager at
// another transport, deadline or seal PCR. Connections opened afterwards take
// them; a connection already held keeps its own.
#pragma once

#include <cstdint>
#include <span>
#include <string>

namespace keymgr::test {

// UseTransport makes connections open |tcti| (a tpm2-tss TCTI configuration;
// "swtpm:" takes the key manager's own transport) with a deadline of
// |deadlineMs| on every command.
void UseTransport(const std::string& tcti, int deadlineMs);
// UseBuildTransport restores the build's transport and deadline.
void UseBuildTransport();
// UseSealPcr makes keys created and opened from then on sealed to the boot
// as a build with KEYMGR_SEAL_TO_VERDICT makes them: following the policies
// that |vendorKey| (an RSA-2048 modulus) signs, with the verdict in PCR
// |pcr|; -1 for plain keys.
void UseSealPcr(int pcr, std::span<const std::uint8_t> vendorKey = {});

}  // namespace keymgr::test
