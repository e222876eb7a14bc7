#include "platform/tpm.h"

#include <pthread.h>
#include <time.h>
#include <tss2/tss2_mu.h>
#include <tss2/tss2_rc.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "crypto/hash.h"
#include "keymgr_build_config.h"
#include "platform/pcp_tcti.h"
#include "platform/socket_tcti.h"
#include "util/random.h"

namespace keymgr::tpm {

namespace {

using Clock = std::chrono::steady_clock;

// tpm2-tss writes an error line to stderr for every failed command, the
// expected ones here included (a wrong password, a missing key, a taken
// handle, an absent TPM). Callers only see 0 or non-zero and print their own
// line for the step, so the library's log is switched off for this process.
// Each tpm2-tss module reads TSS2_LOG the first time it logs, so setting it
// before the first ESAPI call is enough; a TSS2_LOG the user has set is kept
// (no overwrite), so the log can still be had when chasing a fault.
// A build that keeps key bytes off the console overrides the user's
// TSS2_LOG too: tpm2-tss's trace shows session keys and auth values.
void QuietTssLog() {
  setenv("TSS2_LOG", "all+none", KEYMGR_REDACT_OOK);
}

bool IsTransportFailure(TSS2_RC rc) {
  return (rc & TSS2_RC_LAYER_MASK) == TSS2_TCTI_RC_LAYER;
}

bool IsTryAgain(TSS2_RC rc) {
  return (rc & ~TSS2_RC_LAYER_MASK) == TSS2_BASE_RC_TRY_AGAIN;
}

// A TPM without room for another object or session.
bool IsFull(TSS2_RC rc) {
  return rc == TPM2_RC_OBJECT_MEMORY || rc == TPM2_RC_SESSION_MEMORY ||
         rc == TPM2_RC_SESSION_HANDLES || rc == TPM2_RC_OBJECT_HANDLES;
}

// RawCommand sends the raw command that |prepare| prepared on ESAPI's own
// SAPI context.
template <class Prepare>
Status RawCommand(Connection& tpm, const char* call, Prepare prepare) {
  return Run(
      tpm, call,
      [&] {
        const TSS2_RC rc = prepare();
        return rc != TSS2_RC_SUCCESS ? rc : Tss2_Sys_ExecuteAsync(tpm.sys);
      },
      [&] { return Tss2_Sys_ExecuteFinish(tpm.sys, tpm.waitMs); });
}

// OwnHandles lists the TPM handles of what this connection holds, which a
// clean-up must not flush.
std::array<TPM2_HANDLE, 2> OwnHandles(Connection& tpm) {
  std::array<TPM2_HANDLE, 2> own{};
  for (std::size_t i = 0; const TransientObject* object : {&tpm.primary, &tpm.session}) {
    if (*object) {
      (void)Esys_TR_GetTpmHandle(tpm.ctx(), object->get().tr, &own[i]);
    }
    ++i;
  }
  return own;
}

// FlushLeftovers flushes every transient object and session the TPM holds
// but this connection. Without a resource manager the TPM keeps whatever a
// process loaded until someone flushes it, so a process that died part way
// (killed, or its host reset without the TPM) leaves its objects and
// sessions behind, and a few of them fill the TPM's slots for good. It is
// safe because without a resource manager only one process can hold the TPM
// at a time (the kernel opens /dev/tpm0 exclusively, a simulator serves one
// connection at a time): what this connection does not hold belongs to
// nobody alive.
void FlushLeftovers(Connection& tpm) {
  const auto own = OwnHandles(tpm);
  for (std::uint32_t first :
       {TPM2_TRANSIENT_FIRST, TPM2_LOADED_SESSION_FIRST, TPM2_ACTIVE_SESSION_FIRST}) {
    TPMS_CAPABILITY_DATA data{};
    TPMI_YES_NO more = TPM2_NO;
    if (!RawCommand(tpm, "TPM2_GetCapability",
                    [&] {
                      return Tss2_Sys_GetCapability_Prepare(tpm.sys, TPM2_CAP_HANDLES, first,
                                                            TPM2_MAX_CAP_HANDLES);
                    })
             .ok() ||
        Tss2_Sys_GetCapability_Complete(tpm.sys, &more, &data) != TSS2_RC_SUCCESS) {
      continue;
    }
    for (std::uint32_t i = 0; i < data.data.handles.count; ++i) {
      const TPM2_HANDLE handle = data.data.handles.handle[i];
      if ((handle >> TPM2_HR_SHIFT) == (first >> TPM2_HR_SHIFT) &&
          std::find(own.begin(), own.end(), handle) == own.end()) {
        (void)RawCommand(tpm, "TPM2_FlushContext",
                         [&] { return Tss2_Sys_FlushContext_Prepare(tpm.sys, handle); });
      }
    }
  }
}

// The storage template of TCG's provisioning guidance: ECC P-256, AES-128
// CFB, no policy, an all-zero unique field. Created with it, the primary is
// the same key as the persistent SRK.
TPM2B_PUBLIC SrkTemplate() {
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
  area.unique.ecc.x.size = 32;
  area.unique.ecc.y.size = 32;
  return templ;
}

// IsStandardSrk tells whether |area| was made from the storage template.
bool IsStandardSrk(const TPMT_PUBLIC& area) {
  const TPMT_PUBLIC expected = SrkTemplate().publicArea;
  const TPMS_ECC_PARMS& ecc = area.parameters.eccDetail;
  const TPMS_ECC_PARMS& want = expected.parameters.eccDetail;
  return area.type == expected.type && area.nameAlg == expected.nameAlg &&
         area.objectAttributes == expected.objectAttributes && area.authPolicy.size == 0 &&
         ecc.symmetric.algorithm == want.symmetric.algorithm &&
         ecc.symmetric.keyBits.aes == want.symmetric.keyBits.aes &&
         ecc.symmetric.mode.aes == want.symmetric.mode.aes &&
         ecc.scheme.scheme == want.scheme.scheme && ecc.curveID == want.curveID &&
         ecc.kdf.scheme == want.kdf.scheme;
}

Status CreatePrimary(Connection& tpm) {
  TPM2B_SENSITIVE_CREATE sensitive{};
  const TPM2B_PUBLIC templ = SrkTemplate();
  TPM2B_DATA outsideInfo{};
  TPML_PCR_SELECTION pcrs{};
  ESYS_TR primary = ESYS_TR_NONE;
  Status status = Run(
      tpm, "Esys_CreatePrimary",
      [&] {
        return Esys_CreatePrimary_Async(tpm.ctx(), ESYS_TR_RH_OWNER, ESYS_TR_PASSWORD, ESYS_TR_NONE,
                                        ESYS_TR_NONE, &sensitive, &templ, &outsideInfo, &pcrs);
      },
      [&] {
        return Esys_CreatePrimary_Finish(tpm.ctx(), &primary, nullptr, nullptr, nullptr, nullptr);
      });
  if (status.ok()) {
    tpm.primary.reset(tpm.Object(primary));
  }
  return status;
}

// OpenSrk finds the standard SRK at kSrkHandle, when it is there.
Status OpenSrk(Connection& tpm) {
  TPM2B_PUBLIC area{};
  if (Status status = ReadPublic(tpm, kSrkHandle, &area); !status.ok()) {
    return status;
  }
  if (!IsStandardSrk(area.publicArea)) {
    return Refused("not the standard SRK");
  }
  ESYS_TR srk = ESYS_TR_NONE;
  Status status = Run(
      tpm, "Esys_TR_FromTPMPublic",
      [&] {
        return Esys_TR_FromTPMPublic_Async(tpm.ctx(), kSrkHandle, ESYS_TR_NONE, ESYS_TR_NONE,
                                           ESYS_TR_NONE);
      },
      [&] { return Esys_TR_FromTPMPublic_Finish(tpm.ctx(), &srk); });
  if (status.ok()) {
    tpm.srk.reset(tpm.Object(srk));
  }
  return status;
}

}  // namespace

Status TssFailure(const char* call, TSS2_RC rc) {
  return Status::Failure(Origin::kTss, call, rc, Tss2_RC_Decode(rc));
}

void FinalizeTcti(TSS2_TCTI_CONTEXT* tcti) {
  if (IsSocketTcti(tcti)) {
    FinalizeSocketTcti(tcti);
  } else {
    Tss2_TctiLdr_Finalize(&tcti);
  }
}

void FinalizeEsys(ESYS_CONTEXT* esys) {
  Esys_Finalize(&esys);
}

void FlushObject(EsysObject object) {
  Connection& tpm = *object.tpm;
  (void)Run(
      tpm, "Esys_FlushContext", [&] { return Esys_FlushContext_Async(tpm.ctx(), object.tr); },
      [&] { return Esys_FlushContext_Finish(tpm.ctx()); });
}

void CloseObject(EsysObject object) {
  // ESAPI keeps the auth value (16 bytes here) in its own memory;
  // overwrite it first.
  TPM2B_AUTH blank{};
  blank.size = 16;
  ESYS_CONTEXT* esys = object.tpm->ctx();
  (void)Check("Esys_TR_SetAuth", Esys_TR_SetAuth(esys, object.tr, &blank));
  (void)Check("Esys_TR_Close", Esys_TR_Close(esys, &object.tr));
}

void WipeResponse(Connection& tpm) {
  size_t size = 0;
  const uint8_t* parameters = nullptr;
  if (Tss2_Sys_GetRpBuffer(tpm.sys, &size, &parameters) == TSS2_RC_SUCCESS) {
    OPENSSL_cleanse(const_cast<uint8_t*>(parameters), size);
  }
}

SigpipeBlock::SigpipeBlock() {
  sigset_t pipe;
  sigemptyset(&pipe);
  sigaddset(&pipe, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipe, &saved_);
  sigset_t pending;
  sigpending(&pending);
  pendingBefore_ = sigismember(&pending, SIGPIPE) == 1;
}

SigpipeBlock::~SigpipeBlock() {
  sigset_t pipe;
  sigemptyset(&pipe);
  sigaddset(&pipe, SIGPIPE);
  sigset_t pending;
  sigpending(&pending);
  if (!pendingBefore_ && sigismember(&pending, SIGPIPE) == 1) {
    const timespec now{};
    (void)sigtimedwait(&pipe, nullptr, &now);
  }
  pthread_sigmask(SIG_SETMASK, &saved_, nullptr);
}

bool HasResourceManager(const char* tcti) {
  return std::strncmp(tcti, "device:/dev/tpmrm", 17) == 0 || std::strncmp(tcti, "tabrmd", 6) == 0;
}

Status Connect(Connection& tpm) {
  QuietTssLog();
  // A simulator's socket gets the transport with deadlines; every other
  // transport is tpm2-tss's.
  const std::string_view tcti = kPcpTcti;
  const Status opened =
      tcti == "swtpm" || tcti.starts_with("swtpm:")
          ? InitSocketTcti(kPcpTcti + std::min<std::size_t>(tcti.size(), 6), tpm.tcti.out())
          : Check("Tss2_TctiLdr_Initialize", Tss2_TctiLdr_Initialize(kPcpTcti, tpm.tcti.out()));
  if (!opened.ok()) {
    return opened;
  }
  if (Status status =
          Check("Esys_Initialize", Esys_Initialize(tpm.esys.out(), tpm.tcti.get(), nullptr));
      !status.ok()) {
    return status;
  }
  return Check("Esys_GetSysContext", Esys_GetSysContext(tpm.ctx(), &tpm.sys));
}

TSS2_RC SendOnce(Connection& tpm, TSS2_RC (*send)(void*), TSS2_RC (*finish)(void*), void* call) {
  if (tpm.broken) {
    return TSS2_ESYS_RC_BAD_SEQUENCE;
  }
  TSS2_RC rc = send(call);
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(kPcpDeadlineMs);
  while (rc == TSS2_RC_SUCCESS) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) {
      rc = TSS2_ESYS_RC_TRY_AGAIN;
      break;
    }
    tpm.waitMs = static_cast<std::int32_t>(left.count());
    (void)Esys_SetTimeout(tpm.ctx(), tpm.waitMs);
    rc = finish(call);
    if (!IsTryAgain(rc)) {
      break;
    }
    // Not answered yet (or the TPM asked for the command again): wait on
    // while the deadline allows.
    rc = TSS2_RC_SUCCESS;
  }
  // A command left unanswered, or a transport that failed, leaves ESAPI
  // mid-command.
  if (IsTryAgain(rc) || IsTransportFailure(rc)) {
    tpm.broken = true;
  }
  return rc;
}

