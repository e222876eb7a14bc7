// The boot verdict as the TPM measures it: one event per boot run, whose
// digest depends on the verdict alone, so that a good boot gives the same
// PCR value on every device and after every update, and a key can require
// it.
#pragma once

#include <array>
#include <cstdint>

#include "crypto/hash.h"

namespace keymgr::verdict {

enum class Verdict { kOk, kFail, kNone };

using PcrValue = std::array<std::uint8_t, crypto::kSha256Size>;

// VerdictDigest is the SHA-256 of "keymgr boot verdict: " and BN=OK,
// BN=FAIL, or "none" for a run that verified nothing.
PcrValue VerdictDigest(Verdict verdict);

// SeparatorDigest is the SHA-256 of "keymgr boot separator": the event that
// closes the verdict PCR for the rest of a boot.
PcrValue SeparatorDigest();

// Extended is the value of a SHA-256 PCR at |pcr| once extended with
// |digest|.
PcrValue Extended(const PcrValue& pcr, const PcrValue& digest);

// GoodPcrValue is the value of a PCR reset to zeros (PCRs 0-15 at power on)
// extended once with the good verdict's digest.
PcrValue GoodPcrValue();

// VerdictName is the verdict as the event log names it.
const char* VerdictName(Verdict verdict);

}  // namespace keymgr::verdict
