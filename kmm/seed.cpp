// The host calls around the TPM: seeding the C library generator for the
// seed key, and persisting the storage root key.
#include <kmm/kmm.h>
#include <stdlib.h>
#include <unistd.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>

#include "crypto/hash.h"
#include "kmm/internal.h"
#include "tpm/pcp.h"
#include "util/random.h"
#include "util/secure.h"

namespace {

// The generator's state: initstate() keeps its bookkeeping in the first word
// (glibc and musl alike) and the 63 words of its additive feedback register
// after it, which a 32-bit srandom() seed would fill from 2^32 candidates.
constexpr std::size_t kStateWords = 64;
std::array<std::uint32_t, kStateWords> g_state;
constexpr std::size_t kDrawSize = (kStateWords - 1) * sizeof(std::uint32_t);
constexpr std::uint32_t kTpmDraw = 64;
// The process that filled the state last: a child of fork() starts with its
// parent's state, which it must not reuse for keys of its own.
pid_t g_seededBy = 0;

// Expand mixes |count| TPM bytes into all of |state|: block i of it is
// XORed with SHA-256(i, TPM bytes).
bool Expand(const std::uint8_t* tpm, std::uint32_t count, keymgr::Secret<kDrawSize>& state) {
  keymgr::Secret<keymgr::crypto::kSha256Size> block;
  for (std::size_t at = 0; at < kDrawSize; at += block.size()) {
    const auto index = static_cast<std::uint8_t>(at / block.size());
    keymgr::crypto::Sha256 sha;
    if (!sha.Update(&index, 1).ok() || !sha.Update(tpm, count).ok() ||
        !sha.Final(block.bytes).ok()) {
      return false;
    }
    for (std::size_t i = 0; i < block.size() && at + i < kDrawSize; ++i) {
      state[at + i] ^= block[i];
    }
  }
  return true;
}

}  // namespace

extern "C" int KmmSeedRandom(void) {
  // The TPM first: when it answers, the kernel gives only what its pool has
  // ready, so that an early boot never waits on it.
  keymgr::Secret<kTpmDraw> tpm;
  std::uint32_t drawn = 0;
  const bool tpmAnswered = pcp_getEntropyBytes(kTpmDraw, tpm.data(), &drawn) == 0 && drawn >= 16;
  keymgr::Secret<kDrawSize> state;
  const bool fromKernel = keymgr::KernelRandom(
      state.data(), state.size(), tpmAnswered ? keymgr::KernelWait::kNo : keymgr::KernelWait::kYes);
  if (!fromKernel) {
    state.bytes.fill(0);
  }
  // The TPM's draw, in clear on the bus, is expanded over the whole state and
  // mixed with the kernel's: either source alone keeps the state
  // unpredictable, should the other be weak or watched on its bus.
  const bool fromTpm = tpmAnswered && Expand(tpm.data(), drawn, state);
  if (!fromTpm && !fromKernel) {
    return -1;
  }
  ::initstate(1, reinterpret_cast<char*>(g_state.data()), sizeof(g_state));
  std::memcpy(g_state.data() + 1, state.data(), kDrawSize);
  ::setstate(reinterpret_cast<char*>(g_state.data()));
  g_seededBy = ::getpid();
  return fromTpm ? KMM_ENTROPY_TPM : KMM_ENTROPY_GETRANDOM;
}

bool SeedRandomOnce() {
  return g_seededBy == ::getpid() || KmmSeedRandom() >= 0;
}

extern "C" int KmmPersistSrk(void) {
  return pcp_persist_srk() == 0 ? 0 : -1;
}
