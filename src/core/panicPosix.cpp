// Panics: the report is written by a forked child so that the dying process's memory
// stays untouched for its core file, and the core is taken even if logging hangs.
// Everything that needs the allocator or the dynamic loader (formatting, resolving the
// backtrace) happens before the fork; the child is made with the C library's fork so
// that the allocator is usable in it. Logging locks that other threads held at fork time
// stay held in the child; the logging locks take them over there (InReportChild). For
// whatever else may hang, the dying process waits for the child a bounded time; past it,
// it kills the child and writes the prepared report to standard error itself, without
// locks or allocation, before it dumps core.

#include <signal.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
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

std::atomic<long> g_reportChildMs{30000};
std::atomic<bool> g_mayFork{true};
std::atomic<bool> g_inReportChild{false};
thread_local bool t_panicking = false;

// Set by the report child once the first line is logged; shared with the dying process.
volatile sig_atomic_t* g_reportLogged = nullptr;

void WriteRaw(const char* text, size_t size) {
   while (size > 0) {
      ssize_t n = write(STDERR_FILENO, text, size);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return;
      text += n;
      size -= static_cast<size_t>(n);
   }
}

void WriteRaw(const char* text) { WriteRaw(text, strlen(text)); }

long long NowMs() {
   timespec now;
   clock_gettime(CLOCK_MONOTONIC, &now);
   return now.tv_sec * 1000LL + now.tv_nsec / 1000000;
}

// Waits for the report child; past the time-out, kills it and writes what it could not.
void AwaitReportChild(pid_t child, const std::string& text, bool wanted) {
   long long deadline = NowMs() + g_reportChildMs.load(std::memory_order_relaxed);
   for (;;) {
      pid_t done = waitpid(child, nullptr, WNOHANG);
      if (done == child || (done < 0 && errno != EINTR)) return;
      if (NowMs() >= deadline) break;
      timespec pause{0, 1000000};
      nanosleep(&pause, nullptr);
   }
   kill(child, SIGKILL);
   while (waitpid(child, nullptr, 0) < 0 && errno == EINTR) {
   }
   if (wanted && !(g_reportLogged && *g_reportLogged)) {
      WriteRaw(text.data(), text.size());
      WriteRaw("\n");
   }
   WriteRaw("Panic report cut short: logging did not finish in time\n");
}

void WriteReport(const std::string& text, bool wanted, const char* message) {
   Internal::ReportSink& sink = Internal::GetReportSink();
   if (wanted) sink.Log(Internal::kReportPanicLevel, text);
   if (g_reportLogged) *g_reportLogged = 1;
   sink.LogMemoryBuffer(Internal::kReportPanicLevel, message, true);
   sink.Flush();
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
   std::string text = MessageFormatter::ASPrint("\n\nPanic: %1\nBacktrace:\n%2", message,
                                                backtrace ? backtrace->GetText() : std::string());
   bool wanted = Internal::GetReportSink().IsLevelEnabled(Internal::kReportPanicLevel);
   bool reported = false;
   if (PanicMayFork()) {
      void* shared = mmap(nullptr, sizeof(sig_atomic_t), PROT_READ | PROT_WRITE,
                          MAP_SHARED | MAP_ANONYMOUS, -1, 0);
      if (shared != MAP_FAILED) g_reportLogged = static_cast<volatile sig_atomic_t*>(shared);
      pid_t child = fork();
      if (child == 0) {
         g_inReportChild.store(true, std::memory_order_relaxed);
         WriteReport(text, wanted, message);
         _exit(-1);
      }
      reported = child > 0;
      if (reported) AwaitReportChild(child, text, wanted);
   }
   if (!reported) WriteReport(text, wanted, message);
   fflush(nullptr);
   GenerateCoreDumpTerminate();
}

}  // namespace

void SetPanicMayFork(bool mayFork) { g_mayFork.store(mayFork, std::memory_order_relaxed); }
bool PanicMayFork() { return g_mayFork.load(std::memory_order_relaxed); }

namespace Internal {
void SetPanicReportTimeout(std::chrono::milliseconds limit) {
   g_reportChildMs.store(static_cast<long>(limit.count()), std::memory_order_relaxed);
}
bool InReportChild() { return g_inReportChild.load(std::memory_order_relaxed); }
}  // namespace Internal

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
