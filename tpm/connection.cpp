// The TPM connection: opening it, exchanging each command within the
// deadline, and recovering from a TPM that was not started or is full.
#include "tpm/connection.h"

#include <pthread.h>
#include <time.h>
#include <tss2/tss2_rc.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "keymgr_build_config.h"
#include "tpm/commands.h"
#include "tpm/socket_tcti.h"

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
    if (!GetCapability(tpm, TPM2_CAP_HANDLES, first, TPM2_MAX_CAP_HANDLES, &data, Retry::kOnce)
             .ok()) {
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
        (void)FlushContext(tpm, handle, Retry::kOnce);
      }
    }
  }
}

}  // namespace

Status TssFailure(const char* call, TSS2_RC rc) {
  return Status::Failure(Origin::kTss, call, rc, Tss2_RC_Decode(rc));
}

void LogTss(const char* call, TSS2_RC rc) {
  if (rc != TSS2_RC_SUCCESS) {
    LogFailure(Origin::kTss, call, rc, Tss2_RC_Decode(rc));
  }
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
  TPM2_HANDLE handle = 0;
  if (Esys_TR_GetTpmHandle(tpm.ctx(), object.tr, &handle) == TSS2_RC_SUCCESS) {
    (void)FlushContext(tpm, handle);
  }
  // ESAPI forgets the object whether or not the TPM could be told.
  (void)Esys_TR_Close(tpm.ctx(), &object.tr);
}

void CloseObject(EsysObject object) {
  // ESAPI keeps the auth value (16 bytes here) in its own memory;
  // overwrite it first.
  TPM2B_AUTH blank{};
  blank.size = 16;
  ESYS_CONTEXT* esys = object.tpm->ctx();
  LogTss("Esys_TR_SetAuth", Esys_TR_SetAuth(esys, object.tr, &blank));
  LogTss("Esys_TR_Close", Esys_TR_Close(esys, &object.tr));
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

Status Connect(Connection& tpm, const Options& options) {
  QuietTssLog();
  tpm.options = options;
  // A simulator's socket gets the transport with deadlines; every other
  // transport is tpm2-tss's.
  const std::string_view tcti = options.transport;
  const Status opened =
      tcti == "swtpm" || tcti.starts_with("swtpm:")
          ? InitSocketTcti(options.transport + std::min<std::size_t>(tcti.size(), 6),
                           options.deadlineMs, tpm.tcti.out())
          : Check("Tss2_TctiLdr_Initialize",
                  Tss2_TctiLdr_Initialize(options.transport, tpm.tcti.out()));
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
  const Clock::time_point deadline =
      Clock::now() + std::chrono::milliseconds(tpm.options.deadlineMs);
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
    // "Already started" means another caller got there first.
    const Status started = Startup(tpm);
    return started.ok() || started.code() == TPM2_RC_INITIALIZE;
  }
  if (IsFull(rc) && !HasResourceManager(tpm.options.transport)) {
    FlushLeftovers(tpm);
    return true;
  }
  return false;
}

}  // namespace keymgr::tpm
