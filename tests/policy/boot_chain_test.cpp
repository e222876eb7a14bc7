// The PE reader and the boot chain's PCRs over data/uki.efi, a small UKI
// made with the tools that make real ones: a stub and a kernel linked by
// lld-link as arm64 EFI applications, the kernel given a 24-byte
// certificate table at its end (as a signed kernel carries one), then
//   aarch64-linux-gnu-objcopy --add-section .osrel=... --add-section
//     .cmdline=... --add-section .linux=kernel.efi (each at its own VMA)
// PCR 4 below was computed independently of this code, by a prediction
// written apart from it; the VM test holds the same prediction against what
// U-Boot measures.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "policy/boot_chain.h"
#include "policy/pe_image.h"
#include "support/files.h"
#include "util/hex.h"

namespace keymgr::policy {
namespace {

using Bytes = std::vector<std::uint8_t>;

Bytes Uki() {
  const std::string text = *test::ReadFile(KEYMGR_TEST_SOURCE_DIR "/tests/policy/data/uki.efi");
  return Bytes(text.begin(), text.end());
}

Digest Authenticode(const Bytes& bytes) {
  PeImage image;
  EXPECT_TRUE(ReadPeImage(bytes, &image).ok());
  return image.authenticode;
}

// Le32 is |value| as PE stores it.
std::string Le32(std::uint32_t value) {
  return {static_cast<char>(value), static_cast<char>(value >> 8), static_cast<char>(value >> 16),
          static_cast<char>(value >> 24)};
}

TEST(BootChain, TheSmallUkiGivesThePrototypesDigests) {
  const Bytes uki = Uki();
  // PCR 4 takes both image digests: the UKI's, and the kernel's, which leaves
  // out its certificate table and the directory entry that points at it.
  UkiPcrs pcrs;
  ASSERT_TRUE(PredictUkiPcrs(uki, &pcrs).ok());
  EXPECT_STREQ(HexText(pcrs.bootImages, HexCase::kLower).data(),
               "513cc4705c822e55680dad553078a59468980f0226be7419add9237879701ec6");
  EXPECT_EQ(pcrs.loadOptions, Digest{});

  // The firmware hashes a copy padded with zeros to a multiple of 8 bytes.
  Bytes odd = uki;
  odd.insert(odd.end(), {'a', 'b', 'c'});
  Bytes padded = odd;
  padded.resize(padded.size() + 5);
  EXPECT_EQ(Authenticode(odd), Authenticode(padded));
}

// Every cut of the file, and every header that would make the firmware hash
// or load it in a way of its own, is refused.
TEST(BootChain, DamagedImagesAreRefused) {
  const Bytes uki = Uki();
  PeImage image;
  for (std::size_t size = 0; size < uki.size(); ++size) {
    ASSERT_FALSE(ReadPeImage(Bytes(uki.begin(), uki.begin() + size), &image).ok()) << size;
  }
  std::uint32_t pe = 0;
  std::memcpy(&pe, uki.data() + 0x3C, 4);
  const std::size_t opt = pe + 24, certEntry = opt + 144;
  // The sections: .text .rdata .osrel .cmdline .linux.
  const auto section = [&](int i) { return opt + 240 + 40 * i; };
  const struct {
    std::size_t at;
    std::string bytes;
    const char* what;
  } damages[] = {
      {certEntry + 4, Le32(4), "a certificate table shorter than its header"},
      {certEntry, Le32(uki.size() - 4) + Le32(8), "a certificate table past the end"},
      {section(3) + 20, Le32(0x800), ".cmdline's raw data over .osrel's"},
      {section(3) + 12, Le32(0x20000), ".cmdline's memory over .osrel's"},
      {section(4) + 16, Le32(0x10000), ".linux's raw data past the end"},
      {opt + 36, Le32(0x300), "a file alignment that is no power of two"},
      {opt + 60, Le32(0x200), "headers that end inside the section table"},
      {section(2), ".linuxx", "a second section whose name begins with .linux"},
      {opt + 68, "\x0b", "a boot service driver, which the firmware measures into PCR 2"},
  };
  for (const auto& damage : damages) {
    Bytes bytes = uki;
    std::copy(damage.bytes.begin(), damage.bytes.end(), bytes.begin() + damage.at);
    UkiPcrs pcrs;
    EXPECT_FALSE(PredictUkiPcrs(bytes, &pcrs).ok()) << damage.what;
  }
}

}  // namespace
}  // namespace keymgr::policy
