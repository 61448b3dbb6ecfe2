#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/system.h"

namespace Pelmora::System {
namespace {

Ref<RWLock> NewRWLock(int mode = RWLockableObject::LOCK_MODE_DEFAULT) {
   Ref<RWLock> lock;
   GetSystemFactory()->CreateRWLock(mode, lock);
   return lock;
}

void SleepMillis(int milliseconds) {
   std::this_thread::sleep_for(std::chrono::milliseconds(milliseconds));
}

TEST(RWLockTest, HoldsAreTrackedPerThread) {
   Ref<RWLock> lock = NewRWLock();
   EXPECT_TRUE(lock->IsUnlocked());
   lock->ReadLock();
   lock->ReadLock();
   EXPECT_TRUE(lock->IsReadLocked());
   EXPECT_FALSE(lock->IsWriteLocked());
   std::thread([&] {
      EXPECT_TRUE(lock->IsUnlocked());
      lock->ReadLock();  // readers share
      EXPECT_TRUE(lock->IsReadLocked());
      lock->Unlock();
      EXPECT_TRUE(lock->IsUnlocked());
   }).join();
   lock->Unlock();
   EXPECT_TRUE(lock->IsReadLocked());
   lock->Unlock();
   EXPECT_TRUE(lock->IsUnlocked());

   lock->WriteLock();
   EXPECT_TRUE(lock->IsWriteLocked());
   EXPECT_FALSE(lock->IsReadLocked());
   std::thread([&] { EXPECT_TRUE(lock->IsUnlocked()); }).join();
   lock->Unlock();
   EXPECT_TRUE(lock->IsUnlocked());
}

TEST(RWLockTest, UpgradeAndDowngradeMoveBetweenReadAndWrite) {
   Ref<RWLock> lock = NewRWLock();
   lock->ReadLock();
   EXPECT_TRUE(lock->UpgradeReadLock());
   EXPECT_TRUE(lock->IsWriteLocked());
   lock->DowngradeWriteLock();
   EXPECT_TRUE(lock->IsReadLocked());
   // After the downgrade other readers come in again, writers still wait.
   std::atomic<bool> written{false};
   std::thread reader([&] {
      lock->ReadLock();
      lock->Unlock();
   });
   reader.join();
   std::thread writer([&] {
      lock->WriteLock();
      written = true;
      lock->Unlock();
   });
   SleepMillis(2);
   EXPECT_FALSE(written);
   lock->Unlock();
   writer.join();
   EXPECT_TRUE(written);
   EXPECT_TRUE(lock->IsUnlocked());
}

// Whichever of two readers asks second gets false at once and lets the first through by
// giving up its read hold.
TEST(RWLockTest, OfTwoConcurrentUpgradersOneGetsFalseAtOnce) {
   Ref<RWLock> lock = NewRWLock();
   std::atomic<int> holding{0};
   std::atomic<int> upgraded{0};
   std::atomic<int> refused{0};
   auto reader = [&] {
      lock->ReadLock();
      ++holding;
      while (holding < 2) std::this_thread::yield();
      if (lock->UpgradeReadLock()) {
         EXPECT_TRUE(lock->IsWriteLocked());
         ++upgraded;
      } else {
         EXPECT_TRUE(lock->IsReadLocked());
         ++refused;
      }
      lock->Unlock();
   };
   std::thread a(reader), b(reader);
   a.join();
   b.join();
   EXPECT_EQ(1, upgraded);
   EXPECT_EQ(1, refused);
}

// A reader holding the lock while a writer waits: a new reader waits behind the writer in
// writer-priority modes (1 and 2 alike) and goes first otherwise; the holder itself may
// always read-lock again, or it would deadlock with the writer.
class RWLockModeTest : public testing::TestWithParam<int> {};

TEST_P(RWLockModeTest, AReaderRelocksWhileAWriterWaits) {
   const bool writerPriority = GetParam() != RWLockableObject::LOCK_MODE_DEFAULT;
   Ref<RWLock> lock = NewRWLock(GetParam());
   std::mutex orderMutex;
   std::string order;
   auto record = [&](char who) {
      std::lock_guard<std::mutex> guard(orderMutex);
      order += who;
   };
   auto recorded = [&] {
      std::lock_guard<std::mutex> guard(orderMutex);
      return order;
   };
   std::atomic<bool> writerStarting{false};
   std::atomic<bool> readerStarting{false};
   lock->ReadLock();
   std::thread writer([&] {
      writerStarting = true;
      lock->WriteLock();
      record('W');
      lock->Unlock();
   });
   while (!writerStarting) std::this_thread::yield();
   SleepMillis(3);  // the writer is waiting now
   std::thread reader([&] {
      readerStarting = true;
      lock->ReadLock();
      record('R');
      lock->Unlock();
   });
   if (writerPriority) {
      while (!readerStarting) std::this_thread::yield();
      SleepMillis(3);
      EXPECT_EQ("", recorded());  // held back behind the writer
   } else {
      while (recorded().empty()) std::this_thread::yield();
   }
   lock->ReadLock();
   EXPECT_TRUE(lock->IsReadLocked());
   lock->Unlock();
   lock->Unlock();
   writer.join();
   reader.join();
   EXPECT_EQ(writerPriority ? "WR" : "RW", order);
}

INSTANTIATE_TEST_SUITE_P(Modes, RWLockModeTest,
                         testing::Values(RWLockableObject::LOCK_MODE_DEFAULT,
                                         RWLockableObject::LOCK_MODE_WRITER_PRIORITY,
                                         RWLockableObject::LOCK_MODE_WRITER_PRIORITY_LEGACY));

TEST(RWLockTest, WritersExcludeEveryoneUnderLoad) {
   for (int mode : {0, 1}) {
      Ref<RWLock> lock = NewRWLock(mode);
      std::atomic<int> readers{0};
      std::atomic<int> writers{0};
      std::atomic<bool> broken{false};
      long value = 0;
      auto work = [&](int id) {
         for (int i = 0; i < 2000; ++i) {
            if ((i + id) % 4 == 0) {
               lock->WriteLock();
               if (++writers != 1 || readers != 0) broken = true;
               ++value;
               --writers;
               lock->Unlock();
            } else if ((i + id) % 4 == 1) {
               lock->ReadLock();
               if (lock->UpgradeReadLock()) {
                  if (++writers != 1 || readers != 0) broken = true;
                  ++value;
                  --writers;
                  lock->DowngradeWriteLock();
               }
               lock->Unlock();
            } else {
               lock->ReadLock();
               ++readers;
               if (writers != 0) broken = true;
               lock->ReadLock();
               --readers;
               lock->Unlock();
               lock->Unlock();
            }
         }
      };
      std::vector<std::thread> threads;
      for (int id = 0; id < 4; ++id) threads.emplace_back(work, id);
      for (std::thread& t : threads) t.join();
      EXPECT_FALSE(broken);
      EXPECT_GE(value, 2000);
      EXPECT_TRUE(lock->IsUnlocked());
   }
}

// Many holds at once by one thread, released in a scrambled order: each lock keeps its own
// count however the per-thread bookkeeping grows and shrinks.
TEST(RWLockTest, ManyHoldsOfOneThreadStayApart) {
   constexpr int kLocks = 100;
   std::vector<Ref<RWLock>> locks;
   for (int i = 0; i < kLocks; ++i) {
      locks.push_back(NewRWLock());
      locks[i]->ReadLock();
      if (i % 3 == 0) locks[i]->ReadLock();
   }
   std::vector<bool> held(kLocks, true);
   for (int step = 0; step < kLocks; ++step) {
      int i = (step * 37) % kLocks;
      if (i % 3 == 0) locks[i]->Unlock();
      ASSERT_TRUE(locks[i]->IsReadLocked()) << i;
      locks[i]->Unlock();
      held[i] = false;
      for (int k = 0; k < kLocks; ++k)
         ASSERT_EQ(held[k], locks[k]->IsReadLocked()) << step << " " << k;
   }
   locks[5]->WriteLock();
   EXPECT_TRUE(locks[5]->IsWriteLocked());
   locks[5]->Unlock();
}

TEST(RWLockableObjectTest, ForwardsToItsLock) {
   Ref<RWLockableObjectImpl> object = new RWLockableObjectImpl();
   object->ReadLock();
   EXPECT_TRUE(object->GetRWLock()->IsReadLocked());
   EXPECT_TRUE(object->UpgradeReadLock());
   EXPECT_TRUE(object->IsWriteLocked());
   object->DowngradeWriteLock();
   EXPECT_TRUE(object->IsReadLocked());
   object->Unlock();
   EXPECT_TRUE(object->IsUnlocked());
   Ref<RWLockableObjectImpl> sharing = new RWLockableObjectImpl(object->GetRWLock());
   sharing->WriteLock();
   EXPECT_TRUE(object->IsWriteLocked());
   sharing->Unlock();
}

TEST(RWLockDeathTest, MisusePanics) {
   Ref<RWLock> lock = NewRWLock();
   const char* where = "\" @ src/system/rwLock.cpp:[0-9]+\n";
   auto text = [&](const char* expression) {
      return std::string("Assert Failed: \"") + expression + where;
   };
   EXPECT_DEATH(
       {
          lock->WriteLock();
          lock->WriteLock();
       },
       text("locks.find\\(this\\) == locks.end\\(\\)"));
   EXPECT_DEATH(
       {
          lock->ReadLock();
          lock->WriteLock();
       },
       text("locks.find\\(this\\) == locks.end\\(\\)"));
   EXPECT_DEATH(
       {
          lock->WriteLock();
          lock->ReadLock();
       },
       text("_status > 0"));
   EXPECT_DEATH(lock->Unlock(), text("it != locks.end\\(\\)"));
   EXPECT_DEATH(lock->UpgradeReadLock(), text("it != locks.end\\(\\) && it->second == 1"));
   EXPECT_DEATH(
       {
          lock->ReadLock();
          lock->ReadLock();
          lock->UpgradeReadLock();
       },
       text("it != locks.end\\(\\) && it->second == 1"));
   EXPECT_DEATH(
       {
          lock->ReadLock();
          lock->DowngradeWriteLock();
       },
       text("it != locks.end\\(\\) && it->second == -1"));
}

}  // namespace
}  // namespace Pelmora::System
