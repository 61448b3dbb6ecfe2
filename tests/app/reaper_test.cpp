// The child reaper: exited children are collected with their status, promptly.

#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>

#include "pelmora/service/daemon.h"
#include "tests/support/appProcess.h"

namespace Pelmora::Service {
namespace {

pid_t SpawnExiting(int status) {
   pid_t child = fork();
   if (child == 0) _exit(status);
   return child;
}

TEST(ChildReaperTest, CollectsEachChildWithItsStatusOnce) {
   Ref<ChildReaper> reaper;
   CreateChildReaper(10000, reaper);  // a long idle poll: wake-ups must come from notices
   pid_t first = SpawnExiting(3);
   pid_t second = SpawnExiting(4);
   int status = 0;
   auto start = std::chrono::steady_clock::now();
   ASSERT_TRUE(reaper->WaitStatus(second, 5000, status));
   EXPECT_TRUE(WIFEXITED(status));
   EXPECT_EQ(WEXITSTATUS(status), 4);
   ASSERT_TRUE(reaper->WaitStatus(first, 5000, status));
   EXPECT_EQ(WEXITSTATUS(status), 3);
   EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
   // Taken statuses are forgotten; strangers have none.
   EXPECT_FALSE(reaper->TakeStatus(first, status));
   EXPECT_FALSE(reaper->TakeStatus(1, status));
   reaper->Stop();
}

TEST(ChildReaperTest, ARunningChildHasNoStatusUntilItEnds) {
   Ref<ChildReaper> reaper;
   CreateChildReaper(5, reaper);
   int pipeFds[2];
   ASSERT_EQ(pipe(pipeFds), 0);
   pid_t child = fork();
   if (child == 0) {
      char byte;
      close(pipeFds[1]);
      ssize_t n = read(pipeFds[0], &byte, 1);  // until the parent closes its end
      _exit(n == 0 ? 0 : 1);
   }
   close(pipeFds[0]);
   int status = 0;
   EXPECT_FALSE(reaper->WaitStatus(child, 30, status));
   close(pipeFds[1]);
   // Found by the idle poll alone.
   ASSERT_TRUE(Testing::WaitUntil([&] { return reaper->TakeStatus(child, status); }));
   EXPECT_EQ(WEXITSTATUS(status), 0);
   EXPECT_EQ(GetChildReaper() != nullptr, true);
   reaper->Stop();
}

}  // namespace
}  // namespace Pelmora::Service
