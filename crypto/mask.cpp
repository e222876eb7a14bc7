#include "crypto/mask.h"

#include <time.h>
#include <unistd.h>

#include <cstring>

#include "util/random.h"
#include "util/secure.h"

namespace keymgr::crypto {

namespace {

constexpr std::uint64_t Rotl(std::uint64_t x, int bits) {
  return (x << bits) | (x >> (64 - bits));
}

struct SipState {
  std::uint64_t v0, v1, v2, v3;
  void Round() {
    v0 += v1;
    v1 = Rotl(v1, 13);
    v1 ^= v0;
    v0 = Rotl(v0, 32);
    v2 += v3;
    v3 = Rotl(v3, 16);
    v3 ^= v2;
    v0 += v3;
    v3 = Rotl(v3, 21);
    v3 ^= v0;
    v2 += v1;
    v1 = Rotl(v1, 17);
    v1 ^= v2;
    v2 = Rotl(v2, 32);
  }
  void Absorb(std::uint64_t m) {
    v3 ^= m;
    Round();
    Round();
    v0 ^= m;
  }
};

}  // namespace

std::uint64_t MaskWord(const MaskKey& key, std::uint64_t nonce, std::uint64_t block) {
  SipState s{key.k0 ^ 0x736f6d6570736575ull, key.k1 ^ 0x646f72616e646f6dull,
             key.k0 ^ 0x6c7967656e657261ull, key.k1 ^ 0x7465646279746573ull};
  s.Absorb(nonce);
  s.Absorb(block);
  s.Absorb(16ull << 56);  // the message length, as SipHash pads its last word
  s.v2 ^= 0xff;
  s.Round();
  s.Round();
  s.Round();
  s.Round();
  return s.v0 ^ s.v1 ^ s.v2 ^ s.v3;
}

void XorMask(const MaskKey& key, std::uint64_t nonce, const std::uint8_t* src, std::uint8_t* dst,
             std::uint32_t count) {
  std::uint64_t word = 0;
  for (std::uint32_t i = 0; i < count; ++i) {
    if (i % 8 == 0) {
      word = MaskWord(key, nonce, i / 8);
    }
    dst[i] = static_cast<std::uint8_t>(src[i] ^ (word >> (8 * (i % 8))));
  }
}

MaskKey DrawMaskKey() {
  Secret<16> seed;
  // Never waits for the kernel: a normal boot may run before its pool is
  // ready, and the mask only keeps plain bytes out of memory.
  if (!KernelRandom(seed.data(), seed.size(), KernelWait::kNo)) {
    timespec now{};
    timespec mono{};
    clock_gettime(CLOCK_REALTIME, &now);
    clock_gettime(CLOCK_MONOTONIC, &mono);
    const MaskKey fallback{
        static_cast<std::uint64_t>(now.tv_nsec) ^ (static_cast<std::uint64_t>(now.tv_sec) << 20),
        static_cast<std::uint64_t>(mono.tv_nsec) ^ reinterpret_cast<std::uintptr_t>(&seed) ^
            (static_cast<std::uint64_t>(getpid()) << 32)};
    const std::uint64_t a = MaskWord(fallback, 1, 0);
    const std::uint64_t b = MaskWord(fallback, 2, 0);
    std::memcpy(seed.data(), &a, 8);
    std::memcpy(seed.data() + 8, &b, 8);
  }
  MaskKey key{};
  std::memcpy(&key.k0, seed.data(), 8);
  std::memcpy(&key.k1, seed.data() + 8, 8);
  return key;
}

}  // namespace keymgr::crypto
