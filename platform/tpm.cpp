#include "platform/tpm.h"

#include <tss2/tss2_rc.h>
#include <tss2/tss2_sys.h>

#include <cstdlib>
#include <cstring>

#include "platform/pcp_tcti.h"

namespace keymgr::tpm {

namespace {

// tpm2-tss writes an error line to stderr for every failed command, the
// expected ones here included (a wrong password, a missing key, a taken
// handle, an absent TPM). Callers only see 0 or non-zero and print their own
// line for the step, so the library's log is switched off for this process.
// Each tpm2-tss module reads TSS2_LOG the first time it logs, so setting it
// before the first ESAPI call is enough; a TSS2_LOG the user has set is kept
// (no overwrite), so the log can still be had when chasing a fault.
void QuietTssLog() {
  setenv("TSS2_LOG", "all+none", 0);
}

// FlushLeftovers flushes every transient object and session the TPM holds.
// Without a resource manager the TPM keeps whatever a process loaded until
// someone flushes it, so a process that died part way (killed, or its host
// reset without the TPM) leaves its objects and sessions behind, and a few of
// them fill the TPM's slots for good. It is safe here because without a
// resource manager only one process can hold the TPM at a time (the kernel
// opens /dev/tpm0 exclusively, a simulator serves one connection at a time):
// whatever is loaded when a call starts belongs to nobody alive.
void FlushLeftovers(Connection& tpm) {
  TSS2_SYS_CONTEXT* sys = nullptr;
  if (!Check("Esys_GetSysContext", Esys_GetSysContext(tpm.ctx(), &sys)).ok()) {
    return;
  }
  for (uint32_t first :
       {TPM2_TRANSIENT_FIRST, TPM2_LOADED_SESSION_FIRST, TPM2_ACTIVE_SESSION_FIRST}) {
    TPMI_YES_NO more = TPM2_NO;
    Output<TPMS_CAPABILITY_DATA> data;
    if (!Check("Esys_GetCapability",
               Esys_GetCapability(tpm.ctx(), ESYS_TR_NONE, ESYS_TR_NONE, ESYS_TR_NONE,
                                  TPM2_CAP_HANDLES, first, TPM2_MAX_CAP_HANDLES, &more, data.out()))
             .ok()) {
      continue;
    }
    // ESAPI knows nothing of these handles, so they go as raw commands.
    for (uint32_t i = 0; i < data.get()->data.handles.count; ++i) {
      const TPM2_HANDLE handle = data.get()->data.handles.handle[i];
      if ((handle >> TPM2_HR_SHIFT) == (first >> TPM2_HR_SHIFT)) {
        (void)Check("Tss2_Sys_FlushContext", Tss2_Sys_FlushContext(sys, handle));
      }
    }
  }
}

// CreatePrimary makes the owner hierarchy's storage primary key from a fixed
// ECC P-256 template; the same template gives the same key on every call, so
// it need not be kept in the TPM between calls.
Status CreatePrimary(Connection& tpm) {
  TPM2B_SENSITIVE_CREATE sensitive{};
  TPM2B_PUBLIC templ{};
  TPMT_PUBLIC& area = templ.publicArea;
  area.type = TPM2_ALG_ECC;
  area.nameAlg = TPM2_ALG_SHA256;
  area.objectAttributes = TPMA_OBJECT_RESTRICTED | TPMA_OBJECT_DECRYPT | TPMA_OBJECT_FIXEDTPM |
                          TPMA_OBJECT_FIXEDPARENT | TPMA_OBJECT_SENSITIVEDATAORIGIN |
                          TPMA_OBJECT_USERWITHAUTH | TPMA_OBJECT_NODA;
  TPMS_ECC_PARMS& ecc = area.parameters.eccDetail;
  ecc.symmetric.algorithm = TPM2_ALG_AES;
  ecc.symmetric.keyBits.aes = 128;
  ecc.symmetric.mode.aes = TPM2_ALG_CFB;
  ecc.scheme.scheme = TPM2_ALG_NULL;
  ecc.curveID = TPM2_ECC_NIST_P256;
  ecc.kdf.scheme = TPM2_ALG_NULL;
  TPM2B_DATA outsideInfo{};
  TPML_PCR_SELECTION pcrs{};
  ESYS_TR primary = ESYS_TR_NONE;
  Status status =
      Check("Esys_CreatePrimary",
            Esys_CreatePrimary(tpm.ctx(), ESYS_TR_RH_OWNER, ESYS_TR_PASSWORD, ESYS_TR_NONE,
                               ESYS_TR_NONE, &sensitive, &templ, &outsideInfo, &pcrs, &primary,
                               nullptr, nullptr, nullptr, nullptr));
  if (status.ok()) {
    tpm.primary.reset(tpm.Object(primary));
  }
  return status;
}

}  // namespace

Status TssFailure(const char* call, TSS2_RC rc) {
  return Status::Failure(Origin::kTss, call, rc, Tss2_RC_Decode(rc));
}

void FinalizeTcti(TSS2_TCTI_CONTEXT* tcti) {
  Tss2_TctiLdr_Finalize(&tcti);
}

void FinalizeEsys(ESYS_CONTEXT* esys) {
  Esys_Finalize(&esys);
}

void FlushObject(EsysObject object) {
  (void)Check("Esys_FlushContext", Esys_FlushContext(object.esys, object.tr));
}

void CloseObject(EsysObject object) {
  // ESAPI keeps the auth value (16 bytes here) in its own memory;
  // overwrite it first.
  TPM2B_AUTH blank{};
  blank.size = 16;
  (void)Check("Esys_TR_SetAuth", Esys_TR_SetAuth(object.esys, object.tr, &blank));
  (void)Check("Esys_TR_Close", Esys_TR_Close(object.esys, &object.tr));
}

bool HasResourceManager(const char* tcti) {
  return std::strncmp(tcti, "device:/dev/tpmrm", 17) == 0 || std::strncmp(tcti, "tabrmd", 6) == 0;
}

Status Connect(Connection& tpm) {
  QuietTssLog();
  if (Status status =
          Check("Tss2_TctiLdr_Initialize", Tss2_TctiLdr_Initialize(kPcpTcti, tpm.tcti.out()));
      !status.ok()) {
    return status;
  }
  if (Status status =
          Check("Esys_Initialize", Esys_Initialize(tpm.esys.out(), tpm.tcti.get(), nullptr));
      !status.ok()) {
    return status;
  }
  const TSS2_RC rc = Esys_Startup(tpm.ctx(), TPM2_SU_CLEAR);
  if (rc != TPM2_RC_INITIALIZE) {
    if (Status status = Check("Esys_Startup", rc); !status.ok()) {
      return status;
    }
  }
  if (!HasResourceManager(kPcpTcti)) {
    FlushLeftovers(tpm);
  }
  return Status();
}

Status StartSaltedSession(Connection& tpm, TPMA_SESSION attributes) {
  if (Status status = CreatePrimary(tpm); !status.ok()) {
    return status;
  }
  TPMT_SYM_DEF symmetric{};
  symmetric.algorithm = TPM2_ALG_AES;
  symmetric.keyBits.aes = 128;
  symmetric.mode.aes = TPM2_ALG_CFB;
  ESYS_TR session = ESYS_TR_NONE;
  if (Status status =
          Check("Esys_StartAuthSession",
                Esys_StartAuthSession(tpm.ctx(), tpm.primary.get().tr, ESYS_TR_NONE, ESYS_TR_NONE,
                                      ESYS_TR_NONE, ESYS_TR_NONE, nullptr, TPM2_SE_HMAC, &symmetric,
                                      TPM2_ALG_SHA256, &session));
      !status.ok()) {
    return status;
  }
  tpm.session.reset(tpm.Object(session));
  // The session stays loaded after each command, so that it is flushed on
  // every path, failed commands included.
  return Check("Esys_TRSess_SetAttributes",
               Esys_TRSess_SetAttributes(tpm.ctx(), session,
                                         TPMA_SESSION_CONTINUESESSION | attributes, 0xff));
}

}  // namespace keymgr::tpm
