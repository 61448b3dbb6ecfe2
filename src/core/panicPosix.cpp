// Panics: the report is written by a forked child so that the dying process's memory
// stays untouched for its core file, and the core is taken even if logging hangs.

#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "pelmora/exception/panic.h"
#include "pelmora/exception/throwable.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/exception/backtrace.h"
#include "src/internal/report.h"

namespace Pelmora {

const char assertPrefix[] = "Assert Failed:";

namespace {

// A report child that hangs (a lock held by another thread at fork time) ends after this.
constexpr unsigned kReportChildSeconds = 30;

std::atomic<bool> g_mayFork{true};
thread_local bool t_panicking = false;

void WriteRaw(const char* text) {
   size_t size = strlen(text);
   while (size > 0) {
      ssize_t n = write(STDERR_FILENO, text, size);
      if (n <= 0) return;
      text += n;
      size -= static_cast<size_t>(n);
   }
}

void WriteReport(const char* message, System::Backtrace* backtrace) {
   Internal::ReportSink& sink = Internal::GetReportSink();
   if (sink.IsLevelEnabled(Internal::kReportPanicLevel)) {
      sink.Log(Internal::kReportPanicLevel,
               MessageFormatter::ASPrint("\n\nPanic: %1\nBacktrace:\n%2", message,
                                         backtrace ? backtrace->GetText() : std::string()));
   }
   sink.LogMemoryBuffer(Internal::kReportPanicLevel, message, true);
}

pid_t RawFork() {
#ifdef SYS_fork
   return static_cast<pid_t>(syscall(SYS_fork));
#else
   return static_cast<pid_t>(syscall(SYS_clone, SIGCHLD, 0, 0, 0, 0));
#endif
}

[[noreturn]] void Report(const char* message, System::Backtrace* backtrace) {
   if (t_panicking) {
      // A panic while reporting a panic: say what we can and stop.
      WriteRaw("\n\nPanic while panicking: ");
      WriteRaw(message);
      WriteRaw("\n");
      GenerateCoreDumpTerminate();
   }
   t_panicking = true;
   bool reported = false;
   if (PanicMayFork()) {
      pid_t child = RawFork();
      if (child == 0) {
         alarm(kReportChildSeconds);
         WriteReport(message, backtrace);
         Internal::GetReportSink().Flush();
         _exit(-1);
      }
      reported = child > 0;
   }
   if (!reported) {
      WriteReport(message, backtrace);
      Internal::GetReportSink().Flush();
   }
   fflush(nullptr);
   GenerateCoreDumpTerminate();
}

}  // namespace

void SetPanicMayFork(bool mayFork) { g_mayFork.store(mayFork, std::memory_order_relaxed); }
bool PanicMayFork() { return g_mayFork.load(std::memory_order_relaxed); }

std::string FormatPanicMessage(const char* prefix, const char* expr, const char* file, int line) {
   std::string middle = " ";
   if (expr) {
      middle += '"';
      middle += expr;
      middle += "\" ";
   }
   return MessageFormatter::ASPrint("%1%2@ %3:%4", prefix, middle, file, line);
}

void PanicVerify(const char* expr, const char* file, int line) {
   PanicExit(FormatPanicMessage(assertPrefix, expr, file, line).c_str());
}

void PanicNotReached(const char* file, int line) {
   PanicExit(FormatPanicMessage("Not Reached:", nullptr, file, line).c_str());
}

void PanicNotImplemented(const char* file, int line) {
   PanicExit(FormatPanicMessage("Not Implemented:", nullptr, file, line).c_str());
}

void PanicExit(const char* message) {
   // Captured here, raw, so that the child only has to resolve it.
   Ref<System::Backtrace> backtrace;
   if (!t_panicking) System::CaptureBacktrace(1, backtrace);
   Report(message, backtrace.Get());
}

void PanicExit(const Throwable& exception) {
   Report(exception.what(), exception.GetBacktrace().Get());
}

void Vpanic(const char* format, va_list args) {
   char buffer[4096];
   vsnprintf(buffer, sizeof(buffer), format, args);
   PanicExit(buffer);
}

void Panic(const char* format, ...) {
   va_list args;
   va_start(args, format);
   Vpanic(format, args);
}

void GenerateCoreDumpTerminate() { abort(); }

}  // namespace Pelmora
