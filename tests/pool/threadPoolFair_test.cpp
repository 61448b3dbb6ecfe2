// The fair pool as a whole: configuration, growth and shrinking, priority levels under
// load, fairness between queues, timers, I/O completions, the main thread and shutdown.

#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <map>
#include <stdexcept>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "pelmora/perfCounter/lwStats.h"
#include "tests/pool/poolFixture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

using namespace PoolTesting;
using std::chrono::milliseconds;

// Items wait on it until the test opens it.
class Gate {
public:
   void Pass() {
      std::unique_lock<std::mutex> lock(_mutex);
      ++waiting;
      _opened.wait(lock, [this] { return _open; });
      --waiting;
   }
   void Open() {
      std::lock_guard<std::mutex> lock(_mutex);
      _open = true;
      _opened.notify_all();
   }
   int Waiting() {
      std::lock_guard<std::mutex> lock(_mutex);
      return waiting;
   }

private:
   std::mutex _mutex;
   std::condition_variable _opened;
   bool _open = false;
   int waiting = 0;
};

// Counts its living instances: a queued item that is released destroys its copy.
class Tracked : public ObjectImpl {
public:
   explicit Tracked(std::atomic<int>* living) : _living(living) { ++*_living; }
   ~Tracked() override { --*_living; }

private:
   std::atomic<int>* _living;
};

using ThreadPoolFairTest = PoolTest;

TEST_F(ThreadPoolFairTest, StackSizesAreClampedWithWarnings) {
   const std::pair<const char*, long long> cases[] = {{"0", 256}, {"10", 32}, {"4096", 2048}, {"100", 100}};
   for (const auto& [configured, expected] : cases) {
      PoolLogCapture log;
      Ref<TestThreadControl> local = new TestThreadControl(true);
      Ref<ThreadPoolFair> p = MakePool({{"ThreadStackSizeKb", configured}, {"minThreads", "1"}}, local.Get());
      EXPECT_EQ(expected, local->lastStackSizeKb.load()) << configured;
      ShutDown(p.Get());
      EXPECT_EQ(std::string(configured) == "10",
                log.Contains("Stack size value 10 smallerr than minStackSize 32, Set to min"));
      EXPECT_EQ(std::string(configured) == "4096",
                log.Contains("Stack size value 4096 bigger than maxStackSize 2048, Set to max"));
   }
   Finish();
}

TEST_F(ThreadPoolFairTest, StartUpLogsTheLimitsAndStartsMinThreads) {
   PoolLogCapture log;
   Pool({{"minThreads", "3"}, {"maxThreads", "2"}, {"reservationRatio", "5"}, {"MaxFdsPerThread", "64"}});
   EXPECT_TRUE(log.Contains("'minThreads'(3) is greater than 'maxThreads'(2)"));
   EXPECT_TRUE(log.Contains("Thread pool fair: Min threads, Max threads, Reservation ratio: 3, 2, 5"));
   EXPECT_TRUE(log.Contains("Thread pool launched"));
   EXPECT_EQ(3, control->started.load()) << "the values are kept as given";
   EXPECT_EQ(64, control->startupFds.load());
   ThreadPoolConfig config;
   pool->GetConfig(config);
   EXPECT_EQ(3, config.minThreads);
   EXPECT_EQ(2, config.maxThreads);
   ShutDown(pool.Get());
   EXPECT_EQ(1, control->shutdowns.load());
   pool.Reset();
   Finish();
}

TEST_F(ThreadPoolFairTest, SingleThreadedStartsTheFirstWorkerOnTheFirstItem) {
   Pool({{"initSingleThreaded", "true"}});
   EXPECT_EQ(0, control->started.load());
   EXPECT_EQ(0, pool->GetThreadCount());
   std::atomic<bool> ran{false};
   pool->ScheduleWorkItem([&] { ran = true; });
   WaitFor([&] { return ran.load(); }, "the first item");
   EXPECT_GE(control->started.load(), 1);
   Finish();
}

