// Shared by the parts of the crypto services: the protected key records and
// the containers. Private to crypto/.
#pragma once

#include <openssl/err.h>
#include <openssl/evp.h>

#include <cstdint>

#include "crypto/dtc.h"
#include "crypto/hash.h"
#include "crypto/openssl_handles.h"
#include "util/status.h"

namespace keymgr::crypto {

inline constexpr std::uint32_t kAesKeySize = 32;
inline constexpr std::uint32_t kAesBlockSize = 16;
inline constexpr std::uint32_t kIvSize = 16;
// The module's keys are at most 48 bytes; the bound keeps a corrupt length
// from running the fixed work buffers past their end.
inline constexpr std::uint32_t kMaxLength = 1024;

// OpensslFailure names a failed libcrypto call with the error it queued, and
// clears the queue; LogOpenssl does so for a failure no caller is told of.
inline Status OpensslFailure(const char* call) {
  const unsigned long error = ERR_get_error();
  ERR_clear_error();
  return Status::Failure(Origin::kOpenssl, call, static_cast<std::uint32_t>(error),
                         error != 0 ? ERR_reason_error_string(error) : nullptr);
}
inline void LogOpenssl(const char* call) {
  (void)OpensslFailure(call);
}

// Steps names the libcrypto call that failed in a chain of them written as one
// condition: each call's outcome goes through it with the call's name, and it
// keeps the name of the last one run.
//   Steps step;
//   if (!step("A", A() == 1) || !step("B", B() != nullptr)) {
//     return OpensslFailure(step.call());
//   }
class Steps {
 public:
  bool operator()(const char* call, bool ok) {
    call_ = call;
    return ok;
  }
  // A bare int result would pass as true for libcrypto's negative codes.
  bool operator()(const char* call, int result) = delete;
  const char* call() const { return call_; }

 private:
  const char* call_ = "";
};

// Records: attached to a caller's array, then sized (its key bytes taken in
// and masked).
bool IsAttached(const ProtectedKey* key);
bool IsSized(const ProtectedKey* key);
// IsFixedConstant tells whether |key| is constant 2 or 3, which callers may
// read but never re-bind or overwrite.
bool IsFixedConstant(const ProtectedKey* key);
// ReadPlain copies |count| plain bytes of an attached record to |out|: the
// key bytes unmasked, and past the sized length the array's raw bytes.
void ReadPlain(const ProtectedKey& key, std::uint8_t* out, std::uint32_t count);
// Store writes |count| plain bytes into an attached record, masked under a
// fresh nonce, and sizes it to |count|.
void Store(ProtectedKey* key, const std::uint8_t* plain, std::uint32_t count);

}  // namespace keymgr::crypto
