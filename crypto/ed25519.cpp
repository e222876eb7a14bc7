#include "crypto/ed25519.h"

#include "crypto/internal.h"

namespace keymgr::crypto {

Status Ed25519Verify(std::span<const std::uint8_t, 32> key, std::span<const std::uint8_t> message,
                     std::span<const std::uint8_t, 64> signature) {
  const EvpPkey pkey(
      EVP_PKEY_new_raw_public_key(EVP_PKEY_ED25519, nullptr, key.data(), key.size()));
  const EvpMdContext context(EVP_MD_CTX_new());
  Steps step;
  if (!step("EVP_PKEY_new_raw_public_key", pkey.get() != nullptr) ||
      !step("EVP_MD_CTX_new", context.get() != nullptr) ||
      !step("EVP_DigestVerifyInit",
            EVP_DigestVerifyInit(context.get(), nullptr, nullptr, nullptr, pkey.get()) == 1)) {
    return OpensslFailure(step.call());
  }
  if (EVP_DigestVerify(context.get(), signature.data(), signature.size(), message.data(),
                       message.size()) != 1) {
    return OpensslFailure("EVP_DigestVerify");
  }
  return Status();
}

Status Ed25519PublicKey(EVP_PKEY* key, std::span<std::uint8_t, 32> publicKey) {
  std::size_t size = publicKey.size();
  if (key == nullptr || EVP_PKEY_get_id(key) != EVP_PKEY_ED25519 ||
      EVP_PKEY_get_raw_public_key(key, publicKey.data(), &size) != 1 || size != publicKey.size()) {
    return Refused("not an Ed25519 key");
  }
  return Status();
}

Status Ed25519Sign(EVP_PKEY* key, std::span<const std::uint8_t> message,
                   std::span<std::uint8_t, 64> signature) {
  const EvpMdContext context(EVP_MD_CTX_new());
  std::size_t size = signature.size();
  Steps step;
  if (!step("EVP_MD_CTX_new", context.get() != nullptr) ||
      !step("EVP_DigestSignInit",
            EVP_DigestSignInit(context.get(), nullptr, nullptr, nullptr, key) == 1) ||
      !step("EVP_DigestSign", EVP_DigestSign(context.get(), signature.data(), &size, message.data(),
                                             message.size()) == 1 &&
                                  size == signature.size())) {
    return OpensslFailure(step.call());
  }
  return Status();
}

}  // namespace keymgr::crypto
