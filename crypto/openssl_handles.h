// The owned libcrypto handles: one alias a handle type, each released by the
// free function libcrypto gives it.
#pragma once

#include <openssl/bn.h>
#include <openssl/evp.h>
#include <openssl/param_build.h>

#include "util/owned.h"

namespace keymgr::crypto {

using BigNum = Owned<BIGNUM*, BN_free>;
using CipherContext = Owned<EVP_CIPHER_CTX*, EVP_CIPHER_CTX_free>;
using EvpMdContext = Owned<EVP_MD_CTX*, EVP_MD_CTX_free>;
using EvpPkey = Owned<EVP_PKEY*, EVP_PKEY_free>;
using EvpPkeyContext = Owned<EVP_PKEY_CTX*, EVP_PKEY_CTX_free>;
using ParamBuilder = Owned<OSSL_PARAM_BLD*, OSSL_PARAM_BLD_free>;
using Params = Owned<OSSL_PARAM*, OSSL_PARAM_free>;

}  // namespace keymgr::crypto
