// The host call that seeds the C library generator for the seed key.
#include <kmm/kmm.h>
#include <openssl/crypto.h>
#include <stdlib.h>
#include <sys/random.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstring>

#include "platform/pcp.h"
#include "util/io.h"
#include "util/secure.h"

namespace {

// The generator's state: initstate() keeps its bookkeeping in the first word
// (glibc and musl alike) and the 63 words of its additive feedback register
// after it, which a 32-bit srandom() seed would fill from 2^32 candidates.
constexpr std::size_t kStateWords = 64;
std::array<std::uint32_t, kStateWords> g_state;
constexpr std::size_t kDrawSize = (kStateWords - 1) * sizeof(std::uint32_t);

}  // namespace

extern "C" int KmmSeedRandom(void) {
  keymgr::Secret<kDrawSize> tpm;
  keymgr::Secret<kDrawSize> kernel;
  const bool fromTpm = pcp_getRandomBytes(kDrawSize, tpm.data()) == 0;
  const bool fromKernel =
      keymgr::MoveAll([&](std::size_t done,
                          std::size_t left) { return ::getrandom(kernel.data() + done, left, 0); },
                      kernel.size());
  if (!fromTpm && !fromKernel) {
    return -1;
  }
  // Both sources when both answer: either one alone keeps the state
  // unpredictable, should the other be weak or watched on its bus.
  for (std::size_t i = 0; i < kDrawSize; ++i) {
    tpm[i] ^= kernel[i];
  }
  ::initstate(1, reinterpret_cast<char*>(g_state.data()), sizeof(g_state));
  std::memcpy(g_state.data() + 1, tpm.data(), kDrawSize);
  ::setstate(reinterpret_cast<char*>(g_state.data()));
  return fromTpm ? KMM_ENTROPY_TPM : KMM_ENTROPY_GETRANDOM;
}
