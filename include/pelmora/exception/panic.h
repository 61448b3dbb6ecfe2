#pragma once
// Panics end the process for broken invariants: a report (first line, backtrace and the
// in-memory log) is written by a forked child, which the panicking process waits for a
// bounded time before it dumps core.
// None of these returns. Callable from any thread.

#include <cstdarg>
#include <string>

#include "pelmora/object/export.h"

namespace Pelmora {

class Throwable;

extern PELMORA_EXPORT const char assertPrefix[];  // "Assert Failed:"

[[noreturn]] PELMORA_EXPORT void PanicVerify(const char* expr, const char* file, int line);
[[noreturn]] PELMORA_EXPORT void PanicNotReached(const char* file, int line);
[[noreturn]] PELMORA_EXPORT void PanicNotImplemented(const char* file, int line);
[[noreturn]] PELMORA_EXPORT void PanicExit(const char* message);
[[noreturn]] PELMORA_EXPORT void PanicExit(const Throwable& exception);
[[noreturn]] PELMORA_EXPORT void Vpanic(const char* format, va_list args);
[[noreturn]] PELMORA_EXPORT void Panic(const char* format, ...) __attribute__((format(printf, 1, 2)));
[[noreturn]] PELMORA_EXPORT void GenerateCoreDumpTerminate();

// The report's first line: prefix, ` "expr" ` (or a blank), "@ file:line".
PELMORA_EXPORT std::string FormatPanicMessage(const char* prefix, const char* expr, const char* file, int line);

// Whether a panic writes its report from a forked child (the default) or in-process.
// Tests that read the report from the dying process turn forking off.
PELMORA_EXPORT void SetPanicMayFork(bool mayFork);
PELMORA_EXPORT bool PanicMayFork();

}  // namespace Pelmora

// Checks an invariant; on failure panics with the expression text as written (macros in
// it expanded), the source file and the line.
#define PELMORA_VERIFY(expr) PELMORA_VERIFY_EXPANDED(expr)
#define PELMORA_VERIFY_EXPANDED(expr) \
   ((expr) ? static_cast<void>(0) : ::Pelmora::PanicVerify(#expr, __FILE__, __LINE__))
#define PELMORA_NOT_REACHED() ::Pelmora::PanicNotReached(__FILE__, __LINE__)
#define PELMORA_NOT_IMPLEMENTED() ::Pelmora::PanicNotImplemented(__FILE__, __LINE__)
