// The configuration lock lets a waiting writer in before readers that come after it.

#include <atomic>
#include <chrono>
#include <thread>

#include <gtest/gtest.h>

#include "src/config/configLock.h"
#include "tests/support/watchdog.h"

using Pelmora::Service::ConfigLock;

TEST(ConfigLockTest, AWaitingWriterHoldsBackNewReaders) {
   ConfigLock lock;
   lock.lock_shared();
   std::atomic<bool> written{false};
   std::thread writer([&] {
      lock.lock();
      written = true;
      lock.unlock();
   });
   // Once the writer waits, a new reader must not get in ahead of it.
   bool heldBack = false;
   auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
   while (!heldBack && std::chrono::steady_clock::now() < deadline) {
      if (lock.try_lock_shared()) {
         lock.unlock_shared();
         std::this_thread::yield();
      } else {
         heldBack = true;
      }
   }
   EXPECT_TRUE(heldBack) << "a reader got in while a writer waited";
   EXPECT_FALSE(written.load());
   lock.unlock_shared();
   Pelmora::Testing::Join(writer, "writer to finish");
   EXPECT_TRUE(written.load());
   EXPECT_TRUE(lock.try_lock_shared());
   lock.unlock_shared();
}
