// The fair pool against boost::asio::thread_pool and a plain io_context run by two
// threads: posting throughput through one fair queue, the hop between two queues, the
// round trip into an idle pool, and how much the most urgent level gets done while three
// lower levels saturate the pool.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <mutex>
#include <thread>
#include <vector>

#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/thread_pool.hpp>

#include "pelmora/pelmora.h"
#include "pelmora/service.h"
#include "pelmora/system.h"
#include "support/ratioMain.h"

using namespace Pelmora;
using namespace Pelmora::System;

namespace {

constexpr int kPostItems = 1000000;
constexpr int kHops = 20000;

// Counts completions; Wait returns once `target` were counted.
class Countdown {
public:
   void Reset(long long target) {
      std::lock_guard<std::mutex> lock(_mutex);
      _target = target;
      _count.store(0);
   }
   void Done() {
      if (_count.fetch_add(1, std::memory_order_acq_rel) + 1 == _target) {
         std::lock_guard<std::mutex> lock(_mutex);
         _reached.notify_all();
      }
   }
   void Wait() {
      std::unique_lock<std::mutex> lock(_mutex);
      _reached.wait(lock, [this] { return _count.load() >= _target; });
   }

private:
   std::mutex _mutex;
   std::condition_variable _reached;
   std::atomic<long long> _count{0};
   long long _target = 0;
};

// Pools with two workers: the most urgent level of a pool of 3 slots runs 2 items at once.
Ref<ThreadPool> MakePool(int minThreads, int maxThreads) {
   Ref<Service::Config> config;
   Service::CreateScratchConfig(config);
   Ref<Service::Config::View> view;
   config->GetMainView(view);
   view->Set("minThreads", minThreads);
   view->Set("maxThreads", maxThreads);
   Ref<ThreadPool> pool;
   CreateThreadPool(view.Get(), pool);
   return pool;
}

void Shut(ThreadPool* pool) {
   pool->RequestShutdown();
   pool->WaitShutdown(-1);
}

// An io_context served by two threads until destroyed.
struct TwoThreadIoContext {
   TwoThreadIoContext() : guard(boost::asio::make_work_guard(io)) {
      for (int i = 0; i < 2; ++i) threads.emplace_back([this] { io.run(); });
   }
   ~TwoThreadIoContext() {
      guard.reset();
      io.stop();
      for (std::thread& thread : threads) thread.join();
   }
   boost::asio::io_context io;
   boost::asio::executor_work_guard<boost::asio::io_context::executor_type> guard;
   std::vector<std::thread> threads;
};

void BM_PoolPostFairQueue(benchmark::State& state) {
   Ref<ThreadPool> pool = MakePool(2, 3);
   Ref<WorkQueue> queue;
   pool->CreateFairWorkQueue(WorkQueueSpec("Bench", 5), queue);
   Countdown countdown;
   for (auto _ : state) {
      countdown.Reset(kPostItems);
      for (int i = 0; i < kPostItems; ++i) queue->Enqueue([&countdown] { countdown.Done(); });
      countdown.Wait();
   }
   state.SetItemsProcessed(state.iterations() * kPostItems);
   Shut(pool.Get());
}
BENCHMARK(BM_PoolPostFairQueue)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(3);

void BM_AsioThreadPoolPost(benchmark::State& state) {
   boost::asio::thread_pool pool(2);
   Countdown countdown;
   for (auto _ : state) {
      countdown.Reset(kPostItems);
      for (int i = 0; i < kPostItems; ++i) boost::asio::post(pool, [&countdown] { countdown.Done(); });
      countdown.Wait();
   }
   state.SetItemsProcessed(state.iterations() * kPostItems);
   pool.join();
}
BENCHMARK(BM_AsioThreadPoolPost)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(3);

void BM_IoContextPost(benchmark::State& state) {
   TwoThreadIoContext context;
   Countdown countdown;
   for (auto _ : state) {
      countdown.Reset(kPostItems);
      for (int i = 0; i < kPostItems; ++i) boost::asio::post(context.io, [&countdown] { countdown.Done(); });
      countdown.Wait();
   }
   state.SetItemsProcessed(state.iterations() * kPostItems);
}
BENCHMARK(BM_IoContextPost)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(3);

// One iteration is kHops items, each posting the next to the other queue.
void BM_PoolHopBetweenQueues(benchmark::State& state) {
   Ref<ThreadPool> pool = MakePool(2, 3);
   Ref<WorkQueue> a, b;
   pool->CreateSerialWorkQueue(WorkQueueSpec("Ping", 5), a);
   pool->CreateSerialWorkQueue(WorkQueueSpec("Pong", 5), b);
   Countdown countdown;
   std::function<void(int)> hop = [&](int left) {
      if (left == 0) {
         countdown.Done();
         return;
      }
      WorkQueue* next = left % 2 ? a.Get() : b.Get();
      next->Enqueue([&hop, left] { hop(left - 1); });
   };
   for (auto _ : state) {
      countdown.Reset(1);
      hop(kHops);
      countdown.Wait();
   }
   state.counters["ns_per_hop"] = benchmark::Counter(
       static_cast<double>(state.iterations()) * kHops,
       benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
   Shut(pool.Get());
}
BENCHMARK(BM_PoolHopBetweenQueues)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(5);

void BM_IoContextHop(benchmark::State& state) {
   TwoThreadIoContext context;
   Countdown countdown;
   std::function<void(int)> hop = [&](int left) {
      if (left == 0) {
         countdown.Done();
         return;
      }
      boost::asio::post(context.io, [&hop, left] { hop(left - 1); });
   };
   for (auto _ : state) {
      countdown.Reset(1);
      hop(kHops);
      countdown.Wait();
   }
   state.counters["ns_per_hop"] = benchmark::Counter(
       static_cast<double>(state.iterations()) * kHops,
       benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(BM_IoContextHop)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(5);

// From this thread into an idle pool and back.
void BM_PoolRoundTripIdle(benchmark::State& state) {
   Ref<ThreadPool> pool = MakePool(2, 3);
   Countdown countdown;
   for (auto _ : state) {
      countdown.Reset(1);
      pool->ScheduleWorkItem([&countdown] { countdown.Done(); });
      countdown.Wait();
   }
   Shut(pool.Get());
}
BENCHMARK(BM_PoolRoundTripIdle)->Unit(benchmark::kMicrosecond)->UseRealTime();

void BM_AsioThreadPoolRoundTripIdle(benchmark::State& state) {
   boost::asio::thread_pool pool(2);
   Countdown countdown;
   for (auto _ : state) {
      countdown.Reset(1);
      boost::asio::post(pool, [&countdown] { countdown.Done(); });
      countdown.Wait();
   }
   pool.join();
}
BENCHMARK(BM_AsioThreadPoolRoundTripIdle)->Unit(benchmark::kMicrosecond)->UseRealTime();

void BM_IoContextRoundTripIdle(benchmark::State& state) {
   TwoThreadIoContext context;
   Countdown countdown;
   for (auto _ : state) {
      countdown.Reset(1);
      boost::asio::post(context.io, [&countdown] { countdown.Done(); });
      countdown.Wait();
   }
}
BENCHMARK(BM_IoContextRoundTripIdle)->Unit(benchmark::kMicrosecond)->UseRealTime();

void Spin(std::chrono::microseconds length) {
   auto end = std::chrono::steady_clock::now() + length;
   while (std::chrono::steady_clock::now() < end) {
   }
}

constexpr int kBackgroundItems = 4000;  // per lower level, 50 us each
constexpr int kUrgentItems = 20000;

// Three lower levels keep every slot they may busy; the urgent level's items are
// measured while they do. The peer has no levels: its urgent items wait in line.
void BM_PoolUrgentWhileSaturated(benchmark::State& state) {
   Ref<ThreadPool> pool = MakePool(2, 8);
   Ref<WorkQueue> urgent, levels[3];
   pool->CreateFairWorkQueue(WorkQueueSpec("Urgent", 0), urgent);
   for (int i = 0; i < 3; ++i) pool->CreateFairWorkQueue(WorkQueueSpec("Level" + std::to_string(i), 5 + 5 * i), levels[i]);
   Countdown urgentDone, backgroundDone;
   double urgentPerSecond = 0;
   for (auto _ : state) {
      backgroundDone.Reset(3 * kBackgroundItems);
      urgentDone.Reset(kUrgentItems);
      for (int i = 0; i < kBackgroundItems; ++i) {
         for (auto& level : levels) level->Enqueue([&] {
            Spin(std::chrono::microseconds(50));
            backgroundDone.Done();
         });
      }
      auto start = std::chrono::steady_clock::now();
      for (int i = 0; i < kUrgentItems; ++i) urgent->Enqueue([&] { urgentDone.Done(); });
      urgentDone.Wait();
      double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
      urgentPerSecond = kUrgentItems / seconds;
      backgroundDone.Wait();
   }
   state.counters["urgent_per_s"] = urgentPerSecond;
   Shut(pool.Get());
}
BENCHMARK(BM_PoolUrgentWhileSaturated)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(3);

void BM_AsioThreadPoolUrgentWhileSaturated(benchmark::State& state) {
   boost::asio::thread_pool pool(2);
   Countdown urgentDone, backgroundDone;
   double urgentPerSecond = 0;
   for (auto _ : state) {
      backgroundDone.Reset(3 * kBackgroundItems);
      urgentDone.Reset(kUrgentItems);
      for (int i = 0; i < 3 * kBackgroundItems; ++i) {
         boost::asio::post(pool, [&] {
            Spin(std::chrono::microseconds(50));
            backgroundDone.Done();
         });
      }
      auto start = std::chrono::steady_clock::now();
      for (int i = 0; i < kUrgentItems; ++i) boost::asio::post(pool, [&] { urgentDone.Done(); });
      urgentDone.Wait();
      double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
      urgentPerSecond = kUrgentItems / seconds;
      backgroundDone.Wait();
   }
   state.counters["urgent_per_s"] = urgentPerSecond;
   pool.join();
}
BENCHMARK(BM_AsioThreadPoolUrgentWhileSaturated)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(3);

}  // namespace

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(
       argc, argv,
       {{"BM_PoolPostFairQueue/iterations:3/real_time", "BM_IoContextPost/iterations:3/real_time"},
        {"BM_PoolPostFairQueue/iterations:3/real_time", "BM_AsioThreadPoolPost/iterations:3/real_time"},
        {"BM_PoolHopBetweenQueues/iterations:5/real_time", "BM_IoContextHop/iterations:5/real_time"},
        {"BM_PoolRoundTripIdle/real_time", "BM_IoContextRoundTripIdle/real_time"},
        {"BM_PoolRoundTripIdle/real_time", "BM_AsioThreadPoolRoundTripIdle/real_time"},
        {"BM_PoolUrgentWhileSaturated/iterations:3/real_time",
         "BM_AsioThreadPoolUrgentWhileSaturated/iterations:3/real_time"}});
}