TEST_F(ThreadPoolFairTest, QueueIdsAreUniqueAndItemsKnowTheirQueue) {
   Pool({{"minThreads", "1"}});
   Ref<WorkQueue> first;
   pool->CreateSerialWorkQueue(WorkQueueSpec("jobs", 5), first);
   Ref<WorkQueue> second;
   try {
      pool->CreateFairWorkQueue(WorkQueueSpec("jobs", 7), second);
      FAIL() << "a second queue 'jobs' was created";
   } catch (const InvalidStateException& e) {
      EXPECT_STREQ("Queue creation failed. Queue[jobs] already exists.", e.what());
   }
   Ref<WorkQueue> found;
   pool->FindCompletionQueue(WorkQueueSpec("jobs", 7), found);
   EXPECT_EQ(first.Get(), found.Get());
   EXPECT_TRUE(found->IsSerial());
   EXPECT_EQ(5, found->GetPriority());
   pool->FindCompletionQueue(WorkQueueSpec("replies", 3), found);
   EXPECT_FALSE(found->IsSerial());

   // Items know their queue; other threads see none.
   std::atomic<WorkQueue*> seen{nullptr};
   found->Enqueue([&] { seen = pool->GetCurrentWorkQueue(); });
   WaitFor([&] { return seen.load() != nullptr; }, "the item");
   EXPECT_EQ(found.Get(), seen.load());
   EXPECT_EQ(nullptr, pool->GetCurrentWorkQueue());
   pool->EnlistThisThread();
   pool->DelistThisThread();
   Finish();
}

using ThreadPoolFairDeathTest = ThreadPoolFairTest;

TEST_F(ThreadPoolFairDeathTest, BadQueueSpecsAndForeignThreadsPanic) {
   Pool({{"initSingleThreaded", "true"}});
   Ref<WorkQueue> queue;
   EXPECT_DEATH(pool->CreateFairWorkQueue(WorkQueueSpec("", 5), queue), "!spec.id.empty\\(\\)");
   EXPECT_DEATH(pool->CreateFairWorkQueue(WorkQueueSpec("x", 26), queue),
                "spec.priority >= WorkQueueSpec::PL_BEGIN && spec.priority <= WorkQueueSpec::PL_END");
   EXPECT_DEATH(pool->DelistThisThread(), "tlsInfo != __null");
}

// Two fair queues of one level share it: neither gets far ahead of the other, although
// every item of the first was posted before any of the second. Fairness is by items
// running, so one slot (two threads: the most urgent level leaves one free) makes the
// count of items a fair measure even when the machine preempts a worker.
TEST_F(ThreadPoolFairTest, FairQueuesOfOneLevelShareIt) {
   Pool({{"minThreads", "2"}, {"maxThreads", "2"}});
   Ref<WorkQueue> a, b;
   pool->CreateFairWorkQueue(WorkQueueSpec("a", 5), a);
   pool->CreateFairWorkQueue(WorkQueueSpec("b", 5), b);
   constexpr int kItems = 2000;
   std::mutex mutex;
   std::vector<char> order;
   Gate gate;
   // Holds the level while both queues fill, so the order is the pool's, not the posting's.
   Ref<WorkQueue> holder;
   pool->CreateFairWorkQueue(WorkQueueSpec("holder", 5), holder);
   holder->Enqueue([&] { gate.Pass(); });
   WaitFor([&] { return gate.Waiting() == 1; }, "the holder to take the slot");
   for (int i = 0; i < kItems; ++i) {
      a->Enqueue([&] {
         std::lock_guard<std::mutex> lock(mutex);
         order.push_back('a');
      });
   }
   for (int i = 0; i < kItems; ++i) {
      b->Enqueue([&] {
         std::lock_guard<std::mutex> lock(mutex);
         order.push_back('b');
      });
   }
   gate.Open();
   WaitFor([&] {
      std::lock_guard<std::mutex> lock(mutex);
      return order.size() == 2 * kItems;
   }, "every item");
   int fromA = 0;
   for (int i = 0; i < kItems; ++i) fromA += order[i] == 'a';
   EXPECT_GT(fromA, kItems * 45 / 100);
   EXPECT_LT(fromA, kItems * 55 / 100);
   Finish();
}

