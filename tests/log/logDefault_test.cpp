// The default logger as the process report sink: panics and exception dumps.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/writers.h"
#include "pelmora/object/ref.h"
#include "pelmora/service.h"
#include "src/internal/report.h"
#include "tests/support/watchdog.h"
#include "tests/support/logLines.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;

TEST(LogMemoryDeathTest, PanicAndExceptionDumpReportTheRecentLines) {
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "recent line %1", 42);
          PELMORA_VERIFY(1 + 1 == 3);
       },
       "Panic: Assert Failed: \"1 \\+ 1 == 3\".*Recent log lines.*recent line 42");
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "before the dump");
          InvalidStateException().Dump();
          abort();
       },
       "error 'default'\\] \n\nException: Invalid state\nType: .*Recent log lines.*before the dump");
}

// A thread that holds the memory output's lock when the process panics stays stopped in
// the report child for good; the report must still carry the ring's lines, and in good
// time (the report time-out here is far above the bounded wait for a lock).
TEST(LogMemoryDeathTest, PanicReportHasTheRecentLinesWhileAnotherThreadHoldsALogLock) {
   auto panicWithTheMemoryOutputHeld = [] {
      SetPanicMayFork(true);
      Internal::SetPanicReportTimeout(std::chrono::seconds(20));
      PELMORA_LOG_VERBOSE(GetDefaultLogger(), "recent line %1", 7);
      Ref<LogOutput> memory;
      GetDefaultLogManager()->FindLogOutput(LogManager::kMemoryOutput, memory);
      std::atomic<bool> held{false};
      std::thread([&] {
         memory->RecursiveWriteLock();
         held.store(true);
         for (;;) pause();
      }).detach();
      auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
      while (!held.load() && std::chrono::steady_clock::now() < end) std::this_thread::yield();
      PELMORA_VERIFY(1 + 1 == 3);
   };
   auto start = std::chrono::steady_clock::now();
   EXPECT_DEATH(panicWithTheMemoryOutputHeld(),
                "Panic: Assert Failed: \"1 \\+ 1 == 3\".*"
                "----- Recent log lines \\(Assert Failed: .*recent line 7\n.*"
                "----- End of recent log lines -----");
   EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(15));
}

namespace {

// Writes to standard error; the first Flush stops its thread for good, holding the log
// writer's lock around it.
class StderrStoppingWriter : public virtual Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override {
      while (length > 0) {
         ssize_t n = write(STDERR_FILENO, data, static_cast<size_t>(length));
         if (n <= 0) return;
         data += n;
         length -= static_cast<int>(n);
      }
   }
   void Flush() override {
      if (stopped.exchange(true)) return;
      for (;;) pause();
   }
   void Close() override {}
   std::atomic<bool> stopped{false};
};

void WaitFor(const std::atomic<bool>& flag) {
   auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
   while (!flag.load() && std::chrono::steady_clock::now() < end) std::this_thread::yield();
}

// The lock another thread holds, stopped for good, when the process panics.
enum class HeldLock { kOutput, kWriter, kManager };

// Panics while another thread, stopped for good, holds the default output's lock, one of
// its writers' locks or its manager's lock. The report time-out is short: a report child
// that waits for the lock is killed by then and the report is cut short, without the
// recent lines.
void PanicWithALogLockHeld(HeldLock which) {
   SetPanicMayFork(true);
   Internal::SetPanicReportTimeout(std::chrono::milliseconds(1500));
   PELMORA_LOG_VERBOSE(GetDefaultLogger(), "recent line %1", 9);
   LogOutput* output = GetDefaultLogger()->GetLogOutput();
   std::atomic<bool> held{false};
   if (which == HeldLock::kWriter) {
      Ref<StderrStoppingWriter> target = new StderrStoppingWriter();
      Ref<LogWriter> writer;
      CreateLogWriter("stopping", target.Get(), "trivia", writer);
      output->AddWriter("stopping", writer.Get());
      std::thread([writer] { writer->Flush(); }).detach();
      WaitFor(target->stopped);
   } else {
      std::thread([&, which] {
         if (which == HeldLock::kOutput) {
            output->RecursiveWriteLock();
         } else {
            GetDefaultLogManager()->Lock();
         }
         held.store(true);
         for (;;) pause();
      }).detach();
      WaitFor(held);
   }
   PELMORA_VERIFY(1 + 1 == 3);
}

}  // namespace

TEST(LogMemoryDeathTest, PanicReportIsWholeAndQuickWhileAnotherThreadHoldsALogLock) {
   const char* whole =
       "Panic: Assert Failed: \"1 \\+ 1 == 3\".*"
       "----- Recent log lines \\(Assert Failed: .*recent line 9\n.*"
       "----- End of recent log lines -----";
   for (HeldLock which : {HeldLock::kOutput, HeldLock::kWriter, HeldLock::kManager}) {
      auto start = std::chrono::steady_clock::now();
      EXPECT_DEATH(PanicWithALogLockHeld(which), whole) << "lock " << static_cast<int>(which);
      EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1500))
          << "lock " << static_cast<int>(which);
   }
}