bool Recover(Connection& tpm, TSS2_RC rc) {
  if (rc == TPM2_RC_INITIALIZE) {
    auto send = [](void* p) {
      return Esys_Startup_Async(static_cast<ESYS_CONTEXT*>(p), TPM2_SU_CLEAR);
    };
    auto finish = [](void* p) { return Esys_Startup_Finish(static_cast<ESYS_CONTEXT*>(p)); };
    const TSS2_RC started = SendOnce(tpm, send, finish, tpm.ctx());
    // "Already started" means another caller got there first.
    return started == TSS2_RC_SUCCESS || started == TPM2_RC_INITIALIZE;
  }
  if (IsFull(rc) && !HasResourceManager(kPcpTcti)) {
    FlushLeftovers(tpm);
    return true;
  }
  return false;
}

Status ReadPublic(Connection& tpm, TPM2_HANDLE handle, TPM2B_PUBLIC* area) {
  TPM2B_NAME name{};
  TPM2B_NAME qualified{};
  if (Status status = RawCommand(tpm, "TPM2_ReadPublic",
                                 [&] { return Tss2_Sys_ReadPublic_Prepare(tpm.sys, handle); });
      !status.ok()) {
    return status;
  }
  *area = TPM2B_PUBLIC{};
  if (Status status = Check("Tss2_Sys_ReadPublic_Complete",
                            Tss2_Sys_ReadPublic_Complete(tpm.sys, area, &name, &qualified));
      !status.ok()) {
    return status;
  }
  // The name is the name algorithm and the SHA-256 of the marshalled public
  // area: a public area that does not hash to it is not the object's.
  std::array<std::uint8_t, sizeof(TPMT_PUBLIC)> marshalled{};
  std::size_t size = 0;
  std::array<std::uint8_t, crypto::kSha256Size> digest{};
  crypto::Sha256 sha;
  if (area->publicArea.nameAlg != TPM2_ALG_SHA256 || name.size != 2 + digest.size() ||
      Tss2_MU_TPMT_PUBLIC_Marshal(&area->publicArea, marshalled.data(), marshalled.size(), &size) !=
          TSS2_RC_SUCCESS ||
      !sha.Update(marshalled.data(), size).ok() || !sha.Final(digest).ok() ||
      name.name[0] != (TPM2_ALG_SHA256 >> 8) || name.name[1] != (TPM2_ALG_SHA256 & 0xFF) ||
      std::memcmp(name.name + 2, digest.data(), digest.size()) != 0) {
    return Refused("public area does not match its name");
  }
  return Status();
}

