// One typed wrapper per TPM command the key manager sends. Each sends its
// command through Exchange within the connection's deadline and names its
// failure once (the ESAPI call, or the TPM command for one sent raw); the
// flows call these and nothing below them. Private to tpm/.
#pragma once

#include <cstdint>

#include "tpm/connection.h"

namespace keymgr::tpm {

// Startup sends TPM2_Startup(CLEAR), once: it is part of the recovery.
Status Startup(Connection& tpm);

// GetCapability asks for up to |count| entries of |capability| from
// |property| on.
Status GetCapability(Connection& tpm, TPM2_CAP capability, std::uint32_t property,
                     std::uint32_t count, TPMS_CAPABILITY_DATA* data,
                     Retry retry = Retry::kRecover);

// FlushContext flushes the transient object or session at |handle|.
Status FlushContext(Connection& tpm, TPM2_HANDLE handle, Retry retry = Retry::kRecover);

// ReadPublic reads the public area of the object at |handle| and checks it
// against the name the TPM gives for it.
Status ReadPublic(Connection& tpm, TPM2_HANDLE handle, TPM2B_PUBLIC* area);

// OpenPersistent makes an ESAPI object of the persistent object at |handle|
// (ESAPI reads its public area with TPM2_ReadPublic).
Status OpenPersistent(Connection& tpm, TPM2_HANDLE handle, ESYS_TR* object);

// CreatePrimary creates a primary of the owner hierarchy from |templ|.
Status CreatePrimary(Connection& tpm, const TPM2B_PUBLIC& templ, ESYS_TR* primary);

// CreateLoaded creates and loads a child of |parent| from |templ|, the
// sensitive part carried in |session|, and gives its public area.
Status CreateLoaded(Connection& tpm, ESYS_TR parent, ESYS_TR session,
                    const TPM2B_SENSITIVE_CREATE& sensitive, const TPM2B_TEMPLATE& templ,
                    ESYS_TR* loaded, Output<TPM2B_PUBLIC>* area);

// EvictControl makes the loaded object at |object| persistent at
// |persistent|, or evicts the persistent object when both are the same
// (owner authorisation, the empty password).
Status EvictControl(Connection& tpm, TPM2_HANDLE object, TPM2_HANDLE persistent);

// StartAuthSession starts a session of |type| salted by |tpmKey| and bound to
// |bind| (either may be ESYS_TR_NONE) with |nonce| as the caller's nonce.
Status StartAuthSession(Connection& tpm, ESYS_TR tpmKey, ESYS_TR bind, const TPM2B_NONCE& nonce,
                        TPM2_SE type, const TPMT_SYM_DEF& symmetric, ESYS_TR* session);

// PolicyPCR adds the PCRs of |pcrs| as they stand to the policy of |session|.
Status PolicyPCR(Connection& tpm, ESYS_TR session, const TPML_PCR_SELECTION& pcrs);

// PolicyAuthValue adds the object's password to the policy of |session|.
Status PolicyAuthValue(Connection& tpm, ESYS_TR session);

// RsaDecrypt decrypts |cipher| with RSA-OAEP (SHA-256) under |key|,
// authorised in |session|.
Status RsaDecrypt(Connection& tpm, ESYS_TR key, ESYS_TR session, const TPM2B_PUBLIC_KEY_RSA& cipher,
                  SecretOutput<TPM2B_PUBLIC_KEY_RSA>* message);

// GetRandom draws up to |count| bytes of the TPM's generator, the response
// encrypted in |session| (or in clear with ESYS_TR_NONE). The response is
// wiped from ESAPI's buffer.
Status GetRandom(Connection& tpm, ESYS_TR session, std::uint16_t count,
                 SecretOutput<TPM2B_DIGEST>* random);

// PcrExtend extends PCR |pcr| with |digests|, authorised with the
// platform's empty password in |session|: a salted HMAC session, so that a
// command changed on its way is refused.
Status PcrExtend(Connection& tpm, std::uint32_t pcr, ESYS_TR session,
                 const TPML_DIGEST_VALUES& digests);

// LoadExternal loads the public key |area| into the owner hierarchy, so
// that the tickets of its signatures serve a policy.
Status LoadExternal(Connection& tpm, const TPM2B_PUBLIC& area, ESYS_TR* key);

// VerifySignature checks |signature| of |digest| under |key| and gives the
// TPM's ticket for it.
Status VerifySignature(Connection& tpm, ESYS_TR key, const TPM2B_DIGEST& digest,
                       const TPMT_SIGNATURE& signature, Output<TPMT_TK_VERIFIED>* ticket);

// PolicyAuthorize replaces the digest of |session|, which must equal
// |approved|, by the one that |signer|'s approval of it for |policyRef|
// stands for, proved by |ticket|.
Status PolicyAuthorize(Connection& tpm, ESYS_TR session, const TPM2B_DIGEST& approved,
                       const TPM2B_NONCE& policyRef, const TPM2B_NAME& signer,
                       const TPMT_TK_VERIFIED& ticket);

// PolicyNV compares the NV index's data from its start with |operand| by
// |operation|, reading it with the index's empty password.
Status PolicyNV(Connection& tpm, ESYS_TR session, ESYS_TR index, const TPM2B_OPERAND& operand,
                TPM2_EO operation);

// PolicyCommandCode limits |session| to the command |code|.
Status PolicyCommandCode(Connection& tpm, ESYS_TR session, TPM2_CC code);

// NvDefineSpace defines the NV index of |area| with an empty password, with
// the owner's empty password.
Status NvDefineSpace(Connection& tpm, const TPM2B_NV_PUBLIC& area, ESYS_TR* index);

// NvRead reads |size| bytes of |index| from its start with the index's
// empty password, authorised in |session|.
Status NvRead(Connection& tpm, ESYS_TR index, ESYS_TR session, std::uint16_t size,
              Output<TPM2B_MAX_NV_BUFFER>* data);

// NvIncrement adds one to the counter |index|, authorised in |session|.
Status NvIncrement(Connection& tpm, ESYS_TR index, ESYS_TR session);

}  // namespace keymgr::tpm