// Lower levels fill every slot they may; the urgent level still finds a thread.
TEST_F(ThreadPoolFairTest, AnUrgentLevelRunsWhileLowerLevelsSaturateThePool) {
   Pool({{"minThreads", "1"}, {"maxThreads", "6"}});
   Ref<WorkQueue> urgent, low, lower;
   pool->CreateFairWorkQueue(WorkQueueSpec("urgent", 0), urgent);
   pool->CreateFairWorkQueue(WorkQueueSpec("low", 5), low);
   pool->CreateFairWorkQueue(WorkQueueSpec("lower", 15), lower);
   Gate gate;
   for (int i = 0; i < 10; ++i) {
      low->Enqueue([&] { gate.Pass(); });
      lower->Enqueue([&] { gate.Pass(); });
   }
   // Level 5 leaves at least 2 of 6 slots free; level 15 may take one of them only while
   // level 5 runs fewer than 3 (the reservation grows with every 3 running). So the lower
   // levels hold 3 or 4 slots, depending on which level a worker reached first.
   WaitFor([&] { return gate.Waiting() >= 3; }, "the lower levels to saturate");
   std::atomic<int> urgentDone{0};
   for (int i = 0; i < 50; ++i) urgent->Enqueue([&] { ++urgentDone; });
   WaitFor([&] { return urgentDone.load() == 50; }, "the urgent items");
   EXPECT_GE(gate.Waiting(), 3);
   EXPECT_LE(gate.Waiting(), 4);
   EXPECT_LE(pool->GetThreadCount(), 6);
   gate.Open();
   WaitFor([&] { return low->GetQueueSize() == 0 && lower->GetQueueSize() == 0; }, "the lower items");
   Finish();
}

// Busy workers make the pool grow up to maxThreads; once maxThreads is lowered the shrink
// timer retires one worker per tick.
TEST_F(ThreadPoolFairTest, GrowsUnderLoadAndShrinksOnTheTimer) {
   Pool({{"minThreads", "1"}, {"maxThreads", "8"}, {"ThreadCheckTimeSecs", "10"}}, 2000);
   Gate gate;
   for (int i = 0; i < 7; ++i) pool->ScheduleWorkItem([&] { gate.Pass(); });
   WaitFor([&] { return gate.Waiting() == 7; }, "seven blocked items");
   EXPECT_GE(pool->GetThreadCount(), 7);
   EXPECT_LE(pool->GetThreadCount(), 8);
   gate.Open();
   WaitFor([&] { return pool->GetLimits().busyCount.Read() == 0; }, "the items to end");
   int grown = pool->GetThreadCount();

   ThreadPoolConfig config;
   pool->GetConfig(config);
   config.maxThreads = 2;
   pool->SetConfig(config);
   std::atomic<bool> ran{false};
   pool->ScheduleWorkItem([&] { ran = true; });  // a handler re-arms the shrinking
   WaitFor([&] { return ran.load(); }, "the re-arming item");
   WaitFor([&] { return pool->GetThreadCount() == 2; }, "the pool to shrink to two threads");
   EXPECT_GT(grown, 2);
   std::this_thread::sleep_for(milliseconds(10));
   EXPECT_EQ(2, pool->GetThreadCount()) << "shrinking stops at maxThreads";
   Finish();
}

TEST_F(ThreadPoolFairTest, TimersFireOnceAndCancelledOnesNever) {
   Pool({{"minThreads", "2"}});
   std::atomic<int> fired{0}, cancelledFired{0}, late{0};
   Ref<ScheduledItem> once, cancelled, marker;
   pool->ScheduleTimer([&] { ++fired; }, 1000, once);
   pool->ScheduleTimer([&] { ++cancelledFired; }, 20000, cancelled);
   EXPECT_TRUE(cancelled->Cancel());
   EXPECT_FALSE(cancelled->Cancel());
   EXPECT_TRUE(cancelled->IsCancelled());
   pool->ScheduleTimer([&] { ++late; }, 40000, marker);
   WaitFor([&] { return late.load() == 1; }, "the marker timer");
   EXPECT_EQ(1, fired.load());
   EXPECT_EQ(0, cancelledFired.load());
   EXPECT_FALSE(once->Cancel()) << "already ran";
   EXPECT_FALSE(once->IsCancelled());
   Finish();
}

