#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/system.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

// Records in `log` the order in which a guard takes and releases its locks.
struct Recorder {
   std::string* log;
   char name;
   void Note(char what) { *log += std::string{what, name}; }
};

class RecordingLock : public RWLockableObjectImpl, public Recorder {
public:
   RecordingLock(std::string* log, char name) : Recorder{log, name} {}
   void ReadLock() override { Note('r'); }
   void WriteLock() override { Note('w'); }
   void Unlock() override { Note('u'); }
};

class RecordingMutex : public LockableObjectImpl, public Recorder {
public:
   RecordingMutex(std::string* log, char name) : Recorder{log, name} {}
   void Lock() override {
      LockableObjectImpl::Lock();
      Note('l');
   }
   void Unlock() override {
      Note('u');
      LockableObjectImpl::Unlock();
   }
};

// The log of taking `locks` with `take` in ascending address order of their `Base`
// subobjects and releasing them in reverse.
template <class Base, class T>
std::string Expected(char take, const std::vector<Ref<T>>& locks) {
   std::vector<T*> sorted;
   for (const Ref<T>& lock : locks) sorted.push_back(lock.Get());
   std::sort(sorted.begin(), sorted.end(),
             [](T* x, T* y) { return static_cast<Base*>(x) < static_cast<Base*>(y); });
   std::string log;
   for (T* lock : sorted) log += std::string{take, lock->name};
   for (auto it = sorted.rbegin(); it != sorted.rend(); ++it) log += std::string{'u', (*it)->name};
   return log;
}

TEST(MultiSynchronizedTest, LocksByAscendingAddressUnlocksInReverseAndEmpties) {
   std::string log;
   std::vector<Ref<RecordingMutex>> locks;
   for (char name : {'a', 'b', 'c', 'd'}) locks.push_back(new RecordingMutex(&log, name));
   MultiSynchronized guard;
   for (int i : {2, 0, 3, 1}) guard.AddLockable(locks[i].Get());
   guard.Lock();
   guard.Unlock();
   EXPECT_EQ((Expected<LockableObject>('l', locks)), log);

   // Emptied by Unlock: locking again takes nothing until refilled.
   log.clear();
   guard.Lock();
   guard.Unlock();
   EXPECT_EQ("", log);
   guard.AddLockable(locks[1].Get());
   {
      MultiSynchronized scoped;
      scoped.AddLockable(locks[0].Get());
      scoped.Lock();
   }
   guard.Lock();
   guard.Unlock();
   EXPECT_EQ("laualbub", log);  // the scoped guard unlocked on leaving
}

TEST(MultiReadWriteSynchronizedTest, TakesReadOrWriteHoldsInAddressOrder) {
   std::string log;
   std::vector<Ref<RecordingLock>> locks;
   for (char name : {'a', 'b', 'c'}) locks.push_back(new RecordingLock(&log, name));
   MultiReadWriteSynchronized guard;
   for (int i : {1, 2, 0}) guard.AddLockable(locks[i].Get());
   guard.ReadLock();
   guard.Unlock();
   EXPECT_EQ((Expected<RWLockableObject>('r', locks)), log);
   log.clear();
   for (int i : {2, 0, 1}) guard.AddLockable(locks[i].Get());
   guard.WriteLock();
   guard.Unlock();
   EXPECT_EQ((Expected<RWLockableObject>('w', locks)), log);
}

// Filled in opposite orders, the guards still agree on one order: no deadlock however the
// threads interleave.
TEST(MultiSynchronizedTest, OppositeFillOrdersNeverDeadlock) {
   std::vector<Ref<LockableObjectImpl>> mutexes;
   std::vector<Ref<RWLockableObjectImpl>> rwLocks;
   for (int i = 0; i < 3; ++i) {
      mutexes.push_back(new LockableObjectImpl());
      rwLocks.push_back(new RWLockableObjectImpl(RWLockableObject::LOCK_MODE_WRITER_PRIORITY));
   }
   long counter = 0;
   auto work = [&](bool reversed) {
      for (int round = 0; round < 1000; ++round) {
         MultiSynchronized guard;
         MultiReadWriteSynchronized rwGuard;
         for (int i = 0; i < 3; ++i) {
            int k = reversed ? 2 - i : i;
            guard.AddLockable(mutexes[k].Get());
            rwGuard.AddLockable(rwLocks[k].Get());
         }
         rwGuard.WriteLock();
         guard.Lock();
         ++counter;
         guard.Unlock();
         rwGuard.Unlock();
      }
   };
   std::thread a(work, false), b(work, true);
   Pelmora::Testing::Join(a, "a to finish");
   Pelmora::Testing::Join(b, "b to finish");
   EXPECT_EQ(2000, counter);
}

// Adding or locking again while locked, and unlocking while unlocked, panic.
TEST(MultiSynchronizedDeathTest, GuardMisusePanics) {
   Ref<LockableObjectImpl> mutex = new LockableObjectImpl();
   Ref<RWLockableObjectImpl> rwLock = new RWLockableObjectImpl();
   const std::string where = "\" @ src/system/multiSynchronized.cpp:[0-9]+\n";
   const std::string locked = "Assert Failed: \"!_isLocked" + where;
   const std::string unlocked = "Assert Failed: \"_isLocked" + where;
   MultiSynchronized guard;
   MultiReadWriteSynchronized rwGuard;
   EXPECT_DEATH((guard.Lock(), guard.AddLockable(mutex.Get())), locked);
   EXPECT_DEATH((guard.Lock(), guard.Lock()), locked);
   EXPECT_DEATH(guard.Unlock(), unlocked);
   EXPECT_DEATH((rwGuard.ReadLock(), rwGuard.AddLockable(rwLock.Get())), locked);
   EXPECT_DEATH((rwGuard.ReadLock(), rwGuard.WriteLock()), locked);
   EXPECT_DEATH(rwGuard.Unlock(), unlocked);
}

}  // namespace
}  // namespace Pelmora::System
