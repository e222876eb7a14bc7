#include "cli/measure.h"

#include <array>
#include <span>

#include "keymgr_build_config.h"
#include "policy/file.h"
#include "tpm/chain.h"
#include "util/debug_print.h"
#include "util/hex.h"
#include "util/paths.h"
#include "util/status.h"
#include "verdict/event_file.h"

namespace keymgr::cli {

namespace {

// The vendor key of a sealed program, whose signed policies move the
// counter there; other programs move it with the good verdict alone.
#ifdef KEYMGR_PROGRAM_VENDOR_MODULUS
constexpr std::optional<std::array<std::uint8_t, 256>> kVendorKey =
    HexBytes<256>(KEYMGR_PROGRAM_VENDOR_MODULUS);
static_assert(kVendorKey.has_value(), "KEYMGR_PROGRAM_VENDOR_MODULUS must be 512 hex digits");
std::span<const std::uint8_t> VendorKey() {
  return *kVendorKey;
}
#else
std::span<const std::uint8_t> VendorKey() {
  return {};
}
#endif

// Connected opens the connection once; false once it failed.
bool Connected(BootTpm& tpm) {
  if (!tpm.opened && !tpm.failed) {
    tpm.opened = true;
    tpm.failed = !tpm::Connect(tpm.connection, tpm::BuildOptions()).ok();
  }
  return !tpm.failed && !tpm.connection.broken;
}

#if KEYMGR_SIGNED_BUILD
// RaiseFloor moves the release counter up to the release just checked.
void RaiseFloor(BootTpm& tpm, unsigned pcr, std::uint64_t release) {
  policy::PolicyFile file;
  if (!VendorKey().empty() && !policy::ReadPolicyFile(&file).ok()) {
    return;
  }
  if (!tpm::RaiseReleaseFloor(tpm.connection, VendorKey(), static_cast<int>(pcr), release,
                              VendorKey().empty() ? nullptr : &file)
           .ok()) {
    LogRefused("move of the release counter");
  }
}
#endif

}  // namespace

std::optional<std::uint64_t> ReadReleaseFloor(BootTpm& tpm, unsigned pcr) {
  std::uint64_t floor = 0;
  if (!Connected(tpm) ||
      !tpm::ReadReleaseFloor(tpm.connection, VendorKey(), static_cast<int>(pcr), &floor).ok()) {
    DebugPrint("release counter: no TPM to hold it against!!!\n");
    return std::nullopt;
  }
  return floor;
}

bool MeasureVerdict(BootTpm& tpm, unsigned pcr, const integrity::BootCheck& check) {
  std::array<verdict::Event, 2> events = {verdict::VerdictEvent(0, pcr, check.verdict)};
  verdict::Event& measured = events[0];
  if (check.verdict != verdict::Verdict::kNone) {
    measured.manifestSha256 = check.manifestSha256;
    measured.digestsSha256 = check.digestsSha256;
    measured.release = check.release;
  }
  if (!Connected(tpm) || !tpm::ExtendPcr(tpm.connection, pcr, measured.digest).ok()) {
    LogRefused("extend of the boot verdict");
    // A failed extend leaves the log empty: it never claims an event the
    // PCR does not hold.
    (void)verdict::WriteEventLog({});
    return false;
  }
  std::size_t count = 1;
  bool closed = true;
#if KEYMGR_SIGNED_BUILD
  if (check.verdict == verdict::Verdict::kOk && check.release &&
      (!check.floor || *check.floor < *check.release)) {
    RaiseFloor(tpm, pcr, *check.release);
  }
#if !KEYMGR_SEALED_PROGRAM
  // No key proof follows to close the PCR, and a PCR left at the good value
  // would let any later process move the counter.
  events[1] = verdict::SeparatorEvent(1, pcr);
  closed = tpm::ExtendPcr(tpm.connection, pcr, events[1].digest).ok();
  if (closed) {
    count = 2;
  } else {
    LogRefused("extend of the separator");
  }
#endif
#endif
  if (Status status = verdict::WriteEventLog(std::span(events).first(count)); !status.ok()) {
    LogRefused("event log");
  }
  return closed;
}

}  // namespace keymgr::cli
