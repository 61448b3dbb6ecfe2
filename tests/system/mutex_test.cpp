#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "pelmora/system.h"

namespace Pelmora::System {
namespace {

Ref<Mutex> NewMutex() {
   Ref<Mutex> mutex;
   GetSystemFactory()->CreateMutex(mutex);
   return mutex;
}

TEST(MutexTest, IsLockedAnswersForTheCallingThreadOnly) {
   Ref<Mutex> mutex = NewMutex();
   EXPECT_FALSE(mutex->IsLocked());
   mutex->Lock();
   EXPECT_TRUE(mutex->IsLocked());
   bool seenByOther = true;
   std::thread([&] { seenByOther = mutex->IsLocked(); }).join();
   EXPECT_FALSE(seenByOther);
   mutex->Unlock();
   EXPECT_FALSE(mutex->IsLocked());
}

TEST(MutexTest, ExcludesOtherThreads) {
   Ref<Mutex> mutex = NewMutex();
   long counter = 0;
   auto work = [&] {
      for (int i = 0; i < 20000; ++i) {
         Synchronized lock(mutex.Get());
         ++counter;
      }
   };
   std::thread a(work), b(work);
   a.join();
   b.join();
   EXPECT_EQ(40000, counter);
}

TEST(MutexDeathTest, RelockingByTheOwnerPanicsInsteadOfDeadlocking) {
   Ref<Mutex> mutex = NewMutex();
   EXPECT_DEATH(
       {
          mutex->Lock();
          mutex->Lock();
       },
       "Assert Failed: \"!_mutex.IsLocked\\(\\)\" @ src/system/mutexImpl.h:[0-9]+\n");
}

TEST(MutexDeathTest, UnlockingByAnotherThreadPanics) {
   Ref<Mutex> mutex = NewMutex();
   EXPECT_DEATH(
       {
          mutex->Lock();
          std::thread([&] { mutex->Unlock(); }).join();
       },
       "Assert Failed: \"_mutex.IsLocked\\(\\)\" @ src/system/mutexImpl.h:[0-9]+\n");
   EXPECT_DEATH(mutex->Unlock(),
                "Assert Failed: \"_mutex.IsLocked\\(\\)\" @ src/system/mutexImpl.h");
}

// An object locked and waited on through its own interface, sharing its mutex.
class Mailbox : public WaitableObjectImpl {
public:
   int value = 0;
};

TEST(LockableObjectTest, ForwardsToItsMutexAndCanShareIt) {
   Ref<Mailbox> box = new Mailbox();
   box->Lock();
   EXPECT_TRUE(box->IsLocked());
   EXPECT_TRUE(box->GetMutex()->IsLocked());
   box->Unlock();

   Ref<LockableObjectImpl> sharing = new LockableObjectImpl(box->GetMutex());
   sharing->Lock();
   EXPECT_TRUE(box->IsLocked());
   sharing->Unlock();
}

TEST(WaitableObjectTest, WaitsUnderItsOwnLock) {
   Ref<Mailbox> box = new Mailbox();
   std::thread producer([&] {
      Synchronized lock(box.Get());
      box->value = 42;
      box->Signal();
   });
   {
      Synchronized lock(box.Get());
      while (box->value == 0) box->Wait();
      EXPECT_TRUE(box->IsLocked());
   }
   producer.join();
   EXPECT_EQ(42, box->value);

   Synchronized lock(box.Get());
   EXPECT_FALSE(box->TimedWait(0));
   EXPECT_TRUE(box->IsLocked());
}

}  // namespace
}  // namespace Pelmora::System
