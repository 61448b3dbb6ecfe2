// What the process does when it dies badly: where panic reports go, core-dump limits,
// backtraces of fatal signals, and the allocation-failure handler.

#include <execinfo.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/service/logWriters.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

namespace {

constexpr const char* kPanicWriter = "panic";

std::mutex g_panicMutex;
std::string* g_panicPath = new std::string();  // read by late panics; kept until exit

void MakeDirectories(const std::string& directory) {
   for (size_t slash = directory.find('/', 1);; slash = directory.find('/', slash + 1)) {
      std::string prefix = directory.substr(0, slash);
      if (mkdir(prefix.c_str(), 0755) != 0 && errno != EEXIST) {
         int error = errno;
         throw SystemException(error, "Failed to create " + prefix + ": " +
                                          System::GetErrorMessage(error));
      }
      if (slash == std::string::npos) return;
   }
}

void WriteAll(const char* text, size_t length) {
   while (length > 0) {
      ssize_t n = write(STDERR_FILENO, text, length);
      if (n <= 0) return;
      text += n;
      length -= static_cast<size_t>(n);
   }
}

// Only async-signal-safe calls: backtrace was called once before, so it does not load
// anything now.
void OnFatalSignal(int number) {
   char header[64] = "Fatal signal ";
   size_t length = strlen(header);
   char digits[12];
   int count = 0;
   for (int value = number; value > 0 || count == 0; value /= 10) digits[count++] = static_cast<char>('0' + value % 10);
   while (count > 0) header[length++] = digits[--count];
   header[length++] = '\n';
   WriteAll(header, length);
   void* frames[64];
   int depth = backtrace(frames, 64);
   backtrace_symbols_fd(frames, depth, STDERR_FILENO);
   // The action is back to the default (SA_RESETHAND): this ends the process.
   raise(number);
}

const char kOutOfMemory[] = "Out of memory: an allocation failed";
std::atomic<int> g_newFailures{0};
std::atomic<long> g_newFailureThread{0};

void NewHandlerInt() {
   long self = syscall(SYS_gettid);
   int expected = 0;
   if (g_newFailures.compare_exchange_strong(expected, 1)) {
      g_newFailureThread.store(self);
      Logger* logger = GetDefaultLogger();
      if (logger->IsLevelWanted(Logger::LOG_ERROR)) {
         LogInternal(logger, Logger::LOG_ERROR, kOutOfMemory);
      }
      PanicExit(kOutOfMemory);
   }
   // Logging or the panic failed to allocate in turn: nothing more can be done.
   if (g_newFailureThread.load() == self) abort();
   // Only the first thread writes the report; this one waits for the end.
   for (;;) usleep(999999);
}

}  // namespace

void SetPanicLocation(const std::string& directory, const std::string& name) {
   if (directory.empty() || name.empty()) throw InvalidArgumentException("panic location");
   MakeDirectories(directory);
   struct rlimit limit;
   if (getrlimit(RLIMIT_CORE, &limit) == 0) {
      limit.rlim_cur = limit.rlim_max;  // raising the hard limit needs privileges we may lack
      setrlimit(RLIMIT_CORE, &limit);
   }
   prctl(PR_SET_DUMPABLE, 1, 0, 0, 0);
   LogFileOptions options;
   options.path = directory.back() == '/' ? directory + name : directory + "/" + name;
   options.level = "panic";
   options.bufferSize = 0;  // a dying process flushes nothing
   options.maxFileSize = 0;
   Ref<LogWriter> writer;
   CreateFileLogWriter(kPanicWriter, options, writer);
   Ref<LogOutput> output;
   GetDefaultLogManager()->GetOrCreateLogOutput(LogManager::kDefaultOutput, output);
   Ref<LogWriter> old;
   output->RemoveWriter(kPanicWriter, old);
   if (old) old->Close();
   output->AddWriter(kPanicWriter, writer.Get());
   std::lock_guard<std::mutex> lock(g_panicMutex);
   *g_panicPath = options.path;
}

std::string GetPanicLocation() {
   std::lock_guard<std::mutex> lock(g_panicMutex);
   return *g_panicPath;
}

void EnableStackTracer() {
   void* frame[1];
   backtrace(frame, 1);  // loads the unwinder outside any handler
   struct sigaction action = {};
   action.sa_handler = &OnFatalSignal;
   action.sa_flags = SA_RESETHAND | SA_NODEFER;
   sigemptyset(&action.sa_mask);
   for (int number : {SIGSEGV, SIGBUS, SIGILL, SIGFPE}) sigaction(number, &action, nullptr);
}

void InstallNewHandler() { std::set_new_handler(&NewHandlerInt); }

}  // namespace Pelmora::Service
