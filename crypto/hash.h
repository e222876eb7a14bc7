// Message digests over OpenSSL EVP.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

#include "crypto/openssl_handles.h"
#include "util/status.h"

// Md5OfString stores the MD5 of the strlen(text) bytes of |text| into the
// kMd5Size (16) bytes at |digest|. Always returns 0; should libcrypto fail,
// |digest| is zeroed, which no identity or password ever hashes to.
int Md5OfString(const char* text, std::uint8_t* digest);

namespace keymgr::crypto {

inline constexpr std::size_t kSha256Size = 32;
inline constexpr std::size_t kMd5Size = 16;

// Sha256 hashes a stream of bytes: Update as often as needed, then Final.
class Sha256 {
 public:
  Sha256();
  Status Update(const void* bytes, std::size_t size);
  // Final writes the digest; the object is spent afterwards.
  Status Final(std::span<std::uint8_t, kSha256Size> digest);

 private:
  EvpMdContext context_;
  Status failed_;  // the first failure, kept until Final
};

// Sha256Of is the SHA-256 of |bytes|; all zeros should libcrypto fail, which
// no comparison of real data matches by chance.
std::array<std::uint8_t, kSha256Size> Sha256Of(std::span<const std::uint8_t> bytes);

}  // namespace keymgr::crypto
