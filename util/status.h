// The one result type inside the product. The C entry points and the
// platform interfaces reduce it to their own contracted values.
#pragma once

#include <cerrno>
#include <cstdint>

namespace keymgr {

// Where a failure's code comes from, and so how to read it.
enum class Origin : std::uint8_t {
  kNone,     // success
  kErrno,    // a system call: errno
  kTss,      // tpm2-tss: TSS2_RC
  kOpenssl,  // libcrypto: ERR_get_error(), or 0 when it queued none
  kCrypto,   // the crypto services: a DTC_E_* code
  kRefused,  // this system refused on its own (bad input, a check that failed)
};

// Status is success, or the failing call and the code it gave. |call| names
// the call (a string literal, never freed). Every failure is made through
// Failure(), which shows it once on standard error when KEYMGR_DEBUG is set:
// the call and |text|, or for errno its message, or else the code.
class [[nodiscard]] Status {
 public:
  constexpr Status() = default;
  constexpr bool ok() const { return origin_ == Origin::kNone; }
  constexpr Origin origin() const { return origin_; }
  constexpr std::uint32_t code() const { return code_; }
  constexpr const char* call() const { return call_; }

  static Status Failure(Origin origin, const char* call, std::uint32_t code,
                        const char* text = nullptr);

 private:
  constexpr Status(Origin origin, const char* call, std::uint32_t code)
      : origin_(origin), code_(code), call_(call) {}
  Origin origin_ = Origin::kNone;
  std::uint32_t code_ = 0;
  const char* call_ = "";
};

// The common failures, each named after the call that failed.
inline Status ErrnoFailure(const char* call, int error = errno) {
  return Status::Failure(Origin::kErrno, call, static_cast<std::uint32_t>(error));
}
inline Status Refused(const char* what) {
  return Status::Failure(Origin::kRefused, what, 0);
}

// LogFailure shows a failure as Status::Failure does, for one that no caller
// is told of: the flow goes on, or its result is fixed by an interface that
// has no room for the cause. Any origin's code fits, a TSS2_RC too.
void LogFailure(Origin origin, const char* call, std::uint32_t code, const char* text = nullptr);
inline void LogErrno(const char* call, int error = errno) {
  LogFailure(Origin::kErrno, call, static_cast<std::uint32_t>(error));
}
inline void LogRefused(const char* what) {
  LogFailure(Origin::kRefused, what, 0);
}

}  // namespace keymgr
