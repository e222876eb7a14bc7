// The sealed fragment's codec over any bytes. The encoder takes 1 to
// kMaxCipherSize bytes behind the tag "PCPF", version 1 and the size, zeros
// after them. The ciphertext the decoder accepts lies inside the bytes given
// and fits a fragment, and encoding it again gives back the header and
// ciphertext it was read from.
#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <span>
#include <string>

#include "support/files.h"
#include "tpm/fragment.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  namespace tpm = keymgr::tpm;
  using keymgr::test::Require;
  const std::span<const std::uint8_t> fragment(data, size);
  std::array<std::uint8_t, PCP_FRAGMENT_SIZE> again{};
  const std::size_t n = std::min<std::size_t>(size, tpm::kMaxCipherSize + 1);
  const bool encoded = tpm::EncodeFragment(fragment.first(n), again).ok();
  std::string header("PCPF\0\0\0\1\0\0", 10);
  header += {static_cast<char>(n >> 8), static_cast<char>(n)};
  Require(encoded == (n >= 1 && n <= tpm::kMaxCipherSize));
  Require(!encoded || (std::memcmp(again.data(), header.data(), header.size()) == 0 &&
                       std::all_of(again.begin() + header.size() + n, again.end(),
                                   [](std::uint8_t b) { return b == 0; })));
  std::span<const std::uint8_t> cipher;
  if (!tpm::DecodeFragment(fragment, &cipher).ok()) {
    return 0;
  }
  const std::size_t used = tpm::kFragmentHeaderSize + cipher.size();
  Require(cipher.data() == data + tpm::kFragmentHeaderSize && !cipher.empty() &&
          cipher.size() <= tpm::kMaxCipherSize && used <= size &&
          tpm::EncodeFragment(cipher, again).ok() && std::memcmp(again.data(), data, used) == 0);
  return 0;
}