TEST_F(ThreadPoolFairTest, IOCompletionsGetACopyOfTheError) {
   Pool({{"minThreads", "1"}});
   std::mutex mutex;
   std::vector<std::pair<std::string, int>> calls;
   auto callback = [&](Exception* error, int bytes) {
      std::lock_guard<std::mutex> lock(mutex);
      calls.emplace_back(error ? std::string(typeid(*error).name()) + ":" + error->GetMessage() : "", bytes);
   };
   {
      TimeoutException error("read timed out");
      pool->ScheduleIOCompletion(&error, 0, callback);
   }
   pool->ScheduleIOCompletion(nullptr, 42, callback);
   WaitFor([&] {
      std::lock_guard<std::mutex> lock(mutex);
      return calls.size() == 2;
   }, "both completions");
   std::map<int, std::string> byBytes;
   for (auto& [text, bytes] : calls) byBytes[bytes] = text;
   EXPECT_EQ(std::string(typeid(TimeoutException).name()) + ":read timed out", byBytes[0]);
   EXPECT_EQ("", byBytes[42]);
   Finish();
}

TEST_F(ThreadPoolFairTest, CaughtItemExceptionsAreLoggedAtPanicLevel) {
   PoolLogCapture log;
   Pool({{"minThreads", "1"}, {"catchWorkItemExceptions", "true"}});
   EXPECT_TRUE(GetCatchWorkItemExceptions());
   Ref<WorkQueue> queue;
   pool->CreateSerialWorkQueue(WorkQueueSpec("throwing", 5), queue);
   std::atomic<bool> after{false};
   queue->Enqueue([] { throw InvalidArgumentException("bad thing"); });
   queue->Enqueue([] { throw std::runtime_error("std thing"); });
   queue->Enqueue([] { throw 7; });
   queue->Enqueue([&] { after = true; });
   WaitFor([&] { return after.load(); }, "the item after the throwing ones");
   SetCatchWorkItemExceptions(false);
   std::string text = log.Text();
   EXPECT_NE(std::string::npos, text.find("Worker: Unhandled exception:\nInvalid argument : bad thing"));
   EXPECT_NE(std::string::npos, text.find("Worker: Unhandled exception:\nSt13runtime_error, std thing"));
   EXPECT_NE(std::string::npos, text.find("Worker: Unhandled exception of unknown type"));
   Finish();
}

TEST_F(ThreadPoolFairTest, TheMainThreadRunsTheMainQueueAndOthersMayServe) {
   Pool({{"minThreads", "1"}});
   std::thread helper([&] { pool->ThreadRun(); });
   std::atomic<long long> mainId{0}, ranOn{0};
   std::atomic<WorkQueue*> current{nullptr};
   std::thread main([&] {
      mainId = GetThreadId();
      pool->MainThreadRun();
   });
   WaitFor([&] { return mainId.load() != 0; }, "the main thread");
   pool->ScheduleWorkItem([&] {
      pool->GetMainThreadWorkQueue()->Enqueue([&] {
         current = pool->GetCurrentWorkQueue();
         ranOn = GetThreadId();
      });
   });
   WaitFor([&] { return ranOn.load() != 0; }, "the main-thread item");
   EXPECT_EQ(mainId.load(), ranOn.load());
   EXPECT_EQ(pool->GetMainThreadWorkQueue(), current.load());
   pool->RequestShutdown();
   Testing::Join(main, "MainThreadRun to return at shutdown");
   Testing::Join(helper, "ThreadRun to return at shutdown");
   Finish();
}

