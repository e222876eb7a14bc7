// The boot verdict measured into the TPM, in a build with KEYMGR_MEASURE_PCR.
#pragma once

#include "verdict/verdict.h"

namespace keymgr::cli {

// MeasureVerdict extends PCR |pcr| with the digest of |verdict| and starts
// the event log anew with the record of that one event. A failed extend
// leaves the log empty and is named with KEYMGR_DEBUG; it changes nothing
// else.
void MeasureVerdict(unsigned pcr, verdict::Verdict verdict);

}  // namespace keymgr::cli
