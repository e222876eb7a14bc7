// The chain of trust on one connection: the storage key pinned in the
// EEPROM, sessions salted to it, the vendor's signed policies, the release
// counter and the verdict PCR's extends. Measured, signed and sealed builds
// use these; a plain build sends none of them. Private to tpm/.
#pragma once

#include <cstdint>
#include <span>

#include "policy/file.h"
#include "tpm/connection.h"

namespace keymgr::tpm {

// UsePinnedParent makes the storage parent available (UseParent) and holds
// its name against the pin in the EEPROM: a parent of another name, such as
// one that something between this process and the TPM answers with, is
// refused. A blank pin is set to the parent found (the first use pins it);
// an EEPROM that cannot be read pins nothing.
Status UsePinnedParent(Connection& tpm);

// PinParent writes the parent's name to the pin, as a regeneration does.
Status PinParent(Connection& tpm);

// StartSaltedSession starts a session of |type|, salted to the pinned
// parent, with AES-128-CFB parameter encryption; the caller owns it.
Status StartSaltedSession(Connection& tpm, TPM2_SE type, ESYS_TR* session);

// ExtendPcr extends PCR |pcr| with the SHA-256 |digest| in the connection's
// salted HMAC session: a listener learns the digest, but an extend changed
// on its way is refused, and so is an answer that did not come from the TPM.
Status ExtendPcr(Connection& tpm, std::uint32_t pcr, std::span<const std::uint8_t, 32> digest);

// MeetKeyPolicy runs in |session| the policy of a sealed key under the
// connection's vendor key: the PCRs of |file| as they stand, the release
// counter at most |file|'s release, the vendor's approval of both, then the
// key's password.
Status MeetKeyPolicy(Connection& tpm, ESYS_TR session, const policy::PolicyFile& file);

// ReadReleaseFloor reads the release counter into |*floor|: 0 while it was
// never moved. The counter is defined on first use; an index at its handle
// with other attributes or another policy is refused. |vendor| is the
// modulus of the vendor key that authorises the counter's policies, empty
// where the counter's write needs only the good verdict in PCR
// |verdictPcr|.
Status ReadReleaseFloor(Connection& tpm, std::span<const std::uint8_t> vendor, int verdictPcr,
                        std::uint64_t* floor);

// RaiseReleaseFloor moves the release counter up to |release|, one
// TPM2_NV_Increment at a time, never past it: each increment meets the
// counter's write policy (the good verdict in PCR |verdictPcr|, or |file|'s
// approved policy under |vendor|) in a session of its own. A move cut short
// leaves the counter between the two, for the next good boot to go on from.
Status RaiseReleaseFloor(Connection& tpm, std::span<const std::uint8_t> vendor, int verdictPcr,
                         std::uint64_t release, const policy::PolicyFile* file);

}  // namespace keymgr::tpm
