#include "crypto/rsa.h"

#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>

#include "crypto/internal.h"

namespace keymgr::crypto {

namespace {

// PublicKey builds the RSA public key of |modulus| and |exponent|.
Status PublicKey(std::span<const std::uint8_t> modulus, std::uint32_t exponent, EvpPkey& key) {
  BigNum n(BN_bin2bn(modulus.data(), static_cast<int>(modulus.size()), nullptr));
  BigNum e(BN_new());
  ParamBuilder builder(OSSL_PARAM_BLD_new());
  Steps step;
  if (!step("BN_bin2bn", n.get() != nullptr) || !step("BN_new", e.get() != nullptr) ||
      !step("OSSL_PARAM_BLD_new", builder.get() != nullptr) ||
      !step("BN_set_word", BN_set_word(e.get(), exponent) == 1) ||
      !step("OSSL_PARAM_BLD_push_BN",
            OSSL_PARAM_BLD_push_BN(builder.get(), OSSL_PKEY_PARAM_RSA_N, n.get()) == 1 &&
                OSSL_PARAM_BLD_push_BN(builder.get(), OSSL_PKEY_PARAM_RSA_E, e.get()) == 1)) {
    return OpensslFailure(step.call());
  }
  Params params(OSSL_PARAM_BLD_to_param(builder.get()));
  EvpPkeyContext context(EVP_PKEY_CTX_new_from_name(nullptr, "RSA", nullptr));
  if (!step("OSSL_PARAM_BLD_to_param", params.get() != nullptr) ||
      !step("EVP_PKEY_CTX_new_from_name", context.get() != nullptr) ||
      !step("EVP_PKEY_fromdata_init", EVP_PKEY_fromdata_init(context.get()) == 1) ||
      !step("EVP_PKEY_fromdata",
            EVP_PKEY_fromdata(context.get(), key.out(), EVP_PKEY_PUBLIC_KEY, params.get()) == 1)) {
    return OpensslFailure(step.call());
  }
  return Status();
}

}  // namespace

Status RsaOaepSha256Encrypt(std::span<const std::uint8_t> modulus, std::uint32_t exponent,
                            std::span<const std::uint8_t> plain, std::span<std::uint8_t> out,
                            std::size_t* written) {
  EvpPkey key;
  if (Status status = PublicKey(modulus, exponent, key); !status.ok()) {
    return status;
  }
  EvpPkeyContext context(EVP_PKEY_CTX_new_from_pkey(nullptr, key.get(), nullptr));
  std::size_t size = out.size();
  Steps step;
  if (!step("EVP_PKEY_CTX_new_from_pkey", context.get() != nullptr) ||
      !step("EVP_PKEY_encrypt_init", EVP_PKEY_encrypt_init(context.get()) == 1) ||
      !step("EVP_PKEY_CTX_set_rsa_padding",
            EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_OAEP_PADDING) == 1) ||
      !step("EVP_PKEY_CTX_set_rsa_oaep_md",
            EVP_PKEY_CTX_set_rsa_oaep_md(context.get(), EVP_sha256()) == 1) ||
      !step("EVP_PKEY_CTX_set_rsa_mgf1_md",
            EVP_PKEY_CTX_set_rsa_mgf1_md(context.get(), EVP_sha256()) == 1) ||
      !step("EVP_PKEY_encrypt",
            EVP_PKEY_encrypt(context.get(), out.data(), &size, plain.data(), plain.size()) == 1)) {
    return OpensslFailure(step.call());
  }
  *written = size;
  return Status();
}

}  // namespace keymgr::crypto
