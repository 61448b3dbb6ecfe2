// Work queues on a running pool: serial queues run one item at a time in order, fair
// queues run side by side, and a queue of a pool that shut down drops what it gets.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <mutex>
#include <vector>

#include "tests/pool/poolFixture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

using namespace PoolTesting;

class WorkQueueTest : public PoolTest {
protected:
   WorkQueueTest() { Pool({{"minThreads", "4"}, {"maxThreads", "8"}}); }
};

// Many items on two serial queues of one level, posted from two threads: each queue
// never runs two at once and keeps its posting order.
TEST_F(WorkQueueTest, SerialQueuesNeverOverlapAndKeepOrder) {
   constexpr int kItems = 3000;
   struct Track {
      Ref<WorkQueue> queue;
      std::atomic<int> running{0};
      std::atomic<int> overlaps{0};
      std::vector<int> order;  // written only by the queue's running item
   } tracks[2];
   for (int q = 0; q < 2; ++q) {
      pool->CreateSerialWorkQueue(WorkQueueSpec(q == 0 ? "first" : "second", 5), tracks[q].queue);
   }
   std::vector<std::thread> posters;
   for (int q = 0; q < 2; ++q) {
      posters.emplace_back([&, q] {
         Track& track = tracks[q];
         for (int i = 0; i < kItems; ++i) {
            track.queue->Enqueue([&track, i] {
               if (track.running.fetch_add(1) != 0) ++track.overlaps;
               track.order.push_back(i);
               track.running.fetch_sub(1);
            });
         }
      });
   }
   Testing::JoinAll(posters, "the posting threads");
   std::atomic<int> done{0};
   for (Track& track : tracks) track.queue->Enqueue([&] { ++done; });
   WaitFor([&] { return done.load() == 2; }, "both serial queues to drain");
   for (Track& track : tracks) {
      EXPECT_EQ(0, track.overlaps.load()) << track.queue->GetId();
      ASSERT_EQ(static_cast<size_t>(kItems), track.order.size());
      for (int i = 0; i < kItems; ++i) ASSERT_EQ(i, track.order[i]) << track.queue->GetId();
   }
   Finish();
}

TEST_F(WorkQueueTest, FairQueueItemsRunSideBySide) {
   Ref<WorkQueue> queue;
   pool->CreateFairWorkQueue(WorkQueueSpec("wide", 5), queue);
   std::mutex mutex;
   std::condition_variable cv;
   int running = 0, maxRunning = 0;
   for (int i = 0; i < 3; ++i) {
      queue->Enqueue([&] {
         std::unique_lock<std::mutex> lock(mutex);
         maxRunning = std::max(maxRunning, ++running);
         cv.notify_all();
         // Waits (bounded) for a second item to join.
         cv.wait_for(lock, std::chrono::seconds(10), [&] { return maxRunning >= 2; });
         --running;
      });
   }
   WaitFor([&] {
      std::lock_guard<std::mutex> lock(mutex);
      return maxRunning >= 2;
   }, "two items of one fair queue at once");
   WaitFor([&] {
      std::lock_guard<std::mutex> lock(mutex);
      return running == 0 && queue->GetQueueSize() == 0;
   }, "the items to end");
   Finish();
}

TEST_F(WorkQueueTest, DescribesItself) {
   Ref<WorkQueue> serial;
   pool->CreateSerialWorkQueue(WorkQueueSpec("log", 7, 3), serial);
   EXPECT_EQ("WorkQueue.log, type = serial, priority = 7 , itemWeight = 3", serial->ToString());
   EXPECT_EQ("log", serial->GetId());
   Ref<WorkQueue> completion;
   serial->GetCompletionQueue(completion);
   EXPECT_EQ(serial.Get(), completion.Get());
   Finish();
}

}  // namespace
}  // namespace Pelmora::System
