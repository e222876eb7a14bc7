// keymgr: the boot-time integrity check and its maintenance commands.
//   keymgr [log]      verify the manifest files when the EEPROM enables it
//   keymgr hash       rebuild the digest file
//   keymgr file PATH  check one listed file
//   keymgr -v         print the version
// Command words match as prefixes, so "hashes" is "hash" and "-version" is "-v".
#include <cstdint>
#include <cstdio>

#include "bootlog/boot_status.h"
#include "cli/command.h"
#ifdef KEYMGR_MEASURE_PCR
#include "cli/measure.h"
#endif
#include "eeprom/eeprom.h"
#include "eeprom/eeprom_map.h"
#include "integrity/manifest.h"
#include "keymgr_build_config.h"
#include "util/debug_print.h"

namespace {

namespace eeprom = keymgr::eeprom;

#if KEYMGR_SIGNED_BUILD
constexpr bool kSignedBuild = true;
#else
constexpr bool kSignedBuild = false;
#endif

// Verifies tells whether a boot run verifies, from what the control byte and
// the SFE_003 bit say. The EEPROM is writable by whoever the signature keeps
// out: a signed build reads and shows its bits as any build does, and
// verifies whatever they say.
bool Verifies(bool controlled, bool featured) {
  return kSignedBuild || controlled || featured;
}

// Finish flushes what was printed so the boot script's capture is complete
// before the status is seen.
int Finish(int status) {
  (void)std::fflush(stdout);
  return status;
}

bool ControlByteEnablesVerification() {
  std::uint8_t control = 0;
  // A failed read stays silent: it just does not enable verification.
  if (ReadEEPROM(eeprom::kDevice, eeprom::kControlByteOffset, 1, &control) < 0) {
    return false;
  }
  return (control & eeprom::kControlModeMask) == eeprom::kControlModeVerify &&
         (control & eeprom::kControlEnableBit) != 0;
}

}  // namespace

int main(int argc, char** argv) {
  using keymgr::cli::Action;
  const keymgr::cli::Command command = keymgr::cli::ParseCommand(argc, argv);
  switch (command.action) {
    case Action::kHash:
      // Only a signed build's refusal fails the command.
      return Finish(HashManifest() == 2 ? 1 : 0);
    case Action::kFile:
      VerifyManifestFile(command.path);
      return Finish(0);
    case Action::kVersion:
      DebugPrint("Version: %d.%d\n", KEYMGR_VERSION_MAJOR, KEYMGR_VERSION_MINOR);
      return Finish(0);
    case Action::kVerify:
      break;
  }

  const bool controlled = ControlByteEnablesVerification();
  // Always asked, so every gated run shows the SFE_003 line.
  const bool featured = CheckSecurityFeature() != 0;
  const int enabled = Verifies(controlled, featured) ? 1 : 0;
#ifdef KEYMGR_MEASURE_PCR
  keymgr::cli::BootTpm tpm;
  keymgr::integrity::BootCheck check;
  if (kSignedBuild) {
    check.floor = keymgr::cli::ReadReleaseFloor(tpm, KEYMGR_MEASURE_PCR);
  }
  // One verdict a boot run, or that nothing was verified; a run whose
  // verdict did not reach the TPM fails, so that no key proof follows it.
  const int result = enabled == 1 ? VerifyManifestChecked(command.verbose, &check) : 0;
  const bool measured = keymgr::cli::MeasureVerdict(tpm, KEYMGR_MEASURE_PCR, check);
  return Finish(measured ? result : 1);
#else
  if (enabled != 1) {
    return Finish(0);
  }
  return Finish(VerifyManifest(command.verbose));
#endif
}
