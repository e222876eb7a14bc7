#pragma once

// DebugPrint formats like printf and writes to standard output, adding
// nothing of its own. It shares stdout's stream with printf, so all output
// appears in call order.
void DebugPrint(const char* format, ...) __attribute__((format(printf, 1, 2)));

// DiagnosticsOn tells whether KEYMGR_DEBUG is set in the environment: only
// then are diagnostics beyond the messages of the system shown.
bool DiagnosticsOn();

// DiagnosticPrint formats like printf to standard error when DiagnosticsOn().
// Callers never pass secrets.
void DiagnosticPrint(const char* format, ...) __attribute__((format(printf, 1, 2)));
