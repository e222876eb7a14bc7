#include "tpm/fragment.h"

#include <algorithm>
#include <cstring>

#include "util/endian.h"

namespace keymgr::tpm {

namespace {

constexpr std::uint8_t kTag[4] = {'P', 'C', 'P', 'F'};
constexpr std::uint32_t kVersion = 1;

}  // namespace

Status EncodeFragment(std::span<const std::uint8_t> cipher,
                      std::span<std::uint8_t, PCP_FRAGMENT_SIZE> out) {
  if (cipher.empty() || cipher.size() > kMaxCipherSize) {
    return Refused("fragment size");
  }
  std::fill(out.begin(), out.end(), 0);
  std::memcpy(out.data(), kTag, sizeof(kTag));
  StoreBig32(out.data() + 4, kVersion);
  StoreBig32(out.data() + 8, static_cast<std::uint32_t>(cipher.size()));
  std::memcpy(out.data() + kFragmentHeaderSize, cipher.data(), cipher.size());
  return Status();
}

Status DecodeFragment(std::span<const std::uint8_t> fragment,
                      std::span<const std::uint8_t>* cipher) {
  if (fragment.size() < kFragmentHeaderSize ||
      std::memcmp(fragment.data(), kTag, sizeof(kTag)) != 0 ||
      LoadBig32(fragment.data() + 4) != kVersion) {
    return Refused("fragment header");
  }
  const std::uint32_t size = LoadBig32(fragment.data() + 8);
  if (size == 0 || size > kMaxCipherSize || size > fragment.size() - kFragmentHeaderSize) {
    return Refused("fragment size");
  }
  *cipher = fragment.subspan(kFragmentHeaderSize, size);
  return Status();
}

}  // namespace keymgr::tpm
