// The TPM connection of the platform key manager over tpm2-tss: its
// options, the handles it owns, and the exchange of one command within its
// deadline. The commands themselves are in tpm/commands.h. Private to tpm/.
#pragma once

#include <openssl/crypto.h>
#include <signal.h>
#include <tss2/tss2_esys.h>
#include <tss2/tss2_sys.h>
#include <tss2/tss2_tctildr.h>

#include <cstdint>
#include <span>

#include "util/owned.h"
#include "util/status.h"

namespace keymgr::tpm {

// Options are what a connection is opened with.
struct Options {
  // The tpm2-tss TCTI configuration; "swtpm:" takes this key manager's own
  // socket transport.
  const char* transport = nullptr;
  // The deadline of every command, in milliseconds.
  int deadlineMs = 0;
  // The PCR of the SHA-256 bank that holds the boot verdict, when the keys
  // this connection creates and opens are sealed to the boot (a build with
  // KEYMGR_SEAL_TO_VERDICT), or -1 for plain keys.
  int sealPcr = -1;
  // The modulus of the vendor's RSA key whose signed policies sealed keys
  // follow (KEYMGR_POLICY_PUBKEY); empty in other builds.
  std::span<const std::uint8_t> vendorKey;
};

// BuildOptions are the build's: KEYMGR_TCTI, KEYMGR_TPM_TIMEOUT_MS,
// KEYMGR_SEAL_PCR and KEYMGR_POLICY_PUBKEY. Defined alone in options.cpp, so that a test program
// can link its own in their place.
Options BuildOptions();

// TssFailure names a failed tpm2-tss call once, with the decoded code, on
// request (KEYMGR_DEBUG).
Status TssFailure(const char* call, TSS2_RC rc);

// LogTss names a tpm2-tss call that failed where no caller is told.
void LogTss(const char* call, TSS2_RC rc);

// Check is the status of a tpm2-tss call that returned |rc|.
inline Status Check(const char* call, TSS2_RC rc) {
  return rc == TSS2_RC_SUCCESS ? Status() : TssFailure(call, rc);
}

void FinalizeTcti(TSS2_TCTI_CONTEXT* tcti);
void FinalizeEsys(ESYS_CONTEXT* esys);
using TctiContext = Owned<TSS2_TCTI_CONTEXT*, FinalizeTcti>;
using EsysContext = Owned<ESYS_CONTEXT*, FinalizeEsys>;

struct Connection;

// EsysObject is an ESAPI object handle with the connection it belongs to.
struct EsysObject {
  Connection* tpm = nullptr;
  ESYS_TR tr = ESYS_TR_NONE;
  bool operator==(const EsysObject&) const = default;
};
// FlushObject flushes a transient object or session from the TPM, within the
// command deadline like every other command; on a connection that lost its
// TPM it sends nothing.
void FlushObject(EsysObject object);
// CloseObject forgets a persistent object's auth value and closes its handle;
// the object stays in the TPM. It sends no command.
void CloseObject(EsysObject object);
using TransientObject = Owned<EsysObject, FlushObject>;
using PersistentObject = Owned<EsysObject, CloseObject>;

// ESAPI's output buffers, released with Esys_Free; secret ones are wiped
// first.
template <class T>
void FreeOutput(T* output) {
  Esys_Free(output);
}
template <class T>
void FreeSecretOutput(T* output) {
  OPENSSL_cleanse(output, sizeof(*output));
  Esys_Free(output);
}
template <class T>
using Output = Owned<T*, FreeOutput<T>>;
template <class T>
using SecretOutput = Owned<T*, FreeSecretOutput<T>>;

// SigpipeBlock keeps SIGPIPE blocked on this thread while it lives, and then
// drains one that the TPM transport raised: a peer that hangs up fails the
// call with EPIPE instead of ending the process. The process's disposition
// of SIGPIPE is never touched, and one that was already pending is left.
class SigpipeBlock {
 public:
  SigpipeBlock();
  ~SigpipeBlock();
  SigpipeBlock(const SigpipeBlock&) = delete;
  SigpipeBlock& operator=(const SigpipeBlock&) = delete;

