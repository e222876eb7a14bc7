#include "crypto/hash.h"

#include <openssl/crypto.h>
#include <openssl/evp.h>

#include <cstring>

#include "crypto/internal.h"

int Md5OfString(const char* text, std::uint8_t* digest) {
  unsigned int size = 0;
  if (EVP_Digest(text, std::strlen(text), digest, &size, EVP_md5(), nullptr) != 1) {
    keymgr::crypto::LogOpenssl("EVP_Digest");
    std::memset(digest, 0, keymgr::crypto::kMd5Size);
  }
  return 0;
}

namespace keymgr::crypto {

Sha256::Sha256() : context_(EVP_MD_CTX_new()) {
  if (!context_ || EVP_DigestInit_ex(context_.get(), EVP_sha256(), nullptr) != 1) {
    failed_ = OpensslFailure(context_ ? "EVP_DigestInit_ex" : "EVP_MD_CTX_new");
  }
}

Status Sha256::Update(const void* bytes, std::size_t size) {
  if (failed_.ok() && EVP_DigestUpdate(context_.get(), bytes, size) != 1) {
    failed_ = OpensslFailure("EVP_DigestUpdate");
  }
  return failed_;
}

Status Sha256::Final(std::span<std::uint8_t, kSha256Size> digest) {
  unsigned int size = 0;
  if (failed_.ok() &&
      (EVP_DigestFinal_ex(context_.get(), digest.data(), &size) != 1 || size != kSha256Size)) {
    failed_ = OpensslFailure("EVP_DigestFinal_ex");
  }
  return failed_;
}

std::array<std::uint8_t, kSha256Size> Sha256Of(std::span<const std::uint8_t> bytes) {
  std::array<std::uint8_t, kSha256Size> digest{};
  Sha256 sha;
  (void)sha.Update(bytes.data(), bytes.size());
  if (!sha.Final(digest).ok()) {
    digest.fill(0);
  }
  return digest;
}

}  // namespace keymgr::crypto
