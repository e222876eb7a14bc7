// Scope guards and secret buffers that wipe themselves on every path.
#pragma once

#include <openssl/crypto.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <utility>

namespace keymgr {

// ScopeExit runs |fn| when it goes out of scope.
template <typename F>
class ScopeExit {
 public:
  explicit ScopeExit(F fn) : fn_(std::move(fn)) {}
  ~ScopeExit() { fn_(); }
  ScopeExit(const ScopeExit&) = delete;
  ScopeExit& operator=(const ScopeExit&) = delete;

 private:
  F fn_;
};

// Secret is a fixed-size byte array that is wiped when it goes out of scope.
template <std::size_t N>
struct Secret {
  std::array<std::uint8_t, N> bytes{};
  Secret() = default;
  Secret(const Secret&) = delete;
  Secret& operator=(const Secret&) = delete;
  ~Secret() { OPENSSL_cleanse(bytes.data(), N); }
  std::uint8_t* data() { return bytes.data(); }
  const std::uint8_t* data() const { return bytes.data(); }
  constexpr std::size_t size() const { return N; }
  std::uint8_t& operator[](std::size_t i) { return bytes[i]; }
  const std::uint8_t& operator[](std::size_t i) const { return bytes[i]; }
};

// SecretText is a char buffer for secret text (hex of identities and
// passwords), wiped when it goes out of scope.
template <std::size_t N>
struct SecretText {
  std::array<char, N> chars{};
  SecretText() = default;
  SecretText(const SecretText&) = delete;
  SecretText& operator=(const SecretText&) = delete;
  ~SecretText() { OPENSSL_cleanse(chars.data(), N); }
  char* data() { return chars.data(); }
  const char* c_str() const { return chars.data(); }
  constexpr std::size_t size() const { return N; }
};

}  // namespace keymgr
