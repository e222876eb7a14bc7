// Big-endian integers in byte records (the signature file, the sealed
// fragment, TPM commands), read and written byte by byte so that they read
// the same on any host.
#pragma once

#include <cstddef>
#include <cstdint>

namespace keymgr {

// LoadBig reads the unsigned Int stored big-endian in the sizeof(Int) bytes
// at |at|; StoreBig writes |value| there.
template <class Int>
constexpr Int LoadBig(const std::uint8_t* at) {
  Int value = 0;
  for (std::size_t i = 0; i < sizeof(Int); ++i) {
    value = static_cast<Int>(value << 8 | at[i]);
  }
  return value;
}
template <class Int>
constexpr void StoreBig(std::uint8_t* at, Int value) {
  for (std::size_t i = sizeof(Int); i-- > 0; value = static_cast<Int>(value >> 8)) {
    at[i] = static_cast<std::uint8_t>(value);
  }
}

inline constexpr auto LoadBig16 = &LoadBig<std::uint16_t>;
inline constexpr auto LoadBig32 = &LoadBig<std::uint32_t>;
inline constexpr auto LoadBig64 = &LoadBig<std::uint64_t>;
inline constexpr auto StoreBig16 = &StoreBig<std::uint16_t>;
inline constexpr auto StoreBig32 = &StoreBig<std::uint32_t>;
inline constexpr auto StoreBig64 = &StoreBig<std::uint64_t>;

}  // namespace keymgr
