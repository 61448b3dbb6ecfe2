#pragma once
// Panics end the process for broken invariants: a report (first line, backtrace and the
// in-memory log) is written by a forked child while the panicking process dumps core.
// None of these returns. Callable from any thread.

#include <cstdarg>
#include <string>

namespace Pelmora {

class Throwable;

extern const char assertPrefix[];  // "Assert Failed:"

[[noreturn]] void PanicVerify(const char* expr, const char* file, int line);
[[noreturn]] void PanicNotReached(const char* file, int line);
[[noreturn]] void PanicNotImplemented(const char* file, int line);
[[noreturn]] void PanicExit(const char* message);
[[noreturn]] void PanicExit(const Throwable& exception);
[[noreturn]] void Vpanic(const char* format, va_list args);
[[noreturn]] void Panic(const char* format, ...) __attribute__((format(printf, 1, 2)));
[[noreturn]] void GenerateCoreDumpTerminate();

// The report's first line: prefix, ` "expr" ` (or a blank), "@ file:line".
std::string FormatPanicMessage(const char* prefix, const char* expr, const char* file, int line);

// Whether a panic writes its report from a forked child (the default) or in-process.
// Tests that read the report from the dying process turn forking off.
void SetPanicMayFork(bool mayFork);
bool PanicMayFork();

}  // namespace Pelmora

// Checks an invariant; on failure panics with the expression text as written (macros in
// it expanded), the source file and the line.
#define PELMORA_VERIFY(expr) PELMORA_VERIFY_EXPANDED(expr)
#define PELMORA_VERIFY_EXPANDED(expr) \
   ((expr) ? static_cast<void>(0) : ::Pelmora::PanicVerify(#expr, __FILE__, __LINE__))
#define PELMORA_NOT_REACHED() ::Pelmora::PanicNotReached(__FILE__, __LINE__)
#define PELMORA_NOT_IMPLEMENTED() ::Pelmora::PanicNotImplemented(__FILE__, __LINE__)
