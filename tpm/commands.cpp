#include "tpm/commands.h"

#include <tss2/tss2_mu.h>

#include <array>
#include <cstring>

#include "crypto/hash.h"
#include "util/endian.h"

namespace keymgr::tpm {

namespace {

// Raw sends the raw command that |prepare| prepared on ESAPI's own SAPI
// context: for handles ESAPI does not know, and for a public area whose
// name is checked here.
template <class Prepare>
Status Raw(Connection& tpm, const char* call, Retry retry, Prepare prepare) {
  return Exchange(
      tpm, call, retry,
      [&] {
        const TSS2_RC rc = prepare();
        return rc != TSS2_RC_SUCCESS ? rc : Tss2_Sys_ExecuteAsync(tpm.sys);
      },
      [&] { return Tss2_Sys_ExecuteFinish(tpm.sys, tpm.waitMs); });
}

// OwnerPassword is the owner's (or platform's) empty password, given in
// the clear.
TSS2L_SYS_AUTH_COMMAND OwnerPassword() {
  TSS2L_SYS_AUTH_COMMAND auths{};
  auths.count = 1;
  auths.auths[0].sessionHandle = TPM2_RH_PW;
  return auths;
}

// NameMatches tells whether |name| is the SHA-256 name of |area|: the name
// algorithm and the digest of the marshalled public area.
bool NameMatches(const TPM2B_PUBLIC& area, const TPM2B_NAME& name) {
  std::array<std::uint8_t, sizeof(TPMT_PUBLIC)> marshalled{};
  std::size_t size = 0;
  std::array<std::uint8_t, crypto::kSha256Size> digest{};
  crypto::Sha256 sha;
  return area.publicArea.nameAlg == TPM2_ALG_SHA256 && name.size == 2 + digest.size() &&
         Tss2_MU_TPMT_PUBLIC_Marshal(&area.publicArea, marshalled.data(), marshalled.size(),
                                     &size) == TSS2_RC_SUCCESS &&
         sha.Update(marshalled.data(), size).ok() && sha.Final(digest).ok() &&
         LoadBig16(name.name) == TPM2_ALG_SHA256 &&
         std::memcmp(name.name + 2, digest.data(), digest.size()) == 0;
}

}  // namespace

Status Startup(Connection& tpm) {
  return Exchange(
      tpm, "Esys_Startup", Retry::kOnce,
      [&] { return Esys_Startup_Async(tpm.ctx(), TPM2_SU_CLEAR); },
      [&] { return Esys_Startup_Finish(tpm.ctx()); });
}

Status GetCapability(Connection& tpm, TPM2_CAP capability, std::uint32_t property,
                     std::uint32_t count, TPMS_CAPABILITY_DATA* data, Retry retry) {
  if (Status status =
          Raw(tpm, "TPM2_GetCapability", retry,
              [&] { return Tss2_Sys_GetCapability_Prepare(tpm.sys, capability, property, count); });
      !status.ok()) {
    return status;
  }
  TPMI_YES_NO more = TPM2_NO;
  *data = TPMS_CAPABILITY_DATA{};
  return Check("Tss2_Sys_GetCapability_Complete",
               Tss2_Sys_GetCapability_Complete(tpm.sys, &more, data));
}

Status FlushContext(Connection& tpm, TPM2_HANDLE handle, Retry retry) {
  return Raw(tpm, "TPM2_FlushContext", retry,
             [&] { return Tss2_Sys_FlushContext_Prepare(tpm.sys, handle); });
}

Status ReadPublic(Connection& tpm, TPM2_HANDLE handle, TPM2B_PUBLIC* area) {
  if (Status status = Raw(tpm, "TPM2_ReadPublic", Retry::kRecover,
                          [&] { return Tss2_Sys_ReadPublic_Prepare(tpm.sys, handle); });
      !status.ok()) {
    return status;
  }
  TPM2B_NAME name{};
  TPM2B_NAME qualified{};
  *area = TPM2B_PUBLIC{};
  if (Status status = Check("Tss2_Sys_ReadPublic_Complete",
                            Tss2_Sys_ReadPublic_Complete(tpm.sys, area, &name, &qualified));
      !status.ok()) {
    return status;
  }
  // A public area that does not hash to the name is not the object's.
  return NameMatches(*area, name) ? Status() : Refused("public area does not match its name");
}

Status OpenPersistent(Connection& tpm, TPM2_HANDLE handle, ESYS_TR* object) {
  return Exchange(
      tpm, "Esys_TR_FromTPMPublic", Retry::kRecover,
      [&] {
        return Esys_TR_FromTPMPublic_Async(tpm.ctx(), handle, ESYS_TR_NONE, ESYS_TR_NONE,
                                           ESYS_TR_NONE);
      },
      [&] { return Esys_TR_FromTPMPublic_Finish(tpm.ctx(), object); });
}

Status CreatePrimary(Connection& tpm, const TPM2B_PUBLIC& templ, ESYS_TR* primary) {
  const TPM2B_SENSITIVE_CREATE sensitive{};
  const TPM2B_DATA outsideInfo{};
  const TPML_PCR_SELECTION pcrs{};
  return Exchange(
      tpm, "Esys_CreatePrimary", Retry::kRecover,
      [&] {
        return Esys_CreatePrimary_Async(tpm.ctx(), ESYS_TR_RH_OWNER, ESYS_TR_PASSWORD, ESYS_TR_NONE,
                                        ESYS_TR_NONE, &sensitive, &templ, &outsideInfo, &pcrs);
      },
      [&] {
        return Esys_CreatePrimary_Finish(tpm.ctx(), primary, nullptr, nullptr, nullptr, nullptr);
      });
}

Status CreateLoaded(Connection& tpm, ESYS_TR parent, ESYS_TR session,
                    const TPM2B_SENSITIVE_CREATE& sensitive, const TPM2B_TEMPLATE& templ,
                    ESYS_TR* loaded, Output<TPM2B_PUBLIC>* area) {
  return Exchange(
      tpm, "Esys_CreateLoaded", Retry::kRecover,
      [&] {
        return Esys_CreateLoaded_Async(tpm.ctx(), parent, session, ESYS_TR_NONE, ESYS_TR_NONE,
                                       &sensitive, &templ);
      },
      [&] { return Esys_CreateLoaded_Finish(tpm.ctx(), loaded, nullptr, area->out()); });
}

Status EvictControl(Connection& tpm, TPM2_HANDLE object, TPM2_HANDLE persistent) {
  const TSS2L_SYS_AUTH_COMMAND auths = OwnerPassword();
  if (Status status = Raw(tpm, "TPM2_EvictControl", Retry::kRecover,
                          [&] {
                            const TSS2_RC rc = Tss2_Sys_EvictControl_Prepare(tpm.sys, TPM2_RH_OWNER,
                                                                             object, persistent);
                            return rc != TSS2_RC_SUCCESS ? rc
                                                         : Tss2_Sys_SetCmdAuths(tpm.sys, &auths);
                          });
      !status.ok()) {
    return status;
  }
  return Check("Tss2_Sys_EvictControl_Complete", Tss2_Sys_EvictControl_Complete(tpm.sys));
}

Status StartAuthSession(Connection& tpm, ESYS_TR tpmKey, ESYS_TR bind, const TPM2B_NONCE& nonce,
                        TPM2_SE type, const TPMT_SYM_DEF& symmetric, ESYS_TR* session) {
  *session = ESYS_TR_NONE;
  return Exchange(
      tpm, "Esys_StartAuthSession", Retry::kRecover,
      [&] {
        return Esys_StartAuthSession_Async(tpm.ctx(), tpmKey, bind, ESYS_TR_NONE, ESYS_TR_NONE,
                                           ESYS_TR_NONE, &nonce, type, &symmetric, TPM2_ALG_SHA256);
      },
      [&] { return Esys_StartAuthSession_Finish(tpm.ctx(), session); });
}

Status PolicyPCR(Connection& tpm, ESYS_TR session, const TPML_PCR_SELECTION& pcrs) {
  const TPM2B_DIGEST current{};  // the TPM takes the PCRs' values as they stand
  return Exchange(
      tpm, "Esys_PolicyPCR", Retry::kRecover,
      [&] {
        return Esys_PolicyPCR_Async(tpm.ctx(), session, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE,
                                    &current, &pcrs);
      },
      [&] { return Esys_PolicyPCR_Finish(tpm.ctx()); });
}

Status PolicyAuthValue(Connection& tpm, ESYS_TR session) {
  return Exchange(
      tpm, "Esys_PolicyAuthValue", Retry::kRecover,
      [&] {
        return Esys_PolicyAuthValue_Async(tpm.ctx(), session, ESYS_TR_NONE, ESYS_TR_NONE,
                                          ESYS_TR_NONE);
      },
      [&] { return Esys_PolicyAuthValue_Finish(tpm.ctx()); });
}

Status RsaDecrypt(Connection& tpm, ESYS_TR key, ESYS_TR session, const TPM2B_PUBLIC_KEY_RSA& cipher,
                  SecretOutput<TPM2B_PUBLIC_KEY_RSA>* message) {
  TPMT_RSA_DECRYPT scheme{};
  scheme.scheme = TPM2_ALG_OAEP;
  scheme.details.oaep.hashAlg = TPM2_ALG_SHA256;
  const TPM2B_DATA label{};
  Status status = Exchange(
      tpm, "Esys_RSA_Decrypt", Retry::kRecover,
      [&] {
        return Esys_RSA_Decrypt_Async(tpm.ctx(), key, session, ESYS_TR_NONE, ESYS_TR_NONE, &cipher,
                                      &scheme, &label);
      },
      [&] { return Esys_RSA_Decrypt_Finish(tpm.ctx(), message->out()); });
  WipeResponse(tpm);
  return status;
}

Status GetRandom(Connection& tpm, ESYS_TR session, std::uint16_t count,
                 SecretOutput<TPM2B_DIGEST>* random) {
  Status status = Exchange(
      tpm, "Esys_GetRandom", Retry::kRecover,
      [&] { return Esys_GetRandom_Async(tpm.ctx(), session, ESYS_TR_NONE, ESYS_TR_NONE, count); },
      [&] { return Esys_GetRandom_Finish(tpm.ctx(), random->out()); });
  WipeResponse(tpm);
  return status;
}

Status PcrExtend(Connection& tpm, std::uint32_t pcr, ESYS_TR session,
                 const TPML_DIGEST_VALUES& digests) {
  const ESYS_TR handle = ESYS_TR_PCR0 + pcr;
  return Exchange(
      tpm, "Esys_PCR_Extend", Retry::kRecover,
      [&] {
        return Esys_PCR_Extend_Async(tpm.ctx(), handle, session, ESYS_TR_NONE, ESYS_TR_NONE,
                                     &digests);
      },
      [&] { return Esys_PCR_Extend_Finish(tpm.ctx()); });
}

Status LoadExternal(Connection& tpm, const TPM2B_PUBLIC& area, ESYS_TR* key) {
  return Exchange(
      tpm, "Esys_LoadExternal", Retry::kRecover,
      [&] {
        return Esys_LoadExternal_Async(tpm.ctx(), ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE, nullptr,
                                       &area, ESYS_TR_RH_OWNER);
      },
      [&] { return Esys_LoadExternal_Finish(tpm.ctx(), key); });
}

Status VerifySignature(Connection& tpm, ESYS_TR key, const TPM2B_DIGEST& digest,
                       const TPMT_SIGNATURE& signature, Output<TPMT_TK_VERIFIED>* ticket) {
  return Exchange(
      tpm, "Esys_VerifySignature", Retry::kRecover,
      [&] {
        return Esys_VerifySignature_Async(tpm.ctx(), key, ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE,
                                          &digest, &signature);
      },
      [&] { return Esys_VerifySignature_Finish(tpm.ctx(), ticket->out()); });
}

Status PolicyAuthorize(Connection& tpm, ESYS_TR session, const TPM2B_DIGEST& approved,
                       const TPM2B_NONCE& policyRef, const TPM2B_NAME& signer,
                       const TPMT_TK_VERIFIED& ticket) {
  return Exchange(
      tpm, "Esys_PolicyAuthorize", Retry::kRecover,
      [&] {
        return Esys_PolicyAuthorize_Async(tpm.ctx(), session, ESYS_TR_NONE, ESYS_TR_NONE,
                                          ESYS_TR_NONE, &approved, &policyRef, &signer, &ticket);
      },
      [&] { return Esys_PolicyAuthorize_Finish(tpm.ctx()); });
}

Status PolicyNV(Connection& tpm, ESYS_TR session, ESYS_TR index, const TPM2B_OPERAND& operand,
                TPM2_EO operation) {
  return Exchange(
      tpm, "Esys_PolicyNV", Retry::kRecover,
      [&] {
        return Esys_PolicyNV_Async(tpm.ctx(), index, index, session, ESYS_TR_PASSWORD, ESYS_TR_NONE,
                                   ESYS_TR_NONE, &operand, 0, operation);
      },
      [&] { return Esys_PolicyNV_Finish(tpm.ctx()); });
}

Status PolicyCommandCode(Connection& tpm, ESYS_TR session, TPM2_CC code) {
  return Exchange(
      tpm, "Esys_PolicyCommandCode", Retry::kRecover,
      [&] {
        return Esys_PolicyCommandCode_Async(tpm.ctx(), session, ESYS_TR_NONE, ESYS_TR_NONE,
                                            ESYS_TR_NONE, code);
      },
      [&] { return Esys_PolicyCommandCode_Finish(tpm.ctx()); });
}

Status NvDefineSpace(Connection& tpm, const TPM2B_NV_PUBLIC& area, ESYS_TR* index) {
  const TPM2B_AUTH auth{};
  return Exchange(
      tpm, "Esys_NV_DefineSpace", Retry::kRecover,
      [&] {
        return Esys_NV_DefineSpace_Async(tpm.ctx(), ESYS_TR_RH_OWNER, ESYS_TR_PASSWORD,
                                         ESYS_TR_NONE, ESYS_TR_NONE, &auth, &area);
      },
      [&] { return Esys_NV_DefineSpace_Finish(tpm.ctx(), index); });
}

Status NvRead(Connection& tpm, ESYS_TR index, ESYS_TR session, std::uint16_t size,
              Output<TPM2B_MAX_NV_BUFFER>* data) {
  return Exchange(
      tpm, "Esys_NV_Read", Retry::kRecover,
      [&] {
        return Esys_NV_Read_Async(tpm.ctx(), index, index, session, ESYS_TR_NONE, ESYS_TR_NONE,
                                  size, 0);
      },
      [&] { return Esys_NV_Read_Finish(tpm.ctx(), data->out()); });
}

Status NvIncrement(Connection& tpm, ESYS_TR index, ESYS_TR session) {
  return Exchange(
      tpm, "Esys_NV_Increment", Retry::kRecover,
      [&] {
        return Esys_NV_Increment_Async(tpm.ctx(), index, index, session, ESYS_TR_NONE,
                                       ESYS_TR_NONE);
      },
      [&] { return Esys_NV_Increment_Finish(tpm.ctx()); });
}

}  // namespace keymgr::tpm
