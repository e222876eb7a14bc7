// Ed25519 signatures (RFC 8032) over OpenSSL EVP.
#pragma once

#include <openssl/evp.h>

#include <cstdint>
#include <span>

#include "util/status.h"

namespace keymgr::crypto {

// Ed25519Verify accepts |signature| of |message| under the 32-byte public
// |key|.
Status Ed25519Verify(std::span<const std::uint8_t, 32> key, std::span<const std::uint8_t> message,
                     std::span<const std::uint8_t, 64> signature);

// Ed25519PublicKey gives the 32-byte public part of |key|, which must be an
// Ed25519 key.
Status Ed25519PublicKey(EVP_PKEY* key, std::span<std::uint8_t, 32> publicKey);

// Ed25519Sign signs |message| with |key|, an Ed25519 private key.
Status Ed25519Sign(EVP_PKEY* key, std::span<const std::uint8_t> message,
                   std::span<std::uint8_t, 64> signature);

}  // namespace keymgr::crypto
