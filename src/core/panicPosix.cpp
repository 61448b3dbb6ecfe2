// Panics: the report is written by a forked child so that the dying process's memory
// stays untouched for its core file, and the core is taken even if logging hangs.
// Everything that needs the allocator or the dynamic loader (formatting, resolving the
// backtrace) happens before the fork; the child is made with the C library's fork so
// that the allocator is usable in it. Logging locks that other threads held at fork time
// stay held in the child, so a watchdog there writes the prepared report to standard
// error, without locks or allocation, when logging does not finish in time.

#include <signal.h>
#include <sys/time.h>
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
thread_local bool t_panicking = false;

// The report as prepared before the fork, for the child's watchdog.
const char* volatile g_reportText = nullptr;
volatile size_t g_reportSize = 0;
volatile sig_atomic_t g_reportLogged = 0;

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

void OnReportTimeout(int) {
   if (!g_reportLogged && g_reportText) {
      WriteRaw(g_reportText, g_reportSize);
      WriteRaw("\n");
   }
   WriteRaw("Panic report cut short: logging did not finish in time\n");
   _exit(-1);
}

void ArmReportWatchdog() {
   struct sigaction action;
   memset(&action, 0, sizeof(action));
   action.sa_handler = OnReportTimeout;
   sigemptyset(&action.sa_mask);
   sigaction(SIGALRM, &action, nullptr);
   sigset_t alarmOnly;
   sigemptyset(&alarmOnly);
   sigaddset(&alarmOnly, SIGALRM);
   pthread_sigmask(SIG_UNBLOCK, &alarmOnly, nullptr);
   long ms = g_reportChildMs.load(std::memory_order_relaxed);
   itimerval timer{};
   timer.it_value.tv_sec = ms / 1000;
   timer.it_value.tv_usec = (ms % 1000) * 1000;
   setitimer(ITIMER_REAL, &timer, nullptr);
}

void WriteReport(const std::string& text, bool wanted, const char* message) {
   Internal::ReportSink& sink = Internal::GetReportSink();
   if (wanted) sink.Log(Internal::kReportPanicLevel, text);
   g_reportLogged = 1;
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
      if (wanted) {
         g_reportText = text.c_str();
         g_reportSize = text.size();
      }
      pid_t child = fork();
      if (child == 0) {
         ArmReportWatchdog();
         WriteReport(text, wanted, message);
         _exit(-1);
      }
      reported = child > 0;
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
