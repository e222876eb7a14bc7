#include "integrity/signature.h"

#include <cstring>

#include "crypto/ed25519.h"
#include "crypto/hash.h"
#include "util/endian.h"

namespace keymgr::integrity {

namespace {

constexpr std::uint8_t kMagic[4] = {'K', 'M', 'S', 'G'};

}  // namespace

void EncodeSignatureFile(const SignatureFile& file,
                         std::span<std::uint8_t, kSignatureFileSize> out) {
  std::memcpy(out.data(), kMagic, sizeof(kMagic));
  StoreBig32(out.data() + 4, file.version);
  std::memcpy(out.data() + 8, file.keyId.data(), file.keyId.size());
  StoreBig64(out.data() + 16, file.counter);
  std::memcpy(out.data() + 24, file.listDigest.data(), file.listDigest.size());
  std::memcpy(out.data() + 56, file.digestsDigest.data(), file.digestsDigest.size());
  std::memcpy(out.data() + kSignedSize, file.signature.data(), file.signature.size());
}

Status DecodeSignatureFile(std::span<const std::uint8_t> bytes, SignatureFile* file) {
  if (bytes.size() != kSignatureFileSize ||
      std::memcmp(bytes.data(), kMagic, sizeof(kMagic)) != 0) {
    return Refused("not a signature file");
  }
  file->version = LoadBig32(bytes.data() + 4);
  std::memcpy(file->keyId.data(), bytes.data() + 8, file->keyId.size());
  file->counter = LoadBig64(bytes.data() + 16);
  std::memcpy(file->listDigest.data(), bytes.data() + 24, file->listDigest.size());
  std::memcpy(file->digestsDigest.data(), bytes.data() + 56, file->digestsDigest.size());
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
