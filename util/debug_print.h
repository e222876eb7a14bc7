#pragma once

// DebugPrint formats like printf and writes to standard output, adding
// nothing of its own. It shares stdout's stream with printf, so all output
// appears in call order.
void DebugPrint(const char* format, ...) __attribute__((format(printf, 1, 2)));
