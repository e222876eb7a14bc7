// The boot run's TPM work in a measured build (KEYMGR_MEASURE_PCR): the
// release floor a signed build holds keymgr.sig against, the verdict's
// measurement, the floor's move after a good boot, and the event log.
#pragma once

#include <cstdint>
#include <optional>

#include "integrity/manifest.h"
#include "tpm/connection.h"

namespace keymgr::cli {

// BootTpm is the boot run's one connection to the TPM, opened on first use;
// once it failed, nothing more is sent.
struct BootTpm {
  tpm::Connection connection;
  bool opened = false;
  bool failed = false;
};

// ReadReleaseFloor reads the release counter of a signed build. Without an
// answer from the TPM it says so and gives nothing, and keymgr.sig is then
// taken without a floor.
std::optional<std::uint64_t> ReadReleaseFloor(BootTpm& tpm, unsigned pcr);

// MeasureVerdict extends PCR |pcr| with the verdict of |check| in a salted
// session; after a good boot of a signed build it moves the release counter
// up to the release checked (and a signed build without sealed keys then
// closes the PCR with the separator, since no key proof will); last it
// replaces the event log with the records of what it extended. False when
// the verdict could not be measured: the boot then fails closed. A floor
// that could not be moved is named with KEYMGR_DEBUG, and the next good boot
// moves it.
bool MeasureVerdict(BootTpm& tpm, unsigned pcr, const integrity::BootCheck& check);

}  // namespace keymgr::cli