Status EvictPersistent(Connection& tpm, TPM2_HANDLE handle) {
  // The owner's authorization: a password session with the empty password.
  TSS2L_SYS_AUTH_COMMAND auths{};
  auths.count = 1;
  auths.auths[0].sessionHandle = TPM2_RH_PW;
  if (Status status = RawCommand(
          tpm, "TPM2_EvictControl",
          [&] {
            TSS2_RC rc = Tss2_Sys_EvictControl_Prepare(tpm.sys, TPM2_RH_OWNER, handle, handle);
            return rc != TSS2_RC_SUCCESS ? rc : Tss2_Sys_SetCmdAuths(tpm.sys, &auths);
          });
      !status.ok()) {
    return status;
  }
  return Check("Tss2_Sys_EvictControl_Complete", Tss2_Sys_EvictControl_Complete(tpm.sys));
}

Status UseParent(Connection& tpm) {
  if (tpm.primary || tpm.srk) {
    return Status();
  }
  // Without the SRK, or with something else at its handle, the same key is
  // made from the template.
  if (OpenSrk(tpm).ok()) {
    return Status();
  }
  return tpm.broken ? Refused("TPM connection lost") : CreatePrimary(tpm);
}

Status StartHmacSession(Connection& tpm, ESYS_TR tpmKey, ESYS_TR bind, ESYS_TR* session) {
  TPMT_SYM_DEF symmetric{};
  symmetric.algorithm = TPM2_ALG_AES;
  symmetric.keyBits.aes = 128;
  symmetric.mode.aes = TPM2_ALG_CFB;
  *session = ESYS_TR_NONE;
  // Left to ESAPI, the nonce would come from OpenSSL's generator, which
  // waits for the kernel's pool. The TPM's nonce makes the session fresh;
  // this one need only differ from run to run, which the clock ensures
  // while the pool is not ready.
  TPM2B_NONCE nonce{};
  nonce.size = crypto::kSha256Size;
  if (!KernelRandom(nonce.buffer, nonce.size, KernelWait::kNo)) {
    timespec clocks[2]{};
    clock_gettime(CLOCK_REALTIME, &clocks[0]);
    clock_gettime(CLOCK_MONOTONIC, &clocks[1]);
    crypto::Sha256 sha;
    (void)sha.Update(clocks, sizeof(clocks));
    (void)sha.Final(std::span<std::uint8_t, crypto::kSha256Size>(nonce.buffer, nonce.size));
  }
  return Run(
      tpm, "Esys_StartAuthSession",
      [&] {
        return Esys_StartAuthSession_Async(tpm.ctx(), tpmKey, bind, ESYS_TR_NONE, ESYS_TR_NONE,
                                           ESYS_TR_NONE, &nonce, TPM2_SE_HMAC, &symmetric,
                                           TPM2_ALG_SHA256);
      },
      [&] { return Esys_StartAuthSession_Finish(tpm.ctx(), session); });
}

