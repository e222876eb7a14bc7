// Platform key manager over a TPM 2.0. Each call opens the TPM on the
// KEYMGR_TCTI transport, does its work and closes it again. Without a
// resource manager on that transport, each call first flushes what a dead
// process left loaded. Every call
// returns 0 on success and non-zero on failure; no TPM error ends the process.
#pragma once

#include <stdint.h>

#ifdef __cplusplus
#define PCP_NODISCARD [[nodiscard]]
extern "C" {
#else
#define PCP_NODISCARD
#endif

// Size of a sealed fragment: 12-byte header and 256-byte RSA-OAEP ciphertext.
#define PCP_FRAGMENT_SIZE 268u

// pcp_getRandomBytes fills |count| bytes of |dst| from the TPM's generator;
// on failure |dst| is left as it was.
PCP_NODISCARD int pcp_getRandomBytes(uint32_t count, uint8_t* dst);

// pcp_create_key creates an RSA-|bits| decryption key authorised by the 16
// bytes |passwordDigest| and makes it persistent at the handle derived from
// the 16 bytes |nameDigest|. Fails when that handle is taken. The key's
// template marks it as this key manager's own.
PCP_NODISCARD int pcp_create_key(const uint8_t* nameDigest, const uint8_t* passwordDigest,
                                 uint32_t bits, uint32_t flags);

// pcp_delete_key evicts the persistent key of |nameDigest|. An object there
// that this key manager did not create is left alone and the call fails, as
// for a missing key.
PCP_NODISCARD int pcp_delete_key(const uint8_t* nameDigest, uint32_t flags);

// pcp_evict_stale_keys evicts every persistent key this key manager created
// except the one of |keepNameDigest| (NULL keeps none): keys whose identity
// never reached the disk, left by a regeneration that was killed. Returns 0,
// or non-zero when the TPM could not be searched or a key not evicted.
PCP_NODISCARD int pcp_evict_stale_keys(const uint8_t* keepNameDigest);

// pcp_encryptDataFragment seals |length| bytes of |data| under the key whose
// name digest is the MD5 of |nameHex|. |*outSize| is the capacity of |out|
// on entry and PCP_FRAGMENT_SIZE on success.
PCP_NODISCARD int pcp_encryptDataFragment(const char* nameHex, const char* passHex,
                                          const uint8_t* data, uint32_t length, uint8_t* out,
                                          uint32_t* outSize);

// pcp_decryptDataFragment opens a fragment sealed by pcp_encryptDataFragment,
// authorising with the MD5 of |passHex|. |*outSize| is the capacity of |out|
// on entry and the plaintext length on success.
PCP_NODISCARD int pcp_decryptDataFragment(const char* nameHex, const char* passHex,
                                          const uint8_t* fragment, uint32_t length, uint8_t* out,
                                          uint32_t* outSize);

#ifdef __cplusplus
}
#endif
