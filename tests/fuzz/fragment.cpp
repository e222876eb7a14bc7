// The sealed fragment's decoder over any bytes: the ciphertext it accepts
// lies inside the bytes given and fits a fragment, and encoding it again
// gives back the header and ciphertext it was read from.
#include <array>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <span>

#include "platform/fragment.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  namespace tpm = keymgr::tpm;
  const std::span<const std::uint8_t> fragment(data, size);
  std::span<const std::uint8_t> cipher;
  if (!tpm::DecodeFragment(fragment, &cipher).ok()) {
    return 0;
  }
  const std::size_t used = tpm::kFragmentHeaderSize + cipher.size();
  std::array<std::uint8_t, PCP_FRAGMENT_SIZE> again{};
  if (cipher.data() != data + tpm::kFragmentHeaderSize || cipher.empty() ||
      cipher.size() > tpm::kMaxCipherSize || used > size ||
      !tpm::EncodeFragment(cipher, again).ok() || std::memcmp(again.data(), data, used) != 0) {
    std::abort();
  }
  return 0;
}
