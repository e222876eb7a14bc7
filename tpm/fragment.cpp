#include "tpm/fragment.h"

#include <algorithm>
#include <cstring>

namespace keymgr::tpm {

namespace {

constexpr std::uint8_t kTag[4] = {'P', 'C', 'P', 'F'};
constexpr std::uint32_t kVersion = 1;

void PutBigEndian(std::uint8_t* dst, std::uint32_t value) {
  dst[0] = static_cast<std::uint8_t>(value >> 24);
  dst[1] = static_cast<std::uint8_t>(value >> 16);
  dst[2] = static_cast<std::uint8_t>(value >> 8);
  dst[3] = static_cast<std::uint8_t>(value);
}

std::uint32_t GetBigEndian(const std::uint8_t* src) {
  return (std::uint32_t{src[0]} << 24) | (std::uint32_t{src[1]} << 16) |
         (std::uint32_t{src[2]} << 8) | src[3];
}

}  // namespace

Status EncodeFragment(std::span<const std::uint8_t> cipher,
                      std::span<std::uint8_t, PCP_FRAGMENT_SIZE> out) {
  if (cipher.empty() || cipher.size() > kMaxCipherSize) {
    return Refused("fragment size");
  }
  std::fill(out.begin(), out.end(), 0);
  std::memcpy(out.data(), kTag, sizeof(kTag));
  PutBigEndian(out.data() + 4, kVersion);
  PutBigEndian(out.data() + 8, static_cast<std::uint32_t>(cipher.size()));
  std::memcpy(out.data() + kFragmentHeaderSize, cipher.data(), cipher.size());
  return Status();
}

Status DecodeFragment(std::span<const std::uint8_t> fragment,
                      std::span<const std::uint8_t>* cipher) {
  if (fragment.size() < kFragmentHeaderSize ||
      std::memcmp(fragment.data(), kTag, sizeof(kTag)) != 0 ||
      GetBigEndian(fragment.data() + 4) != kVersion) {
    return Refused("fragment header");
  }
  const std::uint32_t size = GetBigEndian(fragment.data() + 8);
  if (size == 0 || size > kMaxCipherSize || size > fragment.size() - kFragmentHeaderSize) {
    return Refused("fragment size");
  }
  *cipher = fragment.subspan(kFragmentHeaderSize, size);
  return Status();
}

}  // namespace keymgr::tpm
