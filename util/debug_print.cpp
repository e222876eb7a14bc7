#include "util/debug_print.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>

void DebugPrint(const char* format, ...) {
  va_list args;
  va_start(args, format);
  std::vprintf(format, args);
  va_end(args);
}

bool DiagnosticsOn() {
  // Read each time: a cached value would need a guarded static, and with it
  // the C++ runtime library at every start of keymgr.
  return std::getenv("KEYMGR_DEBUG") != nullptr;
}

void DiagnosticPrint(const char* format, ...) {
  if (!DiagnosticsOn()) {
    return;
  }
  va_list args;
  va_start(args, format);
  (void)std::vfprintf(stderr, format, args);
  va_end(args);
}
