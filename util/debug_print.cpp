#include "util/debug_print.h"

#include <cstdarg>
#include <cstdio>

void DebugPrint(const char* format, ...) {
  va_list args;
  va_start(args, format);
  std::vprintf(format, args);
  va_end(args);
}
