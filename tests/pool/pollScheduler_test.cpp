// Descriptor waits: they fire once on readability or write-readiness, cancelled ones
// never, and a polling thread that is full hands new descriptors to another.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>

#include "tests/pool/poolFixture.h"

namespace Pelmora::System {
namespace {

using namespace PoolTesting;

class PollSchedulerTest : public PoolTest {
protected:
   // The pool stops polling before the descriptors close.
   ~PollSchedulerTest() override {
      Finish();
      for (int fd : fds) close(fd);
   }
   void Start() { Pool({{"minThreads", "2"}}); }
   void Pipe(int& readFd, int& writeFd) {
      int pair[2];
      ASSERT_EQ(0, pipe(pair));
      readFd = pair[0];
      writeFd = pair[1];
      fds.push_back(readFd);
      fds.push_back(writeFd);
   }

   std::vector<int> fds;
};

TEST_F(PollSchedulerTest, WaitsFireOnceWhenTheDescriptorIsReady) {
   Start();
   int readFd, writeFd;
   Pipe(readFd, writeFd);
   std::atomic<int> readable{0}, writable{0};
   std::atomic<WorkQueue*> queue{nullptr};
   Ref<ScheduledItem> readWait, writeWait;
   pool->ScheduleReadReady(readFd, [&] {
      queue = pool->GetCurrentWorkQueue();
      ++readable;
   }, readWait);
   pool->ScheduleWriteReady(writeFd, [&] { ++writable; }, writeWait);
   WaitFor([&] { return writable.load() == 1; }, "write-readiness of an empty pipe");
   EXPECT_EQ(0, readable.load());
   ASSERT_EQ(1, write(writeFd, "x", 1));
   WaitFor([&] { return readable.load() == 1; }, "readability");
   EXPECT_EQ(pool->GetDefaultIOQueue(), queue.load());
   EXPECT_FALSE(pool->CancelPollable(readWait.Get())) << "already ran";
   // Still readable, but the wait is over: it does not fire again.
   std::atomic<int> marker{0};
   Ref<ScheduledItem> again;
   pool->ScheduleReadReady(readFd, [&] { ++marker; }, again);
   WaitFor([&] { return marker.load() == 1; }, "a second wait");
   EXPECT_EQ(1, readable.load());
   Finish();
}

TEST_F(PollSchedulerTest, ACancelledWaitNeverFires) {
   Start();
   int readFd, writeFd, otherRead, otherWrite;
   Pipe(readFd, writeFd);
   Pipe(otherRead, otherWrite);
   std::atomic<int> cancelledFired{0}, marker{0};
   Ref<ScheduledItem> cancelled, other;
   pool->ScheduleReadReady(readFd, [&] { ++cancelledFired; }, cancelled);
   EXPECT_TRUE(pool->CancelPollable(cancelled.Get()));
   EXPECT_TRUE(cancelled->IsCancelled());
   ASSERT_EQ(1, write(writeFd, "x", 1));
   pool->ScheduleReadReady(otherRead, [&] { ++marker; }, other);
   ASSERT_EQ(1, write(otherWrite, "x", 1));
   WaitFor([&] { return marker.load() == 1; }, "the other wait");
   EXPECT_EQ(0, cancelledFired.load());
   Finish();
}

// With room for three descriptors beside its signal, one thread cannot take seven waits.
TEST_F(PollSchedulerTest, FullPollingThreadsAreJoinedByAnother) {
   control->maxPollables = 4;
   Start();
   int before = control->started.load();
   constexpr int kWaits = 7;
   int readFds[kWaits], writeFds[kWaits];
   std::atomic<int> fired{0};
   std::vector<Ref<ScheduledItem>> waits(kWaits);
   for (int i = 0; i < kWaits; ++i) {
      Pipe(readFds[i], writeFds[i]);
      pool->ScheduleReadReady(readFds[i], [&] { ++fired; }, waits[i]);
   }
   EXPECT_EQ(3, control->started.load() - before) << "polling threads";
   for (int i = 0; i < kWaits; ++i) ASSERT_EQ(1, write(writeFds[i], "x", 1));
   WaitFor([&] { return fired.load() == kWaits; }, "every wait");
   Finish();
}

// Jitters the polling threads around the points where they snapshot, poll and drain their
// signal, so a wake-up that depends on lucky timing gets lost.
class JitterControl : public TestThreadControl {
public:
   JitterControl() : TestThreadControl(true) {}
   void DoPoll(const std::vector<std::pair<int, POLL_EVENT>>& pollables,
               std::vector<int>& readyIndices) override {
      Jitter();
      TestThreadControl::DoPoll(pollables, readyIndices);
      Jitter();
   }
   void SetPollableSignal(int writeFd) override {
      Jitter();
      TestThreadControl::SetPollableSignal(writeFd);
   }
   void ResetPollableSignal(int readFd) override {
      Jitter();
      TestThreadControl::ResetPollableSignal(readFd);
   }

private:
   void Jitter() {
      unsigned r = _seed.fetch_add(0x9e3779b9u) * 2654435761u >> 24;
      if (r % 4 == 0) std::this_thread::sleep_for(std::chrono::microseconds(r % 200));
      else if (r % 4 == 1) std::this_thread::yield();
   }
   std::atomic<unsigned> _seed{1};
};

// Callbacks of waits that fire together reach the default queue from several polling
// threads at once; none may be left in the queue without a handler.
TEST(PollSchedulerStress, EveryWaitFiresUnderJitter) {
   for (int round = 0; round < 40; ++round) {
      Ref<JitterControl> control = new JitterControl();
      control->maxPollables = 4;
      Ref<ThreadPoolFair> pool = MakePool({{"minThreads", "2"}}, control.Get());
      constexpr int kWaits = 7;
      int fds[kWaits][2];
      std::atomic<int> fired{0};
      std::vector<Ref<ScheduledItem>> waits(kWaits);
      for (int i = 0; i < kWaits; ++i) {
         ASSERT_EQ(0, pipe(fds[i]));
         pool->ScheduleReadReady(fds[i][0], [&] { ++fired; }, waits[i]);
      }
      for (int i = 0; i < kWaits; ++i) ASSERT_EQ(1, write(fds[i][1], "x", 1));
      bool all = WaitFor([&] { return fired.load() == kWaits; }, "every wait", std::chrono::milliseconds(3000));
      ShutDown(pool.Get());
      for (auto& pair : fds) {
         close(pair[0]);
         close(pair[1]);
      }
      ASSERT_TRUE(all) << "round " << round;
   }
}

}  // namespace
}  // namespace Pelmora::System
