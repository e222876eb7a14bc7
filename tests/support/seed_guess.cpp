#include "support/seed_guess.h"

#include <openssl/evp.h>
#include <stdlib.h>

#include <array>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <fstream>

namespace keymgr::test {

namespace {

using Words = std::array<std::int32_t, 8>;

// The first eight results of random() after srandom(seed), from a state of
// the default size, as glibc starts a process.
Words WordsOf(unsigned int seed) {
  std::array<char, 128> state{};
  random_data data{};
  initstate_r(seed, state.data(), state.size(), &data);
  Words words{};
  for (std::int32_t& word : words) {
    random_r(&data, &word);
  }
  return words;
}

bool Matches(std::string_view scDigest, std::time_t at, const Words& words) {
  std::uint8_t seed[44] = {};
  std::tm local{};
  localtime_r(&at, &local);
  char date[32];
  std::snprintf(date, sizeof(date), "%04d%02d%02d", local.tm_year + 1900, local.tm_mon + 1,
                local.tm_mday);
  const auto seconds = static_cast<std::uint32_t>(at);
  std::memcpy(seed, date, 8);
  std::memcpy(seed + 8, &seconds, 4);
  std::memcpy(seed + 12, words.data(), 32);
  std::uint8_t secret[32], digest[32];
  EVP_Digest(seed, sizeof(seed), secret, nullptr, EVP_sha256(), nullptr);
  EVP_Digest(secret, sizeof(secret), digest, nullptr, EVP_sha256(), nullptr);
  return scDigest == std::string_view(reinterpret_cast<const char*>(digest), sizeof(digest));
}

}  // namespace

std::string GuessSeedKey(std::string_view scDigest, std::time_t when) {
  constexpr std::time_t kHalfDay = 12 * 3600;
  // An unseeded generator starts as srandom(1) leaves it.
  const Words unseeded = WordsOf(1);
  for (std::time_t at = when - kHalfDay; at <= when + kHalfDay; ++at) {
    if (Matches(scDigest, at, unseeded)) {
      return "unseeded";
    }
  }
  // Seeded from the clock a moment before the key was made.
  for (std::time_t seed = when - kHalfDay; seed <= when + kHalfDay; ++seed) {
    const Words words = WordsOf(static_cast<unsigned int>(seed));
    for (std::time_t at = seed; at <= seed + 2; ++at) {
      if (Matches(scDigest, at, words)) {
        return "seeded from the time";
      }
    }
  }
  unsigned int pidMax = 32768;
  std::ifstream("/proc/sys/kernel/pid_max") >> pidMax;
  for (unsigned int pid = 1; pid <= pidMax && pid <= (1u << 17); ++pid) {
    const Words words = WordsOf(pid);
    for (std::time_t at = when - 2; at <= when + 2; ++at) {
      if (Matches(scDigest, at, words)) {
        return "seeded from a process id";
      }
    }
  }
  return "";
}

}  // namespace keymgr::test
