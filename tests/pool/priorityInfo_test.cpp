// Priority levels: slot reservation as GetNextItem applies it, and the weight order of
// the queues of one level. The pool's threads are held back, so the test alone takes items.

#include <gtest/gtest.h>

#include "tests/pool/poolFixture.h"

namespace Pelmora::System {
namespace {

using namespace PoolTesting;

class PriorityInfoTest : public testing::Test {
protected:
   PriorityInfoTest() : control(new TestThreadControl(false)) {
      pool = MakePool({{"maxThreads", "200"}, {"reservationRatio", "3"}, {"initSingleThreaded", "true"}},
                      control.Get());
   }
   ~PriorityInfoTest() override {
      pool->RequestShutdown();
      control->StartHeld();
      EXPECT_TRUE(pool->WaitShutdown(10000000));
   }

   Ref<WorkQueueImpl> Fair(const std::string& id, int level) {
      Ref<WorkQueue> queue;
      pool->CreateFairWorkQueue(WorkQueueSpec(id, level), queue);
      return queue.Cast<WorkQueueImpl>();
   }
   static void Fill(WorkQueue* queue, int count) {
      for (int i = 0; i < count; ++i) queue->Enqueue([] {});
   }
   // The queue GetNextItem serves next, null when it refuses.
   WorkQueueImpl* Next(bool starved = false) {
      WorkItem item;
      WorkQueueImpl* queue = nullptr;
      if (!pool->GetNextItem(starved, item, queue)) return nullptr;
      taken.push_back(queue);
      return queue;
   }
   int Reservation(int level) {
      PriorityInfo* info = pool->GetPriorityInfo(level);
      Synchronized lock(info);
      return info->GetEffectiveReservation();
   }
   void SetBusy(int busy) { pool->GetLimits().busyCount.Write(busy); }

