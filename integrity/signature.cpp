#include "integrity/signature.h"

#include <cstring>

#include "crypto/ed25519.h"
#include "crypto/hash.h"

namespace keymgr::integrity {

namespace {

constexpr std::uint8_t kMagic[4] = {'K', 'M', 'S', 'G'};

void PutBig(std::uint8_t* at, std::uint64_t value, int bytes) {
  for (int i = bytes - 1; i >= 0; --i, value >>= 8) {
    at[i] = static_cast<std::uint8_t>(value);
  }
}

std::uint64_t GetBig(const std::uint8_t* at, int bytes) {
  std::uint64_t value = 0;
  for (int i = 0; i < bytes; ++i) {
    value = value << 8 | at[i];
  }
  return value;
}

}  // namespace

void EncodeSignatureFile(const SignatureFile& file,
                         std::span<std::uint8_t, kSignatureFileSize> out) {
  std::memcpy(out.data(), kMagic, sizeof(kMagic));
  PutBig(out.data() + 4, file.version, 4);
  std::memcpy(out.data() + 8, file.keyId.data(), file.keyId.size());
  PutBig(out.data() + 16, file.counter, 8);
  std::memcpy(out.data() + 24, file.listDigest.data(), 32);
  std::memcpy(out.data() + 56, file.digestsDigest.data(), 32);
  std::memcpy(out.data() + kSignedSize, file.signature.data(), file.signature.size());
}

Status DecodeSignatureFile(std::span<const std::uint8_t> bytes, SignatureFile* file) {
  if (bytes.size() != kSignatureFileSize ||
      std::memcmp(bytes.data(), kMagic, sizeof(kMagic)) != 0) {
    return Refused("not a signature file");
  }
  file->version = static_cast<std::uint32_t>(GetBig(bytes.data() + 4, 4));
  std::memcpy(file->keyId.data(), bytes.data() + 8, file->keyId.size());
  file->counter = GetBig(bytes.data() + 16, 8);
  std::memcpy(file->listDigest.data(), bytes.data() + 24, 32);
  std::memcpy(file->digestsDigest.data(), bytes.data() + 56, 32);
  std::memcpy(file->signature.data(), bytes.data() + kSignedSize, file->signature.size());
  return Status();
}

std::array<std::uint8_t, 8> KeyIdOf(const PublicKey& key) {
  const auto digest = crypto::Sha256Of(key);
  std::array<std::uint8_t, 8> id{};
  std::memcpy(id.data(), digest.data(), id.size());
  return id;
}

Status CheckSignatureFile(std::span<const std::uint8_t> bytes, const PublicKey& key,
                          std::span<const std::uint8_t> manifest,
                          std::span<const std::uint8_t> digests, std::uint64_t* counter) {
  SignatureFile file;
  if (Status status = DecodeSignatureFile(bytes, &file); !status.ok()) {
    return status;
  }
  if (file.version != kSignatureVersion) {
    return Refused("signature file of another format version");
  }
  if (file.keyId != KeyIdOf(key)) {
    return Refused("signature file of another key");
  }
  if (file.listDigest != crypto::Sha256Of(manifest) ||
      file.digestsDigest != crypto::Sha256Of(digests)) {
    return Refused("signature file of another manifest or digest file");
  }
  if (Status status = crypto::Ed25519Verify(key, bytes.first(kSignedSize),
                                            std::span<const std::uint8_t, 64>(file.signature));
      !status.ok()) {
    return status;
  }
  *counter = file.counter;
  return Status();
}

}  // namespace keymgr::integrity
