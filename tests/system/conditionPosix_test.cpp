#include <gtest/gtest.h>

#include <chrono>
#include <thread>
#include <vector>

#include "pelmora/system.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

using Clock = std::chrono::steady_clock;

long long MicrosSince(Clock::time_point start) {
   return std::chrono::duration_cast<std::chrono::microseconds>(Clock::now() - start).count();
}

class ConditionTest : public testing::Test {
protected:
   ConditionTest() {
      GetSystemFactory()->CreateMutex(mutex);
      GetSystemFactory()->CreateCondition(condition);
   }

   Ref<Mutex> mutex;
   Ref<Condition> condition;
};

// A signal without a waiter is forgotten; a timed wait runs its time (0: none) and returns
// with the mutex held again.
TEST_F(ConditionTest, TimedWaitWithoutSignalTimesOutHoldingTheMutex) {
   condition->Signal();
   condition->Broadcast();
   Synchronized lock(mutex.Get());
   auto start = Clock::now();
   EXPECT_FALSE(condition->TimedWait(mutex.Get(), 0));
   EXPECT_LT(MicrosSince(start), 100000);
   EXPECT_TRUE(mutex->IsLocked());
   start = Clock::now();
   EXPECT_FALSE(condition->TimedWait(mutex.Get(), 2000));
   EXPECT_GE(MicrosSince(start), 2000);
   EXPECT_TRUE(mutex->IsLocked());
}

TEST_F(ConditionTest, SignalWakesOneWaiterAndBroadcastTheRest) {
   // The test thread waits for progress on a condition of its own: waiting on the one
   // under test would make it a waiter that may rightly take the signal meant for others.
   Ref<Condition> progress;
   GetSystemFactory()->CreateCondition(progress);
   int entered = 0;
   int woken = 0;
   std::vector<std::thread> waiters;
   for (int i = 0; i < 3; ++i) {
      waiters.emplace_back([&] {
         Synchronized lock(mutex.Get());
         ++entered;
         progress->Signal();
         condition->Wait(mutex.Get());
         EXPECT_TRUE(mutex->IsLocked());
         ++woken;
         progress->Signal();
      });
   }
   // A waiter counted under the mutex is already inside Wait: the mutex is released only
   // after the waiter has registered, so no wake-up below can miss it.
   {
      Synchronized lock(mutex.Get());
      while (entered < 3) progress->TimedWait(mutex.Get(), 1000);
   }
   condition->Signal();
   {
      Synchronized lock(mutex.Get());
      while (woken < 1) progress->TimedWait(mutex.Get(), 1000);
      // Give a wrongly woken second waiter the time to show.
      progress->TimedWait(mutex.Get(), 3000);
      EXPECT_EQ(1, woken);
   }
   condition->Broadcast();
   Pelmora::Testing::JoinAll(waiters, "waiters to finish");
   EXPECT_EQ(3, woken);
}

// Every hand-over of the token needs a wake-up that is neither lost nor taken by the sender;
// a signalled timed waiter returns true.
TEST_F(ConditionTest, PingPongNeverLosesAWakeup) {
   int turn = 0;
   bool timedOut = false;
   auto play = [&](int me) {
      for (int i = 0; i < 2000; ++i) {
         Synchronized lock(mutex.Get());
         while (turn != me) {
            if (me == 0) condition->Wait(mutex.Get());
            else if (!condition->TimedWait(mutex.Get(), 10000000)) timedOut = true;
         }
         turn = 1 - me;
         condition->Signal();
      }
   };
   std::thread a(play, 0), b(play, 1);
   Pelmora::Testing::Join(a, "a to finish");
   Pelmora::Testing::Join(b, "b to finish");
   EXPECT_EQ(0, turn);
   EXPECT_FALSE(timedOut);
}

using ConditionDeathTest = ConditionTest;

TEST_F(ConditionDeathTest, WaitingWithoutHoldingTheMutexPanics) {
   EXPECT_DEATH(
       condition->Wait(mutex.Get()),
       "Assert Failed: \"mutex->IsLocked\\(\\)\" @ src/system/conditionPosix.cpp:[0-9]+\n");
   EXPECT_DEATH(condition->TimedWait(mutex.Get(), 0), "\"mutex->IsLocked\\(\\)\"");
}

}  // namespace
}  // namespace Pelmora::System
