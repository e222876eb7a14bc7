// Hexadecimal text of bytes, two digits a byte: the one encoder and decoder
// of every hex text the system writes or reads.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>

namespace keymgr {

enum class HexCase : std::uint8_t { kUpper, kLower };

// HexEncode writes the 2 * bytes.size() digits of |bytes| to |text|, which
// holds them; no NUL follows.
constexpr void HexEncode(std::span<const std::uint8_t> bytes, char* text, HexCase letters) {
  const char* digits = letters == HexCase::kUpper ? "0123456789ABCDEF" : "0123456789abcdef";
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    text[2 * i] = digits[bytes[i] >> 4];
    text[2 * i + 1] = digits[bytes[i] & 0x0F];
  }
}

// HexText is the digits of |bytes| followed by a NUL.
template <std::size_t N>
constexpr std::array<char, 2 * N + 1> HexText(const std::array<std::uint8_t, N>& bytes,
                                              HexCase letters) {
  std::array<char, 2 * N + 1> text{};
  HexEncode(bytes, text.data(), letters);
  return text;
}

// HexDigitValue returns the value of one hexadecimal digit of either case,
// or -1 for any other character.
constexpr int HexDigitValue(char c) {
  if (c >= '0' && c <= '9') {
    return c - '0';
  }
  if (c >= 'a' && c <= 'f') {
    return c - 'a' + 10;
  }
  if (c >= 'A' && c <= 'F') {
    return c - 'A' + 10;
  }
  return -1;
}

// HexDecode reads |text|, exactly two digits of either case for each byte of
// |bytes|, into |bytes|. False for text of another length or with any other
// character; |bytes| may then be partly written.
constexpr bool HexDecode(std::string_view text, std::span<std::uint8_t> bytes) {
  if (text.size() != 2 * bytes.size()) {
    return false;
  }
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    const int high = HexDigitValue(text[2 * i]);
    const int low = HexDigitValue(text[2 * i + 1]);
    if (high < 0 || low < 0) {
      return false;
    }
    bytes[i] = static_cast<std::uint8_t>(high << 4 | low);
  }
  return true;
}

// HexBytes is the N bytes of |text|, or nothing when |text| is not 2 * N
// digits: for the hex text of a build option, read at compile time.
template <std::size_t N>
constexpr std::optional<std::array<std::uint8_t, N>> HexBytes(std::string_view text) {
  std::array<std::uint8_t, N> bytes{};
  if (!HexDecode(text, bytes)) {
    return std::nullopt;
  }
  return bytes;
}

}  // namespace keymgr
