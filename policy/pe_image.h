// A PE32+ image as the boot chain reads it: the firmware's Authenticode
// digest, which it measures when it loads the image, and the sections that
// systemd's EFI stub finds by name. The reader takes hostile bytes: every
// offset and size is checked against the file, and an image that the
// firmware would hash in a way of its own (regions that overlap, read past
// the file or are dropped) is refused rather than guessed at.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>
#include <vector>

#include "policy/digests.h"
#include "util/status.h"

namespace keymgr::policy {

inline constexpr std::uint16_t kPeMachineArm64 = 0xAA64;
inline constexpr std::uint16_t kPeSubsystemEfiApplication = 10;
// The most sections a loader takes (the EFI stub's limit as well).
inline constexpr std::size_t kMaxPeSections = 96;

struct PeSection {
  std::array<char, 8> name{};  // NUL-padded; all 8 bytes when the name fills them
  std::uint32_t virtualSize = 0;
  std::uint32_t virtualAddress = 0;
  std::uint32_t rawSize = 0;
  std::uint32_t rawOffset = 0;
};

struct PeImage {
  std::span<const std::uint8_t> bytes;
  std::uint16_t machine = 0;
  std::uint16_t subsystem = 0;
  std::size_t sectionCount = 0;
  std::array<PeSection, kMaxPeSections> sections{};
  Digest authenticode{};  // SHA-256
};

// ReadPeImage reads the headers and section table of |bytes|, which must
// outlive |image|, and computes the Authenticode SHA-256 the way the
// firmware does: the headers up to SizeOfHeaders less the CheckSum and the
// certificate table's directory entry; each section's raw data, rounded up
// to FileAlignment, in file order; what follows the sections up to the
// certificate table, which is taken to be the file's last bytes. A file whose
// length is not a multiple of 8 is hashed as if zeros made it one.
Status ReadPeImage(std::span<const std::uint8_t> bytes, PeImage* image);

// LoadedSection gives the section whose name begins with |name|, which is
// how the EFI stub matches names, as the loader lays it out in memory:
// VirtualSize bytes, the raw data first and zeros past it. Refused unless
// exactly one section matches, or when it would be larger than the file.
Status LoadedSection(const PeImage& image, std::string_view name, std::vector<std::uint8_t>* bytes);

}  // namespace keymgr::policy