   Ref<TestThreadControl> control;
   Ref<ThreadPoolFair> pool;
   std::vector<Ref<WorkQueueImpl>> taken;
};

// With 200 slots and ratio 3 the most urgent level may take all slots but one; the level
// below it leaves two free, plus one per three items it runs itself.
TEST_F(PriorityInfoTest, ReservationLeavesSlotsForMoreUrgentLevels) {
   Ref<WorkQueueImpl> urgent = Fair("urgent", 0);
   Ref<WorkQueueImpl> lower = Fair("lower", 5);
   Fill(urgent.Get(), 2);
   SetBusy(198);
   EXPECT_EQ(urgent.Get(), Next());
   EXPECT_EQ(199, pool->GetLimits().busyCount.Read());
   EXPECT_EQ(nullptr, Next());
   EXPECT_EQ(1, pool->GetStarvedCount());
   EXPECT_EQ(199, pool->GetLimits().busyCount.Read()) << "a refused slot is given back";

   // The urgent level drained: the lower one runs, but only up to 198 taken slots.
   SetBusy(0);
   EXPECT_EQ(urgent.Get(), Next(true));
   EXPECT_EQ(0, pool->GetStarvedCount());
   Fill(lower.Get(), 10);
   SetBusy(197);
   EXPECT_EQ(2, Reservation(5));
   EXPECT_EQ(lower.Get(), Next());
   EXPECT_EQ(nullptr, Next());
   EXPECT_EQ(198, pool->GetLimits().busyCount.Read());

   // Three items of its own running raise the lower level's reservation by one.
   SetBusy(0);
   EXPECT_EQ(lower.Get(), Next());
   EXPECT_EQ(lower.Get(), Next());
   EXPECT_EQ(3, pool->GetPriorityInfo(5)->GetExecuting());
   EXPECT_EQ(3, Reservation(5));
   SetBusy(196);
   EXPECT_EQ(lower.Get(), Next());
   EXPECT_EQ(nullptr, Next());
}

// A pool at its limit refuses handler after handler; the usage line is written when the
// refusals start, not for each one, and again only after the refused levels were served.
TEST_F(PriorityInfoTest, RefusalsLogTheUsageOncePerStretch) {
   PoolLogCapture log;
   auto usageLines = [&log] {
      std::string text = log.Text();
      int count = 0;
      for (size_t at = text.find("Thread pool usage"); at != std::string::npos;
           at = text.find("Thread pool usage", at + 1))
         ++count;
      return count;
   };
   Ref<WorkQueueImpl> urgent = Fair("urgent", 0);
   Fill(urgent.Get(), 3);
   SetBusy(199);
   for (int i = 0; i < 3; ++i) EXPECT_EQ(nullptr, Next());
   EXPECT_EQ(3, pool->GetStarvedCount());
   EXPECT_EQ(nullptr, Next(true)) << "a starved pass refused again";
   EXPECT_EQ(3, pool->GetStarvedCount());
   EXPECT_EQ(1, usageLines());

   SetBusy(0);
   for (int i = 0; i < 3; ++i) EXPECT_EQ(urgent.Get(), Next(true));
   EXPECT_EQ(0, pool->GetStarvedCount());
   EXPECT_EQ(nullptr, Next(true)) << "nothing refused is left to serve";
   Fill(urgent.Get(), 1);
   SetBusy(199);
   EXPECT_EQ(nullptr, Next());
   EXPECT_EQ(2, usageLines());
}

// A change of a level's running count reaches the cached reservations of the levels below.
TEST_F(PriorityInfoTest, CachedReservationsFollowTheLevelsAbove) {
   Ref<WorkQueueImpl> top = Fair("top", 0);
   Ref<WorkQueueImpl> middle = Fair("middle", 5);
   Ref<WorkQueueImpl> bottom = Fair("bottom", 10);
   EXPECT_EQ(1, Reservation(0));
   EXPECT_EQ(2, Reservation(5));
   EXPECT_EQ(3, Reservation(10));
   Fill(middle.Get(), 6);
   for (int i = 0; i < 6; ++i) EXPECT_EQ(middle.Get(), Next());
   EXPECT_EQ(4, Reservation(5));
   EXPECT_EQ(5, Reservation(10));
   for (int i = 0; i < 4; ++i) middle->ItemCompleted(1);
   EXPECT_EQ(2, Reservation(5));
   EXPECT_EQ(3, Reservation(10));
   // A level that becomes active in between takes its place in the chain.
   Fair("between", 7);
   EXPECT_EQ(3, Reservation(7));
   EXPECT_EQ(4, Reservation(10));
}

TEST_F(PriorityInfoTest, AFreshQueueIsServedBeforeABusyOne) {
   Ref<WorkQueueImpl> busy = Fair("busy", 5);
   Ref<WorkQueueImpl> fresh = Fair("fresh", 5);
   Fill(busy.Get(), 5);
   EXPECT_EQ(busy.Get(), Next());
   Fill(fresh.Get(), 2);
   EXPECT_EQ(fresh.Get(), Next()) << "weight -1 goes first";
   // Both run one item now: equal weights take turns, the one served last goes behind.
   EXPECT_EQ(busy.Get(), Next());
   EXPECT_EQ(fresh.Get(), Next());
   // Two running against two, then the one that finished an item has fewer running.
   busy->ItemCompleted(1);
   EXPECT_EQ(busy.Get(), Next());
}

// The key is taken when a queue enters the index and after each pop, not on completion.
TEST_F(PriorityInfoTest, TheQueueWithFewerItemsRunningIsServedFirst) {
   Ref<WorkQueueImpl> a = Fair("a", 5);
   Ref<WorkQueueImpl> b = Fair("b", 5);
   Fill(a.Get(), 4);
   Fill(b.Get(), 4);
   EXPECT_EQ(a.Get(), Next());
   EXPECT_EQ(b.Get(), Next());
   EXPECT_EQ(a.Get(), Next());
   EXPECT_EQ(b.Get(), Next()) << "a runs two, b one";
   EXPECT_EQ(a.Get(), Next()) << "equal: the one served last goes behind";
}

// A level whose queues all ran dry is no longer runnable; its next item makes it so again.
TEST_F(PriorityInfoTest, ALevelIsRunnableWhileItHasItems) {
   PoolLogCapture log;
   Ref<WorkQueueImpl> queue = Fair("only", 5);
   EXPECT_FALSE(pool->IsLevelRunnable(5));
   Fill(queue.Get(), 1);
   EXPECT_TRUE(pool->IsLevelRunnable(5));
   EXPECT_EQ(queue.Get(), Next());
   EXPECT_FALSE(pool->IsLevelRunnable(5));
   EXPECT_EQ(nullptr, Next());
   EXPECT_TRUE(log.Contains("Priority 5 becomming non empty."));
   EXPECT_TRUE(log.Contains("Priority 5 becomming empty."));
   EXPECT_TRUE(log.Contains("Priority level 5 is now active."));
}

}  // namespace
}  // namespace Pelmora::System