// Items queued at shutdown are released unrun; none runs after WaitShutdown.
TEST_F(ThreadPoolFairTest, ShutdownReleasesQueuedItemsAndLeavesNoThread) {
   Pool({{"minThreads", "2"}});
   Ref<WorkQueue> queue;
   pool->CreateSerialWorkQueue(WorkQueueSpec("drain", 5), queue);
   std::atomic<int> living{0}, ran{0};
   Gate gate;
   queue->Enqueue([&] { gate.Pass(); });
   for (int i = 0; i < 500; ++i) {
      Ref<Tracked> tracked = new Tracked(&living);
      queue->Enqueue([&ran, tracked] { ++ran; });
   }
   Ref<ScheduledItem> timer;
   pool->ScheduleTimer([&] { ++ran; }, 60000000, timer);
   WaitFor([&] { return gate.Waiting() == 1; }, "the first item");
   pool->RequestShutdown();
   EXPECT_TRUE(pool->IsShuttingDown());
   gate.Open();
   EXPECT_TRUE(pool->WaitShutdown(10000000));
   EXPECT_EQ(0, pool->GetThreadCount());
   EXPECT_EQ(0, living.load()) << "queued items were not released";
   int ranAtShutdown = ran.load();
   EXPECT_EQ(0, ranAtShutdown);
   // Queues, default ones too, outlive the shutdown and drop what they are given.
   queue->Enqueue([&] { ++ran; });
   pool->ScheduleWorkItem([&] { ++ran; });
   pool->GetMainThreadWorkQueue()->Enqueue([&] { ++ran; });
   std::this_thread::sleep_for(milliseconds(5));
   EXPECT_EQ(ranAtShutdown, ran.load());
   pool.Reset();
   queue->Enqueue([&] { ++ran; });
   Finish();
}

TEST_F(ThreadPoolFairTest, StatsAndTheProcessPool) {
   Pool({{"minThreads", "1"}});
   Ref<WorkQueue> queue;
   pool->CreateFairWorkQueue(WorkQueueSpec("Stats", 5), queue);
   std::atomic<int> ran{0};
   for (int i = 0; i < 3; ++i) queue->Enqueue([&] { ++ran; });
   WaitFor([&] { return ran.load() == 3; }, "the items");
   WaitFor([&] {
      Ref<PerfCounter::LwStatsBuilder> builder;
      PerfCounter::CreateLwStatsBuilder(builder);
      pool->GetStats(*builder);
      long long completed = 0;
      builder->Push("ThreadPool");
      builder->Push("Pelmora");
      builder->Push("WorkQueue", "Stats");
      builder->GetTotalCount("TotalExecionCount", completed);
      return completed == 3;
   }, "the completed count");
   // The registry carries the queue's counters under their exact names until shutdown.
   auto registered = [](const std::string& name, long long* value) {
      std::vector<std::string> names{name};
      Ref<PerfCounter::Query> query;
      PerfCounter::GetCounterRegistry()->CreateNamesQuery(names, query);
      PerfCounter::QueryResults results;
      query->Execute(results);
      if (results.empty()) return false;
      if (value) *value = results[0].value.Get();
      return true;
   };
   long long completed = 0;
   EXPECT_TRUE(registered("/ThreadPool/Pelmora/WorkQueue/Stats/TotalExecionCount", &completed));
   EXPECT_EQ(3, completed);
   EXPECT_TRUE(registered("/ThreadPool/Pelmora/WorkQueue/Stats/currentConcurrency", nullptr));
   EXPECT_TRUE(registered("/ThreadPool/Pelmora/WorkQueue/DefaultIOQueue/QueueSize", nullptr));
   EXPECT_EQ(nullptr, GetThreadPool()) << "a new pool is not the process's pool";
   SetThreadPool(pool.Get());
   EXPECT_EQ(pool.Get(), GetThreadPool());
   SetThreadPool(nullptr);
   EXPECT_NE(std::string::npos, queue->ToString().find("WorkQueue.Stats, type = fair, priority = 5 , itemWeight = 1"));
   Finish();
   EXPECT_FALSE(registered("/ThreadPool/Pelmora/WorkQueue/Stats/QueueSize", nullptr));
}

}  // namespace
}  // namespace Pelmora::System
