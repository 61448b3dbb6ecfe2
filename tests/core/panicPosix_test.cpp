#include <gtest/gtest.h>

#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <thread>
#include <vector>

#include "pelmora/exception.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/service/logger.h"
#include "src/internal/report.h"

namespace Pelmora {
namespace {

TEST(PanicTest, FormatPanicMessageLaysOutTheFirstLine) {
   EXPECT_EQ("Assert Failed: \"x > 0\" @ a/b:7", FormatPanicMessage(assertPrefix, "x > 0", "a/b", 7));
   EXPECT_EQ("Not Reached: @ a/b:7", FormatPanicMessage("Not Reached:", nullptr, "a/b", 7));
}

TEST(PanicDeathTest, EachPanicWritesItsFirstLineAndBacktrace) {
   EXPECT_DEATH(PanicVerify("x > 0", "a/b", 7),
                "\n\nPanic: Assert Failed: \"x > 0\" @ a/b:7\nBacktrace:\n#0 ");
   EXPECT_DEATH(PanicNotReached("a/b", 7), "\n\nPanic: Not Reached: @ a/b:7\n");
   EXPECT_DEATH(PanicNotImplemented("a/b", 7), "\n\nPanic: Not Implemented: @ a/b:7\n");
   EXPECT_DEATH(Panic("%s has %d", "queue", 3), "\n\nPanic: queue has 3\n");
   EXPECT_DEATH(PanicExit(InvalidStateException()), "\n\nPanic: Invalid state\n");
}

TEST(PanicDeathTest, VerifyNamesTheExpandedExpressionAndTheRepositoryPath) {
   int* link = nullptr;
   EXPECT_DEATH(PELMORA_VERIFY(NULL != link),
                "Panic: Assert Failed: \"__null != link\" @ tests/core/panicPosix_test.cpp:[0-9]+\n");
   EXPECT_DEATH(PELMORA_NOT_REACHED(), "Panic: Not Reached: @ tests/core/panicPosix_test.cpp:[0-9]+\n");
}

// Everything the process at `pid` and its report child write to `fd`, until both close it
// or `deadline` passes (then the process is killed and `timedOut` set).
std::string ReadUntilClosed(int fd, pid_t pid, std::chrono::steady_clock::time_point deadline,
                            bool& timedOut) {
   std::string text;
   char buffer[4096];
   timedOut = false;
   for (;;) {
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd entry{fd, POLLIN, 0};
      if (left.count() <= 0 || poll(&entry, 1, static_cast<int>(left.count())) == 0) {
         timedOut = true;
         kill(pid, SIGKILL);
         break;
      }
      ssize_t n = read(fd, buffer, sizeof(buffer));
      if (n <= 0) break;
      text.append(buffer, static_cast<size_t>(n));
   }
   return text;
}

struct ChildPanic {
   std::string report;  // what the process and its report child wrote to standard error
   int status = 0;
   bool timedOut = false;
};

// Runs `panic` (which must not return) in a forked process that may fork its report child,
// and collects the report; the report child holds the pipe too, so reading to its end
// waits for the report.
template <class F>
ChildPanic PanicInChild(F panic, std::chrono::steady_clock::time_point deadline) {
   ChildPanic result;
   int pipeFds[2];
   if (pipe(pipeFds) != 0) return result;
   pid_t pid = fork();
   if (pid == 0) {
      dup2(pipeFds[1], STDERR_FILENO);
      close(pipeFds[0]);
      close(pipeFds[1]);
      SetPanicMayFork(true);
      panic();
      _exit(0);
   }
   close(pipeFds[1]);
   result.report = ReadUntilClosed(pipeFds[0], pid, deadline, result.timedOut);
   close(pipeFds[0]);
   waitpid(pid, &result.status, 0);
   return result;
}

TEST(PanicTest, AForkedChildWritesTheReportAndTheProcessDumpsCore) {
   ChildPanic child = PanicInChild([] { PanicVerify("forked", "a/b", 9); },
                                   std::chrono::steady_clock::now() + std::chrono::seconds(20));
   ASSERT_FALSE(child.timedOut);
   EXPECT_TRUE(WIFSIGNALED(child.status));
   EXPECT_EQ(SIGABRT, WTERMSIG(child.status));
   EXPECT_EQ(0u, child.report.find("\n\nPanic: Assert Failed: \"forked\" @ a/b:9\nBacktrace:\n#0 "))
      << child.report;
}

// Other threads hold the allocator's and the logger's locks at any moment; the report child
// must get its report out regardless, each time.
TEST(PanicTest, TheReportArrivesWhileOtherThreadsLogAndAllocate) {
   constexpr int kRounds = 12;
   auto end = std::chrono::steady_clock::now() + std::chrono::seconds(20);
   for (int round = 0; round < kRounds; ++round) {
      ChildPanic child = PanicInChild([round] {
         Internal::SetPanicReportTimeout(std::chrono::milliseconds(200));
         Service::Logger* logger = Service::GetDefaultLogger();
         std::atomic<int> busy{0};
         std::vector<std::thread> threads;
         for (int i = 0; i < 3; ++i) {
            threads.emplace_back([&, i] {
               bool counted = false;
               for (unsigned n = 0;; ++n) {
                  if (i == 0) {
                     auto block = std::make_unique<char[]>(64 + n % 4096);
                     block[0] = 1;
                  } else {
                     PELMORA_LOG_ERROR(logger, "busy line %1 from %2", n, i);
                  }
                  if (!counted && n == 200) {
                     counted = true;
                     busy.fetch_add(1);
                  }
               }
            });
         }
         while (busy.load() < 3) std::this_thread::yield();
         PanicVerify("hammered", "a/b", round);
      }, end);
      ASSERT_FALSE(child.timedOut) << "round " << round << " never finished its report";
      EXPECT_TRUE(WIFSIGNALED(child.status));
      std::string first = "Panic: Assert Failed: \"hammered\" @ a/b:" + std::to_string(round) +
                          "\nBacktrace:\n#0 ";
      ASSERT_NE(std::string::npos, child.report.find(first)) << "round " << round;
   }
}

}  // namespace
}  // namespace Pelmora
