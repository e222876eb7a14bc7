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

constexpr std::uint16_t LoadBig16(const std::uint8_t* at) {
  return LoadBig<std::uint16_t>(at);
}
constexpr std::uint32_t LoadBig32(const std::uint8_t* at) {
  return LoadBig<std::uint32_t>(at);
}
constexpr std::uint64_t LoadBig64(const std::uint8_t* at) {
  return LoadBig<std::uint64_t>(at);
}
constexpr void StoreBig16(std::uint8_t* at, std::uint16_t value) {
  StoreBig(at, value);
}
constexpr void StoreBig32(std::uint8_t* at, std::uint32_t value) {
  StoreBig(at, value);
}
constexpr void StoreBig64(std::uint8_t* at, std::uint64_t value) {
  StoreBig(at, value);
}

}  // namespace keymgr
