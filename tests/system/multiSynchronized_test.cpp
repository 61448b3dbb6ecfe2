#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/system.h"

namespace Pelmora::System {
namespace {

// Records the order in which a guard takes and releases its locks.
class RecordingLock : public RWLockableObjectImpl {
public:
   RecordingLock(std::string* log, char name) : _log(log), _name(name) {}
   void ReadLock() override { Note('r'); }
   void WriteLock() override { Note('w'); }
   void Unlock() override { Note('u'); }
   char GetName() const { return _name; }

private:
   void Note(char what) {
      *_log += what;
      *_log += _name;
   }
   std::string* _log;
   char _name;
};

class RecordingMutex : public LockableObjectImpl {
public:
   RecordingMutex(std::string* log, char name) : _log(log), _name(name) {}
   void Lock() override {
      LockableObjectImpl::Lock();
      *_log += 'l';
      *_log += _name;
   }
   void Unlock() override {
      *_log += 'u';
      *_log += _name;
      LockableObjectImpl::Unlock();
   }
   char GetName() const { return _name; }

private:
   std::string* _log;
   char _name;
};

// The names of `locks` in ascending address order of their `Base` subobjects.
template <class Base, class T>
std::string NamesByAddress(const std::vector<Ref<T>>& locks) {
   std::vector<T*> sorted;
   for (const Ref<T>& lock : locks) sorted.push_back(lock.Get());
   std::sort(sorted.begin(), sorted.end(),
             [](T* x, T* y) { return static_cast<Base*>(x) < static_cast<Base*>(y); });
   std::string names;
   for (T* lock : sorted) names += lock->GetName();
   return names;
}

std::string Expected(char take, const std::string& names) {
   std::string log;
   for (char name : names) log += std::string{take, name};
   for (auto it = names.rbegin(); it != names.rend(); ++it) log += std::string{'u', *it};
   return log;
}

TEST(MultiSynchronizedTest, LocksByAscendingAddressUnlocksInReverseAndEmpties) {
   std::string log;
   std::vector<Ref<RecordingMutex>> locks;
   for (char name : {'a', 'b', 'c', 'd'}) locks.push_back(new RecordingMutex(&log, name));
   MultiSynchronized guard;
   for (int i : {2, 0, 3, 1}) guard.AddLockable(locks[i].Get());
   guard.Lock();
   for (auto& lock : locks) EXPECT_TRUE(lock->IsLocked());
   guard.Unlock();
   for (auto& lock : locks) EXPECT_FALSE(lock->IsLocked());
   EXPECT_EQ(Expected('l', NamesByAddress<LockableObject>(locks)), log);

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
   std::string names = NamesByAddress<RWLockableObject>(locks);
   MultiReadWriteSynchronized guard;
   for (int i : {1, 2, 0}) guard.AddLockable(locks[i].Get());
   guard.ReadLock();
   guard.Unlock();
   EXPECT_EQ(Expected('r', names), log);
   log.clear();
   for (int i : {2, 0, 1}) guard.AddLockable(locks[i].Get());
   guard.WriteLock();
   guard.Unlock();
   EXPECT_EQ(Expected('w', names), log);
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
   a.join();
   b.join();
   EXPECT_EQ(2000, counter);
}

TEST(MultiSynchronizedDeathTest, GuardMisusePanics) {
   Ref<LockableObjectImpl> mutex = new LockableObjectImpl();
   Ref<RWLockableObjectImpl> rwLock = new RWLockableObjectImpl();
   const std::string where = "\" @ src/system/multiSynchronized.cpp:[0-9]+\n";
   EXPECT_DEATH(
       {
          MultiSynchronized guard;
          guard.Lock();
          guard.AddLockable(mutex.Get());
       },
       "Assert Failed: \"!_isLocked" + where);
   EXPECT_DEATH(
       {
          MultiSynchronized guard;
          guard.Lock();
          guard.Lock();
       },
       "\"!_isLocked" + where);
   EXPECT_DEATH(MultiSynchronized().Unlock(), "Assert Failed: \"_isLocked" + where);
   EXPECT_DEATH(
       {
          MultiReadWriteSynchronized guard;
          guard.ReadLock();
          guard.AddLockable(rwLock.Get());
       },
       "\"!_isLocked" + where);
   EXPECT_DEATH(
       {
          MultiReadWriteSynchronized guard;
          guard.ReadLock();
          guard.WriteLock();
       },
       "\"!_isLocked" + where);
   EXPECT_DEATH(MultiReadWriteSynchronized().Unlock(), "\"_isLocked" + where);
}

}  // namespace
}  // namespace Pelmora::System
