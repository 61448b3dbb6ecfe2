#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/system.h"
#include "src/system/systemImpl.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

Ref<RWLock> NewRWLock(int mode = RWLockableObject::LOCK_MODE_DEFAULT) {
   Ref<RWLock> lock;
   GetSystemFactory()->CreateRWLock(mode, lock);
   return lock;
}

// Returns once a writer waits for `lock`: a sleep would only make that likely.
void AwaitWaitingWriter(RWLock* lock) {
   Pelmora::Testing::Watchdog watchdog("a writer to wait for the lock");
   while (CountWaitingWriters(lock) == 0) std::this_thread::yield();
}

// Each thread sees only its own holds (counts are tested below); readers share.
TEST(RWLockTest, HoldsAreTrackedPerThread) {
   Ref<RWLock> lock = NewRWLock();
   lock->ReadLock();
   EXPECT_TRUE(lock->IsReadLocked());
   EXPECT_FALSE(lock->IsWriteLocked());
   std::thread([&] {
      EXPECT_TRUE(lock->IsUnlocked());
      lock->ReadLock();
      EXPECT_TRUE(lock->IsReadLocked());
      lock->Unlock();
   }).join();
   lock->Unlock();
   EXPECT_TRUE(lock->IsUnlocked());
   lock->WriteLock();
   EXPECT_TRUE(lock->IsWriteLocked());
   EXPECT_FALSE(lock->IsReadLocked());
   std::thread([&] { EXPECT_TRUE(lock->IsUnlocked()); }).join();
   lock->Unlock();
}

// Through a lockable object sharing the lock: after the downgrade other readers come in
// again, writers still wait.
TEST(RWLockTest, UpgradeAndDowngradeMoveBetweenReadAndWrite) {
   Ref<RWLockableObjectImpl> object = new RWLockableObjectImpl();
   Ref<RWLockableObjectImpl> lock = new RWLockableObjectImpl(object->GetRWLock());
   lock->ReadLock();
   EXPECT_TRUE(lock->UpgradeReadLock());
   EXPECT_TRUE(object->IsWriteLocked());
   lock->DowngradeWriteLock();
   EXPECT_TRUE(object->GetRWLock()->IsReadLocked());
   std::atomic<bool> written{false};
   std::thread([&] {
      lock->ReadLock();
      lock->Unlock();
   }).join();
   std::thread writer([&] {
      lock->WriteLock();
      written = true;
      lock->Unlock();
   });
   AwaitWaitingWriter(object->GetRWLock());
   EXPECT_FALSE(written);
   lock->Unlock();
   Pelmora::Testing::Join(writer, "writer to finish");
   EXPECT_TRUE(written);
   EXPECT_TRUE(object->IsUnlocked());
}

// Whichever of two readers asks second gets false at once and lets the first through by
// giving up its read hold.
TEST(RWLockTest, OfTwoConcurrentUpgradersOneGetsFalseAtOnce) {
   Ref<RWLock> lock = NewRWLock();
   std::atomic<int> holding{0}, upgraded{0}, refused{0};
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
   Pelmora::Testing::Join(a, "a to finish");
   Pelmora::Testing::Join(b, "b to finish");
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
   std::atomic<char> first{0};
   auto record = [&](char who) {
      char none = 0;
      first.compare_exchange_strong(none, who);
   };
   std::atomic<bool> readerStarting{false};
   lock->ReadLock();
   std::thread writer([&] {
      lock->WriteLock();
      record('W');
      lock->Unlock();
   });
   AwaitWaitingWriter(lock.Get());
   std::thread reader([&] {
      readerStarting = true;
      lock->ReadLock();
      record('R');
      lock->Unlock();
   });
   if (writerPriority) {
      while (!readerStarting) std::this_thread::yield();
      // Time for the reader to get in if it wrongly could.
      std::this_thread::sleep_for(std::chrono::milliseconds(3));
      EXPECT_EQ(0, first.load());  // held back behind the writer
   } else {
      while (first == 0) std::this_thread::yield();
   }
   lock->ReadLock();
   EXPECT_TRUE(lock->IsReadLocked());
   lock->Unlock();
   lock->Unlock();
   Pelmora::Testing::Join(writer, "writer to finish");
   Pelmora::Testing::Join(reader, "reader to finish");
   EXPECT_EQ(writerPriority ? 'W' : 'R', first.load());
}

INSTANTIATE_TEST_SUITE_P(Modes, RWLockModeTest,
                         testing::Values(RWLockableObject::LOCK_MODE_DEFAULT,
                                         RWLockableObject::LOCK_MODE_WRITER_PRIORITY,
                                         RWLockableObject::LOCK_MODE_WRITER_PRIORITY_LEGACY));

TEST(RWLockTest, WritersExcludeEveryoneUnderLoad) {
   for (int mode : {0, 1}) {
      Ref<RWLock> lock = NewRWLock(mode);
      std::atomic<int> readers{0}, writers{0};
      std::atomic<bool> broken{false};
      long value = 0;
      auto write = [&] {
         if (++writers != 1 || readers != 0) broken = true;
         ++value;
         --writers;
      };
      auto work = [&](int id) {
         for (int i = 0; i < 2000; ++i) {
            if ((i + id) % 4 == 0) {
               lock->WriteLock();
               write();
            } else if ((i + id) % 4 == 1) {
               lock->ReadLock();
               if (lock->UpgradeReadLock()) {
                  write();
                  lock->DowngradeWriteLock();
               }
            } else {
               lock->ReadLock();
               ++readers;
               if (writers != 0) broken = true;
               lock->ReadLock();
               --readers;
               lock->Unlock();
            }
            lock->Unlock();
         }
      };
      std::vector<std::thread> threads;
      for (int id = 0; id < 4; ++id) threads.emplace_back(work, id);
      Pelmora::Testing::JoinAll(threads, "threads to finish");
      EXPECT_FALSE(broken);
      EXPECT_GE(value, 2000);
      EXPECT_TRUE(lock->IsUnlocked());
   }
}

// Many holds of one thread, some taken twice, released in a scrambled order: each lock keeps
// its own count however the per-thread bookkeeping grows and shrinks.
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

TEST(RWLockDeathTest, MisusePanics) {
   Ref<RWLock> lock = NewRWLock();
   auto text = [](const char* expression) {
      return std::string("Assert Failed: \"") + expression +
             "\" @ src/system/rwLock.cpp:[0-9]+\n";
   };
   const std::string noHold = text("locks.find\\(this\\) == locks.end\\(\\)");
   const std::string oneRead = text("it != locks.end\\(\\) && it->second == 1");
   EXPECT_DEATH((lock->WriteLock(), lock->WriteLock()), noHold);
   EXPECT_DEATH((lock->ReadLock(), lock->WriteLock()), noHold);
   EXPECT_DEATH((lock->WriteLock(), lock->ReadLock()), text("_status > 0"));
   EXPECT_DEATH(lock->Unlock(), text("it != locks.end\\(\\)"));
   EXPECT_DEATH(lock->UpgradeReadLock(), oneRead);
   EXPECT_DEATH((lock->ReadLock(), lock->ReadLock(), lock->UpgradeReadLock()), oneRead);
   EXPECT_DEATH((lock->ReadLock(), lock->DowngradeWriteLock()),
                text("it != locks.end\\(\\) && it->second == -1"));
}

}  // namespace
}  // namespace Pelmora::System
