// RSA public-key sealing over OpenSSL, for keys whose private part stays in
// the TPM.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "util/status.h"

namespace keymgr::crypto {

// RsaOaepSha256Encrypt seals |plain| to the RSA public key with |modulus|
// (big-endian) and |exponent|, with OAEP over SHA-256 (MGF1 SHA-256, empty
// label): the scheme the TPM's RSA_Decrypt opens for such a key. |out| must
// hold at least the modulus size; |*written| gets the ciphertext's size.
Status RsaOaepSha256Encrypt(std::span<const std::uint8_t> modulus, std::uint32_t exponent,
                            std::span<const std::uint8_t> plain, std::span<std::uint8_t> out,
                            std::size_t* written);

}  // namespace keymgr::crypto
