#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include "pelmora/exception.h"

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

TEST(PanicTest, AForkedChildWritesTheReportAndTheProcessDumpsCore) {
   int pipeFds[2];
   ASSERT_EQ(0, pipe(pipeFds));
   pid_t pid = fork();
   ASSERT_GE(pid, 0);
   if (pid == 0) {
      dup2(pipeFds[1], STDERR_FILENO);
      close(pipeFds[0]);
      close(pipeFds[1]);
      SetPanicMayFork(true);
      PanicVerify("forked", "a/b", 9);
   }
   close(pipeFds[1]);
   // The report child holds the pipe too: reading to its end waits for the report.
   std::string report;
   char buffer[4096];
   ssize_t n;
   while ((n = read(pipeFds[0], buffer, sizeof(buffer))) > 0) report.append(buffer, n);
   close(pipeFds[0]);
   int status = 0;
   ASSERT_EQ(pid, waitpid(pid, &status, 0));
   EXPECT_TRUE(WIFSIGNALED(status));
   EXPECT_EQ(SIGABRT, WTERMSIG(status));
   EXPECT_EQ(0u, report.find("\n\nPanic: Assert Failed: \"forked\" @ a/b:9\nBacktrace:\n#0 "))
      << report;
}

}  // namespace
}  // namespace Pelmora