 private:
  sigset_t saved_;
  bool pendingBefore_ = false;
};

// Connection is one connection to the TPM and what its calls derive from it.
// Its members go in reverse order: the session and the parent are flushed or
// closed before ESAPI and then the transport are finalised.
struct Connection {
  Options options;
  TctiContext tcti;
  EsysContext esys;
  TSS2_SYS_CONTEXT* sys = nullptr;  // ESAPI's own, for the raw commands
  // Set when a command missed its deadline or the transport failed: ESAPI is
  // then mid-command, so nothing more is sent on this connection.
  bool broken = false;
  std::int32_t waitMs = 0;  // the wait of the command under way
  TransientObject primary;  // the storage primary this connection created, or
  PersistentObject srk;     // the persistent SRK it found
  TransientObject session;  // salted by the parent, for secrets on the bus
  // The public area of the key this connection created last: sealing to it
  // needs no command.
  std::uint32_t createdHandle = 0;
  TPM2B_PUBLIC createdPublic{};

  ESYS_CONTEXT* ctx() const { return esys.get(); }
  EsysObject Object(ESYS_TR tr) { return {this, tr}; }
  ESYS_TR Parent() const { return srk ? srk.get().tr : primary.get().tr; }
};

// HasResourceManager tells whether |tcti| reaches the TPM through a resource
// manager (the kernel's /dev/tpmrm*, or tpm2-abrmd), which isolates each
// connection and flushes what it leaves behind.
bool HasResourceManager(const char* tcti);

// Connect opens the transport of |options| and ESAPI on it. It sends
// nothing: a TPM that still needs TPM2_Startup gets it with the first
// command.
Status Connect(Connection& tpm, const Options& options);

// How a command that the TPM refuses for a state it can leave is handled.
enum class Retry {
  // A TPM that was not started is started, and without a resource manager a
  // TPM whose slots are full of what a dead process left is cleared; then
  // the command is sent again.
  kRecover,
  // Sent once: the commands of the recovery itself, which must not recover
  // in turn.
  kOnce,
};

// Exchange sends one command and names its failure |call|. |send| starts the
// command (an ESAPI _Async call, or a raw command's preparation and send)
// and |finish| collects the answer, waiting at most tpm.waitMs; the command
// fails at the connection's deadline. Only tpm/commands.cpp calls it.
template <class Send, class Finish>
Status Exchange(Connection& tpm, const char* call, Retry retry, Send send, Finish finish);

// SendOnce and Recover are Exchange's parts, out of line.
TSS2_RC SendOnce(Connection& tpm, TSS2_RC (*send)(void*), TSS2_RC (*finish)(void*), void* call);
bool Recover(Connection& tpm, TSS2_RC rc);

template <class Send, class Finish>
Status Exchange(Connection& tpm, const char* call, Retry retry, Send send, Finish finish) {
  struct Pair {
    Send& send;
    Finish& finish;
  } pair{send, finish};
  TSS2_RC rc = TSS2_RC_SUCCESS;
  for (int attempt = 0; attempt < 3; ++attempt) {
    rc = SendOnce(
        tpm, [](void* p) -> TSS2_RC { return static_cast<Pair*>(p)->send(); },
        [](void* p) -> TSS2_RC { return static_cast<Pair*>(p)->finish(); }, &pair);
    if (retry == Retry::kOnce || !Recover(tpm, rc)) {
      break;
    }
  }
  return Check(call, rc);
}

// WipeResponse wipes the parameters of the last response in ESAPI's own
// buffer, where a response that a session encrypted lies decrypted.
void WipeResponse(Connection& tpm);

// UseParent makes the storage parent of the keys available, once per
// connection: the persistent SRK when it is there with the standard storage
// template, else a primary created from that template (the same key).
Status UseParent(Connection& tpm);

// StartSession starts a session of |type| (an HMAC session unless asked)
// with AES-128-CFB parameter encryption, salted by |tpmKey| and bound to
// |bind| (either may be ESYS_TR_NONE), and leaves it in |session|. The caller
// owns the session. Its nonce comes from the kernel without waiting, so that
// a boot never waits for the kernel's pool.
Status StartSession(Connection& tpm, ESYS_TR tpmKey, ESYS_TR bind, ESYS_TR* session,
                    TPM2_SE type = TPM2_SE_HMAC);

// UseSaltedSession makes the connection's HMAC session available, salted by
// the parent, and sets its parameter encryption to |attributes|
// (TPMA_SESSION_DECRYPT: the command's first parameter; TPMA_SESSION_ENCRYPT:
// the response's). The salt travels under the parent's public key, so the
// session key, and the secrets it covers, never cross the bus in clear.
Status UseSaltedSession(Connection& tpm, TPMA_SESSION attributes);

// PersistSrk makes the standard SRK persistent at kSrkHandle, or finds it
// there already.
Status PersistSrk(Connection& tpm);

// The persistent handle of the storage root key in TCG's provisioning
// guidance; systemd and tpm2-tss FAPI use it too.
inline constexpr std::uint32_t kSrkHandle = 0x81000001u;

}  // namespace keymgr::tpm
