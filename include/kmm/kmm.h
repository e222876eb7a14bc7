/* Key-management module: keeps the device's store key sealed in EEPROM under
 * a one-off key that the TPM seals, and proves at boot that the key material
 * is intact. C interface for host programs. */
#ifndef KMM_KMM_H
#define KMM_KMM_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The version of this interface: 2.3. */
#define KMM_VERSION_MAJOR 2
#define KMM_VERSION_MINOR 3

#define KMM_OPTION_NORMAL_BOOT 1
#define KMM_OPTION_REGENERATE 3

/* ProtectedKey is the module's record over a run of key bytes held in an
 * array of the context. Once the module has sized it, the array holds the
 * bytes masked under a key of the process, never in plain form. The context
 * holds three by value, so its layout is part of this interface, but a host
 * treats the fields as opaque: it has no call that reads them. */
typedef struct ProtectedKey {
  uint8_t* bytes;  /* the attached array */
  uint64_t nonce;  /* selects this record's mask stream */
  uint32_t length; /* number of key bytes taken in */
  uint32_t state;  /* attached / sized */
} ProtectedKey;

/* The seed key: local date text, calendar time, eight random words. */
typedef struct KmmSeedKey {
  char seedDate[8];       /* "%04d%02d%02d", no terminator */
  uint8_t seedTime[4];    /* seconds, native byte order */
  uint8_t seedRandom[32]; /* eight results of random(), native byte order */
} KmmSeedKey;

/* KeyContext holds all key material of the module. There is one static
 * instance; KeyManage zeroes it on every call. What a host may rely on after
 * a successful call: the lengths (seedKeyLength 44, secretKeyLength 32 after
 * a regeneration and 48 after a normal boot, storeKeyLength 48) and
 * statusWord. The key areas (oneOffKey, seedKey, secretKeyBytes,
 * storeKeyBytes) are held masked by their records, or zero where the flow
 * did not reach them: they never show key bytes in plain form. */
typedef struct KeyContext {
  uint8_t oneOffKey[32];
  KmmSeedKey seedKey;
  uint8_t secretKeyBytes[48];
  uint8_t storeKeyBytes[48];
  uint8_t reserved[476];
  uint16_t statusWord;
  ProtectedKey* oneOffKeyRef;
  uint32_t oneOffKeyRefLength;
  ProtectedKey seedKeyPK;
  uint32_t seedKeyLength;
  ProtectedKey secretKeyPK;
  uint32_t secretKeyLength;
  ProtectedKey storeKeyPK;
  uint32_t storeKeyLength;
  ProtectedKey* cipherParamRef;
  uint32_t cipherParamLength;
} KeyContext;

/* KeyManage zeroes the module's context and runs |option|:
 * KMM_OPTION_NORMAL_BOOT proves the key material (recording DT=OK/DT=FAIL in
 * the boot status log when |logFlag| is non-zero), KMM_OPTION_REGENERATE
 * replaces it (seeding the C library generator first, through KmmSeedRandom,
 * when this process has not). Returns the context on success and NULL on
 * failure or for any other option. The contents are valid until the next
 * call; the module is not reentrant. From the first call on the process holds
 * key material and is made non-dumpable (PR_SET_DUMPABLE 0): the kernel
 * writes no core of it. */
KeyContext* KeyManage(int32_t option, int logFlag);

/* Sources that KmmSeedRandom reports. */
#define KMM_ENTROPY_TPM 1
#define KMM_ENTROPY_GETRANDOM 2

/* KmmSeedRandom fills the whole state of the C library generator (random())
 * with fresh random bytes: the TPM's mixed with the kernel's getrandom, or
 * either alone when the other cannot be had; the kernel is waited for only
 * when the TPM does not answer. The module builds the seed key from that
 * generator, and calls this itself before a regeneration in a process that
 * has not; without any source the regeneration fails. Returns
 * KMM_ENTROPY_TPM or KMM_ENTROPY_GETRANDOM, the source used, or -1 when
 * neither answered (the generator is then left as it was). It replaces
 * whatever seeding the host did before; seeding the host does after it is
 * what the next seed key is made of. */
int KmmSeedRandom(void);

/* KmmPersistSrk makes the TPM's standard storage root key persistent at
 * 0x81000001 (ECC P-256 under the owner hierarchy, TCG's storage template),
 * or finds it there. Regenerations then create their key under it instead of
 * creating a primary each time. Returns 0, or -1 when the TPM cannot be
 * reached or something else occupies the handle. */
int KmmPersistSrk(void);

/* CheckDmsetupDigest compares the SHA-256 of the disk-mapper tool with the
 * built-in expected digest. Returns 0 on a match, -1 otherwise. */
int CheckDmsetupDigest(void);

#ifdef __cplusplus
}
#endif

#endif /* KMM_KMM_H */
