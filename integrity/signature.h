// The signature file, /quorvan/hidden/keymgr.sig: it binds the manifest and
// the digest file to a release counter under an Ed25519 key that the device
// does not hold. 152 bytes, integers big-endian:
//   0..3     magic "KMSG"
//   4..7     format version, 1
//   8..15    key id: the first 8 bytes of the SHA-256 of the 32-byte public key
//   16..23   release counter
//   24..55   SHA-256 of keymgr.list
//   56..87   SHA-256 of keymgr.cb
//   88..151  Ed25519 signature (RFC 8032) of bytes 0..87
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

#include "crypto/hash.h"
#include "util/status.h"

namespace keymgr::integrity {

inline constexpr std::size_t kSignedSize = 88;
inline constexpr std::size_t kSignatureFileSize = kSignedSize + 64;
inline constexpr std::uint32_t kSignatureVersion = 1;

using PublicKey = std::array<std::uint8_t, 32>;

struct SignatureFile {
  std::uint32_t version = kSignatureVersion;
  std::array<std::uint8_t, 8> keyId{};
  std::uint64_t counter = 0;
  std::array<std::uint8_t, crypto::kSha256Size> listDigest{};
  std::array<std::uint8_t, crypto::kSha256Size> digestsDigest{};
  std::array<std::uint8_t, 64> signature{};
};

// EncodeSignatureFile lays |file| out as the signature file holds it.
void EncodeSignatureFile(const SignatureFile& file,
                         std::span<std::uint8_t, kSignatureFileSize> out);

// DecodeSignatureFile reads |bytes|, which must be a whole signature file
// with the magic; any version is read, for the caller to judge.
Status DecodeSignatureFile(std::span<const std::uint8_t> bytes, SignatureFile* file);

// KeyIdOf is the key id of |key|.
std::array<std::uint8_t, 8> KeyIdOf(const PublicKey& key);

// CheckSignatureFile accepts |bytes| as the signature file of |manifest| and
// |digests| under |key|: format version 1, the key's id, both digests, and
// the signature. Sets |*counter| to the release counter when it accepts.
Status CheckSignatureFile(std::span<const std::uint8_t> bytes, const PublicKey& key,
                          std::span<const std::uint8_t> manifest,
                          std::span<const std::uint8_t> digests, std::uint64_t* counter);

}  // namespace keymgr::integrity
