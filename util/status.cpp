#include "util/status.h"

#include <cerrno>
#include <cstring>

#include "util/debug_print.h"

namespace keymgr {

void LogFailure(Origin origin, const char* call, std::uint32_t code, const char* text) {
  if (DiagnosticsOn()) {
    const int saved = errno;  // callers may still report errno
    if (text == nullptr && origin == Origin::kErrno) {
      text = std::strerror(static_cast<int>(code));
    }
    if (text != nullptr) {
      DiagnosticPrint("keymgr: %s failed: %s\n", call, text);
    } else {
      DiagnosticPrint("keymgr: %s failed: 0x%08x\n", call, code);
    }
    errno = saved;
  }
}

Status Status::Failure(Origin origin, const char* call, std::uint32_t code, const char* text) {
  LogFailure(origin, call, code, text);
  return Status(origin, call, code);
}

}  // namespace keymgr
