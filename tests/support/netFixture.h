#pragma once
// Shared pieces of the stream tests: one thread pool for the whole test binary (streams
// complete on the process's pool), a capture of the default logger's lines, bounded
// waiting and a completion latch.

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

#include "pelmora/service.h"
#include "pelmora/system.h"
#include "tests/support/defaultLogCapture.h"

namespace Pelmora::System::NetTesting {

// The process's pool, made on first use and kept until exit.
inline ThreadPool* EnsurePool() {
   static ThreadPool* pool = [] {
      Ref<ThreadPool> made;
      CreateThreadPool(nullptr, made);
      SetThreadPool(made.Get());
      return made.Get();
   }();
   return pool;
}

// Keeps the default logger's lines while it lives.
class DefaultLogCapture : public TestSupport::DefaultLogCapture {
public:
   DefaultLogCapture() : TestSupport::DefaultLogCapture("netTest") {}
};

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

// Remembers one completion: its failure text (empty on success) and byte count.
class Completion {
public:
   void Done(Exception* error, int bytes) {
      std::lock_guard<std::mutex> lock(_mutex);
      _error = error != nullptr ? error->GetMessage() : "";
      _failed = error != nullptr;
      _bytes = bytes;
      ++_count;
      _cv.notify_all();
   }
   // Waits up to 10 s for the `n`th completion; false on time-out.
   bool WaitCount(int n) {
      std::unique_lock<std::mutex> lock(_mutex);
      return _cv.wait_for(lock, std::chrono::seconds(10), [&] { return _count >= n; });
   }
   int Count() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _count;
   }
   int Bytes() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _bytes;
   }
   bool Failed() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _failed;
   }
   std::string Error() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _error;
   }

private:
   std::mutex _mutex;
   std::condition_variable _cv;
   std::string _error;
   bool _failed = false;
   int _bytes = -1;
   int _count = 0;
};

}  // namespace Pelmora::System::NetTesting