Status UseSaltedSession(Connection& tpm, TPMA_SESSION attributes) {
  if (!tpm.session) {
    if (Status status = UseParent(tpm); !status.ok()) {
      return status;
    }
    ESYS_TR session = ESYS_TR_NONE;
    if (Status status = StartHmacSession(tpm, tpm.Parent(), ESYS_TR_NONE, &session); !status.ok()) {
      return status;
    }
    tpm.session.reset(tpm.Object(session));
  }
  // The session stays loaded after each command, so that it is flushed with
  // the connection on every path, failed commands included.
  return Check("Esys_TRSess_SetAttributes",
               Esys_TRSess_SetAttributes(tpm.ctx(), tpm.session.get().tr,
                                         TPMA_SESSION_CONTINUESESSION | attributes, 0xff));
}

Status PersistSrk(Connection& tpm) {
  if (OpenSrk(tpm).ok()) {
    return Status();
  }
  if (Status status = CreatePrimary(tpm); !status.ok()) {
    return status;
  }
  ESYS_TR persistent = ESYS_TR_NONE;
  Status status = Run(
      tpm, "Esys_EvictControl",
      [&] {
        return Esys_EvictControl_Async(tpm.ctx(), ESYS_TR_RH_OWNER, tpm.primary.get().tr,
                                       ESYS_TR_PASSWORD, ESYS_TR_NONE, ESYS_TR_NONE, kSrkHandle);
      },
      [&] { return Esys_EvictControl_Finish(tpm.ctx(), &persistent); });
  if (status.ok()) {
    tpm.srk.reset(tpm.Object(persistent));
  }
  return status;
}

}  // namespace keymgr::tpm
