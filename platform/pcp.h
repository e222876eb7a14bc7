// Platform key manager over a TPM 2.0. Each call opens the TPM on the
// KEYMGR_TCTI transport, does its work and closes it again. Every call
// returns 0 on success and non-zero on failure; no TPM error ends the process.
#pragma once

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

// Size of a sealed fragment: 12-byte header and 256-byte RSA-OAEP ciphertext.
#define PCP_FRAGMENT_SIZE 268u

// pcp_getRandomBytes fills |count| bytes of |dst| from the TPM's generator;
// on failure |dst| is left as it was.
int pcp_getRandomBytes(uint32_t count, uint8_t* dst);

// pcp_create_key creates an RSA-|bits| decryption key authorised by the 16
// bytes |passwordDigest| and makes it persistent at the handle derived from
// the 16 bytes |nameDigest|. Fails when that handle is taken.
int pcp_create_key(const uint8_t* nameDigest, const uint8_t* passwordDigest, uint32_t bits,
                   uint32_t flags);

// pcp_delete_key evicts the persistent key of |nameDigest|.
int pcp_delete_key(const uint8_t* nameDigest, uint32_t flags);

// pcp_encryptDataFragment seals |length| bytes of |data| under the key whose
// name digest is the MD5 of |nameHex|. |*outSize| is the capacity of |out|
// on entry and PCP_FRAGMENT_SIZE on success.
int pcp_encryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* data,
                            uint32_t length, uint8_t* out, uint32_t* outSize);

// pcp_decryptDataFragment opens a fragment sealed by pcp_encryptDataFragment,
// authorising with the MD5 of |passHex|. |*outSize| is the capacity of |out|
// on entry and the plaintext length on success.
int pcp_decryptDataFragment(const char* nameHex, const char* passHex, const uint8_t* fragment,
                            uint32_t length, uint8_t* out, uint32_t* outSize);

#ifdef __cplusplus
}
#endif
