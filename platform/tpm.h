// The TPM connection of the platform key manager over tpm2-tss ESAPI: the
// handles it owns, how it is opened, and its storage primary and sessions.
// Private to platform/.
#pragma once

#include <openssl/crypto.h>
#include <tss2/tss2_esys.h>
#include <tss2/tss2_tctildr.h>

#include "util/owned.h"
#include "util/status.h"

namespace keymgr::tpm {

// TssFailure names a failed tpm2-tss call once, with the decoded code, on
// request (KEYMGR_DEBUG).
Status TssFailure(const char* call, TSS2_RC rc);

// Check is the status of a tpm2-tss call that returned |rc|.
inline Status Check(const char* call, TSS2_RC rc) {
  return rc == TSS2_RC_SUCCESS ? Status() : TssFailure(call, rc);
}

void FinalizeTcti(TSS2_TCTI_CONTEXT* tcti);
void FinalizeEsys(ESYS_CONTEXT* esys);
using TctiContext = Owned<TSS2_TCTI_CONTEXT*, FinalizeTcti>;
using EsysContext = Owned<ESYS_CONTEXT*, FinalizeEsys>;

// EsysObject is an ESAPI object handle with the context it belongs to.
struct EsysObject {
  ESYS_CONTEXT* esys = nullptr;
  ESYS_TR tr = ESYS_TR_NONE;
  bool operator==(const EsysObject&) const = default;
};
// FlushObject flushes a transient object or session from the TPM.
void FlushObject(EsysObject object);
// CloseObject forgets a persistent object's auth value and closes its handle;
// the object stays in the TPM.
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

// Connection is one connection to the TPM and what a call derives from it.
// Its members go in reverse order: the session and the primary are flushed
// before ESAPI and then the transport are finalised. After a transport error
// ESAPI refuses further commands and the flushes fail; the kernel's resource
// manager then drops what the connection held when it closes, and without
// one the next connection flushes it (see Connect).
struct Connection {
  TctiContext tcti;
  EsysContext esys;
  TransientObject primary;
  TransientObject session;

  ESYS_CONTEXT* ctx() const { return esys.get(); }
  EsysObject Object(ESYS_TR tr) const { return {esys.get(), tr}; }
};

// HasResourceManager tells whether |tcti| reaches the TPM through a resource
// manager (the kernel's /dev/tpmrm*, or tpm2-abrmd), which isolates each
// connection and flushes what it leaves behind.
bool HasResourceManager(const char* tcti);

// Connect opens the TPM on the build's transport and starts it ("already
// started" is fine). Without a resource manager it first flushes every
// transient object and session the TPM holds.
Status Connect(Connection& tpm);

// StartSaltedSession creates the storage primary and opens an HMAC session
// salted by it, with AES-128-CFB parameter encryption in the direction(s) of
// |attributes| (TPMA_SESSION_DECRYPT: first command parameter;
// TPMA_SESSION_ENCRYPT: first response parameter). The salt travels under
// the primary's public key, so the session key, and the secrets it covers,
// never cross the bus in clear.
Status StartSaltedSession(Connection& tpm, TPMA_SESSION attributes);

}  // namespace keymgr::tpm
