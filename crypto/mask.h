// Masking of key bytes held in caller arrays. Byte i of a masked run is
//   plain[i] XOR byte (i mod 8) of SipHash-2-4(key; nonce, i / 8)
// with a 128-bit key drawn once per process and a fresh nonce each time a
// run is masked. SipHash is a keyed PRF that costs a few dozen integer
// operations per 8 bytes, so reading a key byte by byte stays cheap, and the
// bytes left in memory are noise to anyone without the process key.
#pragma once

#include <cstdint>

namespace keymgr::crypto {

struct MaskKey {
  std::uint64_t k0;
  std::uint64_t k1;
};

// MaskWord is SipHash-2-4 under |key| of the 16-byte message |nonce| then
// |block|, both little-endian: the mask of bytes 8 * block to 8 * block + 7.
std::uint64_t MaskWord(const MaskKey& key, std::uint64_t nonce, std::uint64_t block);

// XorMask writes |count| bytes of |src| combined with the mask stream of
// |nonce| to |dst| (which may be |src|). Masking and unmasking are the same.
void XorMask(const MaskKey& key, std::uint64_t nonce, const std::uint8_t* src, std::uint8_t* dst,
             std::uint32_t count);

// DrawMaskKey takes a process key from the kernel, without waiting for its
// pool. Before the pool is ready (early in boot), the clocks, process id and
// stack address still give a key that keeps plain bytes out of memory; only
// its unpredictability suffers.
MaskKey DrawMaskKey();

}  // namespace keymgr::crypto
