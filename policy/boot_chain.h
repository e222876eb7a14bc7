// The PCRs that the boot chain fills while it starts a unified kernel image
// (UKI), predicted on the build host from the image alone. The chain is
// U-Boot 2023.01 as the firmware, then systemd 252's EFI stub with the
// kernel, command line and initrd in its .linux, .cmdline and .initrd
// sections; each event below is one of theirs.
#pragma once

#include <cstdint>
#include <span>

#include "policy/digests.h"
#include "util/status.h"

namespace keymgr::policy {

inline constexpr int kBootImagePcr = 4;
inline constexpr int kLoadOptionsPcr = 12;

struct UkiPcrs {
  // PCR 4: the firmware measures the UKI's Authenticode digest when it loads
  // it, "Calling EFI Application from Boot Option" and the separator when it
  // starts it, then the kernel's Authenticode digest when the stub loads
  // the .linux section as an image of its own.
  Digest bootImages{};
  // PCR 12: the stub measures load options there, which would replace the
  // UKI's command line. The firmware passes none: it stays zero.
  Digest loadOptions{};
};

// PredictUkiPcrs predicts both from the bytes of the UKI. Refused unless the
// UKI and its kernel are arm64 EFI applications that the PE reader takes.
Status PredictUkiPcrs(std::span<const std::uint8_t> uki, UkiPcrs* pcrs);

}  // namespace keymgr::policy
