#include <gtest/gtest.h>

#include <chrono>
#include <thread>
#include <vector>

#include "pelmora/system.h"

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

TEST_F(ConditionTest, SignalWithoutWaiterIsForgotten) {
   condition->Signal();
   condition->Broadcast();
   Synchronized lock(mutex.Get());
   auto start = Clock::now();
   EXPECT_FALSE(condition->TimedWait(mutex.Get(), 2000));
   EXPECT_GE(MicrosSince(start), 2000);
   EXPECT_TRUE(mutex->IsLocked());
}

TEST_F(ConditionTest, TimedWaitOfZeroReturnsAtOnce) {
   Synchronized lock(mutex.Get());
   auto start = Clock::now();
   EXPECT_FALSE(condition->TimedWait(mutex.Get(), 0));
   EXPECT_LT(MicrosSince(start), 100000);
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
   for (std::thread& t : waiters) t.join();
   EXPECT_EQ(3, woken);
}

TEST_F(ConditionTest, ATimedWaiterReturnsTrueWhenSignalled) {
   bool ready = false;
   bool result = false;
   std::thread waiter([&] {
      Synchronized lock(mutex.Get());
      ready = true;
      result = condition->TimedWait(mutex.Get(), 10000000);
   });
   for (;;) {
      Synchronized lock(mutex.Get());
      if (ready) break;
   }
   condition->Signal();
   waiter.join();
   EXPECT_TRUE(result);
}

// Two threads hand a token back and forth; every hand-over needs a wake-up that is
// neither lost nor taken by the sender itself.
TEST_F(ConditionTest, PingPongNeverLosesAWakeup) {
   int turn = 0;
   constexpr int kRounds = 2000;
   auto play = [&](int me) {
      for (int i = 0; i < kRounds; ++i) {
         Synchronized lock(mutex.Get());
         while (turn != me) condition->Wait(mutex.Get());
         turn = 1 - me;
         condition->Signal();
      }
   };
   std::thread a(play, 0), b(play, 1);
   a.join();
   b.join();
   EXPECT_EQ(0, turn);
}

TEST_F(ConditionTest, WaitableObjectForwardsToTheCondition) {
   Ref<WaitableObjectImpl> waitable = new WaitableObjectImpl(mutex.Get());
   Synchronized lock(waitable.Get());
   EXPECT_TRUE(mutex->IsLocked());
   waitable->Signal();
   EXPECT_FALSE(waitable->TimedWait(500));
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
