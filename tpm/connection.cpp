// The TPM connection: opening it, sending each command within the deadline,
// and recovering from a TPM that was not started or is full.
#include "tpm/connection.h"

#include <pthread.h>
#include <time.h>
#include <tss2/tss2_mu.h>
#include <tss2/tss2_rc.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "crypto/hash.h"
#include "keymgr_build_config.h"
#include "tpm/socket_tcti.h"
#include "util/random.h"

namespace keymgr::tpm {

namespace {

using Clock = std::chrono::steady_clock;

// The transport that connections opened from now on take: the build's, or a
// copy of the one a test set.
const char* g_tcti = KEYMGR_TCTI;
std::array<char, 256> g_testTcti{};
int g_deadlineMs = KEYMGR_TPM_TIMEOUT_MS;

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
      // Both session lists give HMAC and policy session handles alike.
      const std::uint32_t type = handle >> TPM2_HR_SHIFT;
      const bool listed = first == TPM2_TRANSIENT_FIRST
                              ? type == TPM2_HT_TRANSIENT
                              : type == TPM2_HT_HMAC_SESSION || type == TPM2_HT_POLICY_SESSION;
      if (listed && std::find(own.begin(), own.end(), handle) == own.end()) {
        (void)RawCommand(tpm, "TPM2_FlushContext",
                         [&] { return Tss2_Sys_FlushContext_Prepare(tpm.sys, handle); });
      }
    }
  }
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

void SetTransport(const char* tcti, int deadlineMs) {
  g_tcti = KEYMGR_TCTI;
  g_deadlineMs = KEYMGR_TPM_TIMEOUT_MS;
  if (tcti != nullptr) {
    // One that does not fit is cut short, and then names no transport.
    (void)std::snprintf(g_testTcti.data(), g_testTcti.size(), "%s", tcti);
    g_tcti = g_testTcti.data();
    g_deadlineMs = deadlineMs;
  }
}

Status Connect(Connection& tpm) {
  QuietTssLog();
  tpm.transport = g_tcti;
  tpm.deadlineMs = g_deadlineMs;
  // A simulator's socket gets the transport with deadlines; every other
  // transport is tpm2-tss's.
  const std::string_view tcti = tpm.transport;
  const Status opened = tcti == "swtpm" || tcti.starts_with("swtpm:")
                            ? InitSocketTcti(tpm.transport + std::min<std::size_t>(tcti.size(), 6),
                                             tpm.deadlineMs, tpm.tcti.out())
                            : Check("Tss2_TctiLdr_Initialize",
                                    Tss2_TctiLdr_Initialize(tpm.transport, tpm.tcti.out()));
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
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(tpm.deadlineMs);
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
  if (IsFull(rc) && !HasResourceManager(tpm.transport)) {
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

}  // namespace keymgr::tpm
