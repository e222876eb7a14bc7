/* Crypto services of the key-management module: hashing, AES, crypto
 * containers, protected key records and built-in constants. Internal to the
 * module: hosts see ProtectedKey only as the opaque record kmm.h defines.
 *
 * Every operation that returns a code returns 0 on success and a non-zero
 * DTC_E_* value on failure. A caller that goes on without looking at a code
 * says so with a (void) cast. */
#ifndef KMM_CRYPTO_DTC_H
#define KMM_CRYPTO_DTC_H

#include <kmm/kmm.h> /* ProtectedKey */
#include <stdint.h>

#ifdef __cplusplus
#define DTC_NODISCARD [[nodiscard]]
extern "C" {
#else
#define DTC_NODISCARD
#endif

/* Selectors and constant indices. */
#define DTC_HASH_SELECTOR 1023u /* SHA-256 */
#define DTC_AES_ENCRYPT 1112u
#define DTC_AES_DECRYPT 1122u
#define DTC_AES_MODE 1204u /* AES-256-CBC, no padding, IV from constant 2 */
#define DTC_CONST_AES_KEY 1u
#define DTC_CONST_AES_PARAM 2u
#define DTC_CONST_DMSETUP_DIGEST 3u

/* Failure codes (the set is the library's own; callers only test for 0). */
#define DTC_E_NULL_ARGUMENT 0xD7C00001u
#define DTC_E_BAD_SELECTOR 0xD7C00002u
#define DTC_E_BAD_LENGTH 0xD7C00003u
#define DTC_E_SMALL_OUTPUT 0xD7C00004u
#define DTC_E_BAD_STATE 0xD7C00005u
#define DTC_E_KEY_NOT_BOUND 0xD7C00006u
#define DTC_E_BACKEND 0xD7C00007u

/* CryptoContainer is an opaque handle for one hash or one AES job. */
typedef struct DtcContainer* CryptoContainer;

/* VKT_DTC_GetConstant sets |*ref| to the library's record for constant
 * |index| (1, 2 or 3) and |*length| to its length. The record belongs to the
 * library and stays valid for the life of the process. */
DTC_NODISCARD uint32_t VKT_DTC_GetConstant(uint32_t index, ProtectedKey** ref, uint32_t* length);

/* VKT_DTC_CreateCryptoContainer returns a new container, or NULL on failure.
 * The caller must hand it to VKT_DTC_DestroyCryptoContainer exactly once. */
DTC_NODISCARD CryptoContainer VKT_DTC_CreateCryptoContainer(void);

/* VKT_DTC_DestroyCryptoContainer releases |container| and wipes its state. */
DTC_NODISCARD uint32_t VKT_DTC_DestroyCryptoContainer(CryptoContainer container);

/* VKT_DTC_GetHash hashes |inLength| bytes of |in| with |selector| into |out|,
 * which must be attached. |*outLength| holds the capacity on entry and
 * receives the number of bytes produced (32). */
DTC_NODISCARD uint32_t VKT_DTC_GetHash(CryptoContainer container, uint32_t selector,
                                       const ProtectedKey* in, uint32_t inLength, ProtectedKey* out,
                                       uint32_t* outLength);

/* VKT_DTC_AES_Init prepares |container| for one VKT_DTC_AES_Process in
 * |direction| and |mode| under |key| (|keyLength| bytes) and the parameter
 * record |param| (constant 2). */
DTC_NODISCARD uint32_t VKT_DTC_AES_Init(CryptoContainer container, uint32_t direction,
                                        uint32_t mode, const ProtectedKey* key, uint32_t keyLength,
                                        const ProtectedKey* param);

/* VKT_DTC_AES_Process transforms |inLength| bytes of |in| (a multiple of 16)
 * into |out|, which must be attached to an array of at least |inLength|
 * bytes, and sets |*outLength| to the number of bytes produced. */
DTC_NODISCARD uint32_t VKT_DTC_AES_Process(CryptoContainer container, const ProtectedKey* in,
                                           uint32_t inLength, ProtectedKey* out,
                                           uint32_t* outLength);

/* ProtectedKey_Attach binds |key| to the caller's array |bytes|. |option|
 * must be 0 (a plain attachment). The record is unsized afterwards. */
DTC_NODISCARD uint32_t ProtectedKey_Attach(ProtectedKey* key, uint32_t option, uint8_t* bytes);

/* ProtectedKey_SetLength fixes the number of key bytes to |length| and takes
 * them in from the attached array, which holds them masked afterwards. */
DTC_NODISCARD uint32_t ProtectedKey_SetLength(ProtectedKey* key, uint32_t length);

/* ProtectedKey_ByteAt returns the plain key byte at |index|. */
uint8_t ProtectedKey_ByteAt(const ProtectedKey* key, uint32_t index);

#ifdef __cplusplus
}
#endif

#endif /* KMM_CRYPTO_DTC_H */
