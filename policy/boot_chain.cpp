#include "policy/boot_chain.h"

#include <string_view>
#include <vector>

#include "crypto/hash.h"
#include "policy/pe_image.h"

namespace keymgr::policy {

namespace {

Digest Extended(const Digest& pcr, const Digest& digest) {
  crypto::Sha256 sha;
  (void)sha.Update(pcr.data(), pcr.size());
  (void)sha.Update(digest.data(), digest.size());
  Digest value{};
  (void)sha.Final(value);
  return value;
}

Digest Sha256Of(std::string_view text) {
  return crypto::Sha256Of({reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
}

// ReadBootImage reads an image the firmware loads and measures into PCR 4:
// one it would not start on arm64, or would measure elsewhere (a driver goes
// to PCR 2), is refused.
Status ReadBootImage(std::span<const std::uint8_t> bytes, PeImage* image) {
  if (Status status = ReadPeImage(bytes, image); !status.ok()) {
    return status;
  }
  return image->machine == kPeMachineArm64 && image->subsystem == kPeSubsystemEfiApplication
             ? Status()
             : Refused("not an arm64 EFI application");
}

}  // namespace

Status PredictUkiPcrs(std::span<const std::uint8_t> uki, UkiPcrs* pcrs) {
  PeImage image;
  PeImage kernelImage;
  std::vector<std::uint8_t> kernel;
  if (Status status = ReadBootImage(uki, &image); !status.ok()) {
    return status;
  }
  if (Status status = LoadedSection(image, ".linux", &kernel); !status.ok()) {
    return status;
  }
  if (Status status = ReadBootImage(kernel, &kernelImage); !status.ok()) {
    return status;
  }
  // The separator closes PCRs 0 to 7 when the first image starts.
  constexpr std::uint8_t kSeparator[4] = {};
  Digest pcr = Extended(Digest{}, image.authenticode);
  pcr = Extended(pcr, Sha256Of("Calling EFI Application from Boot Option"));
  pcr = Extended(pcr, crypto::Sha256Of(kSeparator));
  pcrs->bootImages = Extended(pcr, kernelImage.authenticode);
  pcrs->loadOptions = Digest{};
  return Status();
}

}  // namespace keymgr::policy
