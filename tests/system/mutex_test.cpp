#include <unistd.h>

#include <thread>

#include <gtest/gtest.h>

#include "pelmora/system.h"
#include "src/internal/nativeMutex.h"
#include "tests/support/watchdog.h"

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
   Pelmora::Testing::Join(a, "a to finish");
   Pelmora::Testing::Join(b, "b to finish");
   EXPECT_EQ(40000, counter);
}

// Relocking by the owner panics instead of deadlocking; only the owner may unlock.
TEST(MutexDeathTest, MisusePanics) {
   Ref<Mutex> mutex = NewMutex();
   const std::string where = "\" @ src/system/mutexImpl.h:[0-9]+\n";
   EXPECT_DEATH(
       {
          mutex->Lock();
          mutex->Lock();
       },
       "Assert Failed: \"!_mutex.IsLocked\\(\\)" + where);
   EXPECT_DEATH(
       {
          mutex->Lock();
          std::thread([&] { mutex->Unlock(); }).join();
       },
       "Assert Failed: \"_mutex.IsLocked\\(\\)" + where);
   EXPECT_DEATH(mutex->Unlock(), "Assert Failed: \"_mutex.IsLocked\\(\\)" + where);
}

// The mutex inside the library's other objects: relocking by its owner panics instead of
// hanging (the alarm turns a hang into a failure).
TEST(MutexDeathTest, NativeMutexRelockByItsOwnerPanics) {
   NativeMutex mutex;
   EXPECT_DEATH(
       {
          alarm(5);
          mutex.Lock();
          mutex.Lock();
       },
       "Assert Failed: \"!IsLocked\\(\\)\" @ src/[a-z]+/nativeMutex.h:[0-9]+\n");
   mutex.Lock();
   EXPECT_TRUE(mutex.IsLocked());
   mutex.Unlock();
}

class Mailbox : public WaitableObjectImpl {
public:
   using WaitableObjectImpl::WaitableObjectImpl;
   int value = 0;
};

// Lockable and waitable objects may share one mutex and wait under their own lock.
TEST(WaitableObjectTest, SharesItsMutexAndWaitsUnderItsOwnLock) {
   Ref<Mailbox> box = new Mailbox();
   Ref<LockableObjectImpl> sharing = new LockableObjectImpl(box->GetMutex());
   sharing->Lock();
   EXPECT_TRUE(box->IsLocked());
   sharing->Unlock();
   Ref<Mailbox> sameMutex = new Mailbox(box->GetMutex());
   sameMutex->Lock();
   EXPECT_TRUE(box->IsLocked());
   sameMutex->Unlock();
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
   Pelmora::Testing::Join(producer, "producer to finish");
   EXPECT_EQ(42, box->value);
}

}  // namespace
}  // namespace Pelmora::System
