// Platform key manager over a TPM 2.0 on the KEYMGR_TCTI transport. A call
// opens the TPM, does its work and closes it again, unless the calls are
// held together (pcp_hold_connection). Every TPM command has a deadline
// (KEYMGR_TPM_TIMEOUT_MS); a TPM that does not answer in time, or a
// transport that hangs up, fails the call. Every call returns 0 on success
// and non-zero on failure; no TPM error ends the process or raises a signal.
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

// pcp_hold_connection makes the calls that follow share one connection, its
// storage parent and its session, until pcp_release_connection, which
// flushes and closes all of it: nothing of the TPM stays held afterwards.
// Once the held connection cannot be opened, or a command on it misses its
// deadline, the calls that follow fail at once until the release.
void pcp_hold_connection(void);
void pcp_release_connection(void);

// pcp_getRandomBytes fills |count| bytes of |dst| (at most 1024) with the
// TPM's random bytes mixed with the kernel's (getrandom), or the kernel's
// alone when the TPM does not answer. Fails, leaving |dst| as it was, only
// when neither source answers.
PCP_NODISCARD int pcp_getRandomBytes(uint32_t count, uint8_t* dst);

// pcp_getEntropyBytes draws up to |count| bytes (64 at most) from the TPM's
// generator in one command with no session, and sets |*drawn| to how many
// came. They cross the bus in clear: callers only mix them with other
// randomness, never use them as a key.
PCP_NODISCARD int pcp_getEntropyBytes(uint32_t count, uint8_t* dst, uint32_t* drawn);

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

// pcp_list_keys writes the persistent handles of the keys this key manager
// created to |handles|, at most |capacity| of them, and sets |*count| to how
// many the TPM holds (which may be more). For a device's own checks.
PCP_NODISCARD int pcp_list_keys(uint32_t* handles, uint32_t capacity, uint32_t* count);

// pcp_key_handle is the persistent handle of the key whose name digest is
// the MD5 of |nameHex|. It sends nothing to the TPM.
uint32_t pcp_key_handle(const char* nameHex);

// pcp_encryptDataFragment seals |length| bytes of |data| under the key whose
// name digest is the MD5 of |nameHex|: on the host, with the key's public
// area as the TPM gives it. |*outSize| is the capacity of |out| on entry and
// PCP_FRAGMENT_SIZE on success.
PCP_NODISCARD int pcp_encryptDataFragment(const char* nameHex, const char* passHex,
                                          const uint8_t* data, uint32_t length, uint8_t* out,
                                          uint32_t* outSize);

// pcp_decryptDataFragment opens a fragment sealed by pcp_encryptDataFragment,
// authorising with the MD5 of |passHex|, in a session bound to the key that
// returns the plaintext encrypted. |*outSize| is the capacity of |out| on
// entry and the plaintext length on success.
PCP_NODISCARD int pcp_decryptDataFragment(const char* nameHex, const char* passHex,
                                          const uint8_t* fragment, uint32_t length, uint8_t* out,
                                          uint32_t* outSize);

// pcp_extend_pcr extends PCR |pcr| (0 to 23) of the SHA-256 bank with the 32
// bytes at |digest|, in a session salted to the pinned storage key, so that
// an extend changed on its way is refused.
PCP_NODISCARD int pcp_extend_pcr(uint32_t pcr, const uint8_t* digest);

// pcp_seal_pcr is the PCR that holds the boot verdict when keys are sealed to
// the boot (a build with KEYMGR_SEAL_TO_VERDICT), or -1 for plain keys.
int pcp_seal_pcr(void);

// pcp_persist_srk makes the standard storage root key persistent at
// 0x81000001, or finds it there; keys are then created under it without
// creating a primary each time.
PCP_NODISCARD int pcp_persist_srk(void);

#ifdef __cplusplus
}
#endif
