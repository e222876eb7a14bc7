#include "policy/pe_image.h"

#include <algorithm>
#include <cstring>

#include "crypto/hash.h"

namespace keymgr::policy {

namespace {

// Offsets in the headers: the DOS header's pointer to the PE signature, then
// from the COFF header, the optional header (PE32+) and a section header.
constexpr std::size_t kPeOffset = 0x3C;
constexpr std::size_t kCoffSize = 20;
constexpr std::size_t kCoffSections = 2;
constexpr std::size_t kCoffOptionalSize = 16;
constexpr std::uint16_t kPe32PlusMagic = 0x20B;
constexpr std::size_t kOptFileAlignment = 36;
constexpr std::size_t kOptSizeOfHeaders = 60;
constexpr std::size_t kOptCheckSum = 64;
constexpr std::size_t kOptSubsystem = 68;
constexpr std::size_t kOptDirectoryCount = 108;
constexpr std::size_t kOptDirectories = 112;
constexpr std::uint32_t kMaxDirectories = 16;
constexpr std::uint64_t kDirectorySize = 8;
constexpr std::uint32_t kCertificateDirectory = 4;
constexpr std::size_t kSectionHeaderSize = 40;
// A certificate table holds at least one WIN_CERTIFICATE header.
constexpr std::uint32_t kMinCertificateSize = 8;

std::uint16_t Little16(std::span<const std::uint8_t> bytes, std::uint64_t at) {
  return static_cast<std::uint16_t>(bytes[at] | bytes[at + 1] << 8);
}
std::uint32_t Little32(std::span<const std::uint8_t> bytes, std::uint64_t at) {
  return static_cast<std::uint32_t>(Little16(bytes, at) | Little16(bytes, at + 2) << 16);
}

// A stretch of the file that the digest covers, [begin, end).
struct Region {
  std::uint64_t begin = 0;
  std::uint64_t end = 0;
};

// Regions lists what the firmware hashes: three pieces of headers, each
// section and what follows them.
struct Regions {
  std::array<Region, kMaxPeSections + 4> list{};
  std::size_t count = 0;
  void Add(std::uint64_t begin, std::uint64_t end) { list.at(count++) = Region{begin, end}; }
};

// HashRegions hashes |regions| of |bytes| in file order, zeros standing for
// bytes past the end. The firmware adds each region only when it overlaps
// none added before and reads a region past its buffer unchecked: here any
// overlap, or a region past |limit|, refuses the image.
Status HashRegions(std::span<const std::uint8_t> bytes, Regions& regions, std::uint64_t limit,
                   Digest* digest) {
  const std::span<Region> list(regions.list.data(), regions.count);
  std::sort(list.begin(), list.end(), [](const Region& a, const Region& b) {
    return a.begin != b.begin ? a.begin < b.begin : a.end < b.end;
  });
  crypto::Sha256 sha;
  std::uint64_t done = 0;
  for (const Region& region : list) {
    if (region.begin < done || region.end > limit) {
      return Refused("PE image whose hashed regions overlap or pass its end");
    }
    // Only the padding, less than 8 bytes, lies past the file.
    const std::uint64_t inFile = std::clamp<std::uint64_t>(bytes.size(), region.begin, region.end);
    static constexpr std::array<std::uint8_t, 8> kZeros{};
    if (inFile > region.begin) {
      (void)sha.Update(bytes.data() + region.begin, inFile - region.begin);
    }
    (void)sha.Update(kZeros.data(), region.end - inFile);
    done = region.end;
  }
  return sha.Final(*digest);
}

// ReadSections reads the section table at |table|, refusing raw data past the
// file and sections that overlap in memory, where the loader would lay one
// over another.
Status ReadSections(std::span<const std::uint8_t> bytes, std::uint64_t table, PeImage* image) {
  std::array<Region, kMaxPeSections> memory{};
  for (std::size_t i = 0; i < image->sectionCount; ++i) {
    const std::uint64_t at = table + i * kSectionHeaderSize;
    PeSection& section = image->sections.at(i);
    std::memcpy(section.name.data(), bytes.data() + at, section.name.size());
    section.virtualSize = Little32(bytes, at + 8);
    section.virtualAddress = Little32(bytes, at + 12);
    section.rawSize = Little32(bytes, at + 16);
    section.rawOffset = Little32(bytes, at + 20);
    if (section.rawSize != 0 && std::uint64_t{section.rawOffset} + section.rawSize > bytes.size()) {
      return Refused("PE section past the end of the file");
    }
    // The loader gives a section of no VirtualSize its raw size.
    const std::uint32_t inMemory = section.virtualSize != 0 ? section.virtualSize : section.rawSize;
    memory[i].begin = section.virtualAddress;
    memory[i].end = memory[i].begin + inMemory;
  }
  const std::span<Region> ranges(memory.data(), image->sectionCount);
  std::sort(ranges.begin(), ranges.end(),
            [](const Region& a, const Region& b) { return a.begin < b.begin; });
  for (std::size_t i = 1; i < ranges.size(); ++i) {
    if (ranges[i].begin < ranges[i - 1].end) {
      return Refused("PE sections that overlap in memory");
    }
  }
  return Status();
}

}  // namespace

Status ReadPeImage(std::span<const std::uint8_t> bytes, PeImage* image) {
  *image = PeImage{};
  image->bytes = bytes;
  const std::uint64_t size = bytes.size();
  if (size < kPeOffset + 4 || bytes[0] != 'M' || bytes[1] != 'Z') {
    return Refused("not a PE image");
  }
  const std::uint64_t pe = Little32(bytes, kPeOffset);
  const std::uint64_t coff = pe + 4;
  const std::uint64_t opt = coff + kCoffSize;
  if (opt + kOptDirectories > size || std::memcmp(bytes.data() + pe, "PE\0\0", 4) != 0 ||
      Little16(bytes, opt) != kPe32PlusMagic) {
    return Refused("not a PE32+ image");
  }
  image->machine = Little16(bytes, coff);
  image->subsystem = Little16(bytes, opt + kOptSubsystem);
  image->sectionCount = Little16(bytes, coff + kCoffSections);
  const std::uint32_t directories = Little32(bytes, opt + kOptDirectoryCount);
  const std::uint64_t optSize = Little16(bytes, coff + kCoffOptionalSize);
  const std::uint64_t table = opt + optSize;
  const std::uint64_t headers = Little32(bytes, opt + kOptSizeOfHeaders);
  const std::uint32_t alignment = Little32(bytes, opt + kOptFileAlignment);
  if (directories > kMaxDirectories || optSize < kOptDirectories + kDirectorySize * directories ||
      image->sectionCount > kMaxPeSections ||
      table + image->sectionCount * kSectionHeaderSize > headers || headers > size ||
      alignment == 0 || (alignment & (alignment - 1)) != 0) {
    return Refused("PE headers out of bounds");
  }
  if (Status status = ReadSections(bytes, table, image); !status.ok()) {
    return status;
  }

  Regions regions;
  const std::uint64_t checkSum = opt + kOptCheckSum;
  const std::uint64_t certEntry = opt + kOptDirectories + kDirectorySize * kCertificateDirectory;
  std::uint32_t certSize = 0;
  regions.Add(0, checkSum);
  if (directories > kCertificateDirectory) {
    regions.Add(checkSum + 4, certEntry);
    regions.Add(certEntry + kDirectorySize, headers);
    certSize = Little32(bytes, certEntry + 4);
  } else {
    regions.Add(checkSum + 4, headers);
  }
  // The firmware hashes a copy padded with zeros to a multiple of 8 bytes.
  const std::uint64_t padded = (size + 7) / 8 * 8;
  if (certSize != 0 && (certSize < kMinCertificateSize ||
                        Little32(bytes, certEntry) + std::uint64_t{certSize} > padded)) {
    return Refused("PE certificate table out of bounds");
  }
  std::uint64_t hashed = headers;
  for (std::size_t i = 0; i < image->sectionCount; ++i) {
    const PeSection& section = image->sections.at(i);
    if (section.rawSize != 0) {
      const std::uint64_t length =
          (std::uint64_t{section.rawSize} + alignment - 1) & ~std::uint64_t{alignment - 1};
      regions.Add(section.rawOffset, section.rawOffset + length);
      hashed += length;
    }
  }
  // What follows counts from the sections' total size, not from where the
  // last of them ends; the certificate table is taken off the end.
  if (hashed + certSize < padded) {
    regions.Add(hashed, padded - certSize);
  }
  return HashRegions(bytes, regions, padded, &image->authenticode);
}

Status LoadedSection(const PeImage& image, std::string_view name,
                     std::vector<std::uint8_t>* bytes) {
  const PeSection* found = nullptr;
  for (std::size_t i = 0; i < image.sectionCount; ++i) {
    const PeSection& section = image.sections.at(i);
    if (name.size() <= section.name.size() &&
        std::memcmp(section.name.data(), name.data(), name.size()) == 0) {
      if (found != nullptr) {
        return Refused("PE image with two sections of that name");
      }
      found = &section;
    }
  }
  if (found == nullptr) {
    return Refused("PE section missing");
  }
  // None of the stub's sections is larger in memory than the whole file; a
  // header that says so would only make this allocate.
  if (found->virtualSize > image.bytes.size()) {
    return Refused("PE section larger than its file");
  }
  bytes->assign(found->virtualSize, 0);
  const std::uint32_t raw = std::min(found->virtualSize, found->rawSize);
  if (raw != 0) {
    std::memcpy(bytes->data(), image.bytes.data() + found->rawOffset, raw);
  }
  return Status();
}

}  // namespace keymgr::policy
