#pragma once
// Shared pieces of the pool tests: pools built from a few settings, a thread control
// that can hold new threads back (so a test drives GetNextItem itself), a capture of the
// pool's log lines and bounded waiting.

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/service.h"
#include "pelmora/system.h"
#include "src/pool/threadPoolFair.h"
#include "tests/support/defaultLogCapture.h"

namespace Pelmora::System::PoolTesting {

// Forwards to the platform's thread control; with `startThreads` false, new threads are
// held back until StartHeld.
class TestThreadControl : public virtual ThreadControl, public ObjectImpl {
public:
   explicit TestThreadControl(bool startThreads) : _startThreads(startThreads) {
      GetSystemFactory()->CreateThreadControl(_real);
   }
   bool HasIoThreadAffinity() override { return false; }
   void StartThread(const ThreadFunction& function, long long stackSizeKb, Ref<Thread>& out) override {
      ++started;
      lastStackSizeKb = stackSizeKb;
      std::lock_guard<std::mutex> lock(_mutex);
      if (_startThreads) {
         _real->StartThread(function, stackSizeKb, out);
      } else {
         _held.push_back(function);
      }
   }
   // Starts the held threads and every later one.
   void StartHeld() {
      std::lock_guard<std::mutex> lock(_mutex);
      _startThreads = true;
      for (const ThreadFunction& function : _held) {
         Ref<Thread> thread;
         _real->StartThread(function, 256, thread);
      }
      _held.clear();
   }
   void InitializeThisThread() override {}
   void UninitializeThisThread() override {}
   void SetThreadName(const std::string& name) override { _real->SetThreadName(name); }
   int GetMaxPollables() override { return maxPollables; }
   void CreatePollableSignalPair(int& readFd, int& writeFd) override {
      _real->CreatePollableSignalPair(readFd, writeFd);
   }
   void SetPollableSignal(int writeFd) override { _real->SetPollableSignal(writeFd); }
   void ResetPollableSignal(int readFd) override { _real->ResetPollableSignal(readFd); }
   void DoPoll(const std::vector<std::pair<int, POLL_EVENT>>& pollables,
               std::vector<int>& readyIndices) override {
      _real->DoPoll(pollables, readyIndices);
   }
   void OnThreadPoolStartup(int maxFdsPerThread) override { startupFds = maxFdsPerThread; }
   void OnThreadPoolShutdown() override { ++shutdowns; }
   int CheckDescriptors(int threadCount) override { return _real->CheckDescriptors(threadCount); }

   std::atomic<int> started{0};
   std::atomic<long long> lastStackSizeKb{0};
   std::atomic<int> startupFds{-1};
   std::atomic<int> shutdowns{0};
   int maxPollables = 8192;

private:
   std::mutex _mutex;
   bool _startThreads;
   std::vector<ThreadFunction> _held;
   Ref<ThreadControl> _real;
};

// Keeps the lines of the pool's loggers. Installed on the default output for its life.
class PoolLogCapture : public TestSupport::DefaultLogCapture {
public:
   PoolLogCapture() : TestSupport::DefaultLogCapture("poolTest") {
      for (const char* name : kLoggers) Service::GetDefaultLogManager()->SetLevel(name, "trivia", "none");
   }
   ~PoolLogCapture() {
      for (const char* name : kLoggers) Service::GetDefaultLogManager()->SetLevel(name, "info", "none");
   }

private:
   static constexpr const char* kLoggers[] = {"ThreadPool", "PriorityInfo.0", "PriorityInfo.5",
                                              "PriorityInfo.10"};
};

using Settings = std::map<std::string, std::string>;

inline void MakeView(const Settings& settings, Ref<Service::Config::View>& out) {
   Ref<Service::Config> config;
   Service::CreateScratchConfig(config);
   config->GetMainView(out);
   for (const auto& [key, value] : settings) out->Set(key, value);
}

// A started pool on `control`; the shrink timer ticks every `shrinkPeriod` microseconds.
inline Ref<ThreadPoolFair> MakePool(const Settings& settings, ThreadControl* control,
                                    long long shrinkPeriod = ThreadPoolFair::kShrinkPeriodMicroseconds) {
   Ref<Service::Config::View> view;
   MakeView(settings, view);
   Ref<ThreadPoolFair> pool = new ThreadPoolFair(view.Get(), control, shrinkPeriod);
   pool->Start();
   return pool;
}

// Polls `condition` every millisecond; fails the test naming `what` after `limit`.
inline bool WaitFor(const std::function<bool()>& condition, const std::string& what,
                    std::chrono::milliseconds limit = std::chrono::milliseconds(10000)) {
   auto deadline = std::chrono::steady_clock::now() + limit;
   while (!condition()) {
      if (std::chrono::steady_clock::now() > deadline) {
         ADD_FAILURE() << "timed out waiting for " << what;
         return false;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
   }
   return true;
}

// Shuts `pool` down and checks that every thread left.
inline void ShutDown(ThreadPool* pool) {
   pool->RequestShutdown();
   EXPECT_TRUE(pool->WaitShutdown(10000000)) << "pool threads did not leave";
}

// A test on a pool whose threads start at once. Tests call Finish before their locals,
// which items may still use, go away; the destructor catches the rest.
class PoolTest : public testing::Test {
protected:
   ~PoolTest() override { Finish(); }
   Ref<ThreadPoolFair> Pool(const Settings& settings,
                            long long shrinkPeriod = ThreadPoolFair::kShrinkPeriodMicroseconds) {
      pool = MakePool(settings, control.Get(), shrinkPeriod);
      return pool;
   }
   void Finish() {
      if (pool) ShutDown(pool.Get());
      pool.Reset();
   }

   Ref<TestThreadControl> control{new TestThreadControl(true)};
   Ref<ThreadPoolFair> pool;
};

}  // namespace Pelmora::System::PoolTesting
