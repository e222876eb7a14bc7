// The PE reader over any bytes, as a UKI and as the kernel inside one: it
// reads nothing outside them (ASan), and an image it takes has its sections'
// raw data inside them.
#include <cstdint>
#include <span>
#include <vector>

#include "policy/boot_chain.h"
#include "policy/pe_image.h"
#include "support/files.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  namespace policy = keymgr::policy;
  using keymgr::test::Require;
  const std::span<const std::uint8_t> bytes(data, size);
  policy::PeImage image;
  if (policy::ReadPeImage(bytes, &image).ok()) {
    for (std::size_t i = 0; i < image.sectionCount; ++i) {
      const policy::PeSection& section = image.sections.at(i);
      Require(section.rawSize == 0 || std::uint64_t{section.rawOffset} + section.rawSize <= size);
    }
    std::vector<std::uint8_t> kernel;
    (void)policy::LoadedSection(image, ".linux", &kernel);
  }
  policy::UkiPcrs pcrs;
  (void)policy::PredictUkiPcrs(bytes, &pcrs);
  return 0;
}
