// A wait that never ends becomes a failure that names what was awaited.

#include <future>

#include <gtest/gtest.h>

#include "tests/support/watchdog.h"

using Pelmora::Testing::Watchdog;

TEST(WatchdogDeathTest, AHangNamesWhatTheTestWaitedFor) {
   EXPECT_EXIT(
       {
          std::promise<void> never;
          Watchdog watchdog("a wake-up that was lost", std::chrono::milliseconds(50));
          never.get_future().wait();
       },
       testing::ExitedWithCode(3),
       "WatchdogDeathTest.AHangNamesWhatTheTestWaitedFor: still waiting for a wake-up that was "
       "lost after 50 ms");
}
