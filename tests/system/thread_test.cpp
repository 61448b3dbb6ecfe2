#include <gtest/gtest.h>

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "pelmora/exception.h"
#include "pelmora/system.h"

namespace Pelmora::System {
namespace {

using Clock = std::chrono::steady_clock;

long long MicrosSince(Clock::time_point start) {
   return std::chrono::duration_cast<std::chrono::microseconds>(Clock::now() - start).count();
}

// Set when its last reference goes, wherever that happens.
class Tracked : public ObjectImpl {
public:
   explicit Tracked(WaitableObjectImpl* done) : _done(done) {}
   ~Tracked() override {
      Synchronized lock(_done.Get());
      _done->Signal();
      released = true;
   }
   static inline bool released = false;

private:
   Ref<WaitableObjectImpl> _done;
};

class ThreadTest : public testing::Test {
protected:
   ThreadTest() {
      GetSystemFactory()->CreateThreadControl(control);
      done = new WaitableObjectImpl();
      Tracked::released = false;
   }

   // Waits (at most a generous 10 s, normally a few milliseconds) until `flag` is set.
   bool WaitFor(const bool& flag) {
      Synchronized lock(done.Get());
      auto start = Clock::now();
      while (!flag && MicrosSince(start) < 10000000) done->TimedWait(1000);
      return flag;
   }

   Ref<ThreadControl> control;
   Ref<WaitableObjectImpl> done;
};

TEST_F(ThreadTest, AStartedThreadOwnsItsObjectAndReleasesItsTlsWhenItEnds) {
   int key = ReserveTlsKey();
   Ref<Thread> started;
   Thread* seen = nullptr;
   bool existed = false;
   long long id = 0;
   control->StartThread(
       [&] {
          existed = ThisThreadExists();
          seen = GetThisThread();
          id = GetThreadId();
          seen->SetTls(key, new Tracked(done.Get()));
       },
       256, started);
   ASSERT_TRUE(WaitFor(Tracked::released));
   EXPECT_TRUE(existed);
   EXPECT_EQ(started.Get(), seen);
   EXPECT_NE(GetThreadId(), id);
   // The ending thread drops its reference to its object right after its TLS.
   auto start = Clock::now();
   while (started->GetRefCount() != 1 && MicrosSince(start) < 10000000) std::this_thread::yield();
   EXPECT_EQ(1, started->GetRefCount());
   ReleaseTlsKey(key);
}

TEST_F(ThreadTest, AForeignThreadGetsAnObjectOnFirstUseAndReleasesIt) {
   int key = ReserveTlsKey();
   std::thread([&] {
      EXPECT_FALSE(ThisThreadExists());
      Thread* thread = GetThisThread();
      EXPECT_TRUE(ThisThreadExists());
      EXPECT_EQ(thread, GetThisThread());
      thread->SetTls(key, new Tracked(done.Get()));
      EXPECT_NE(nullptr, thread->GetTls(key));
   }).join();
   EXPECT_TRUE(Tracked::released);
   EXPECT_EQ(nullptr, GetThisThread()->GetTls(key));
   ReleaseTlsKey(key);
}

TEST_F(ThreadTest, TheStackSizeIsInKilobytes) {
   size_t stackSize = 0;
   bool finished = false;
   Ref<Thread> started;
   control->StartThread(
       [&] {
          pthread_attr_t attributes;
          pthread_getattr_np(pthread_self(), &attributes);
          pthread_attr_getstacksize(&attributes, &stackSize);
          pthread_attr_destroy(&attributes);
          Synchronized lock(done.Get());
          finished = true;
          done->Signal();
       },
       256, started);
   ASSERT_TRUE(WaitFor(finished));
#ifdef __SANITIZE_THREAD__
   // The thread sanitizer adds room of its own to every stack.
   EXPECT_GE(stackSize, 256u * 1024);
   EXPECT_LT(stackSize, 2048u * 1024);  // neither megabytes nor the 8 MB default
#else
   EXPECT_EQ(256u * 1024, stackSize);
#endif
}

TEST_F(ThreadTest, ARefusedThreadThrowsTheSystemError) {
   Ref<Thread> started;
   try {
      control->StartThread([] {}, 1, started);
      FAIL() << "a 1 KB stack was accepted";
   } catch (const SystemException& e) {
      EXPECT_EQ(EINVAL, e.GetError());
   }
   EXPECT_TRUE(started.IsNull());
}

TEST_F(ThreadTest, WaitOnADescriptorNeverWaitsBelowOneMillisecond) {
   int fds[2];
   ASSERT_EQ(0, pipe(fds));
   Thread* thread = GetThisThread();
   auto start = Clock::now();
   EXPECT_FALSE(thread->Wait(fds[0]));
   EXPECT_FALSE(thread->TimedWait(fds[0], 500));
   EXPECT_FALSE(thread->TimedWait(fds[0], -999));
   EXPECT_LT(MicrosSince(start), 100000);

   start = Clock::now();
   EXPECT_FALSE(thread->TimedWait(fds[0], 3000));
   EXPECT_GE(MicrosSince(start), 3000);

   ASSERT_EQ(1, write(fds[1], "x", 1));
   EXPECT_TRUE(thread->Wait(fds[0]));
   EXPECT_TRUE(thread->TimedWait(fds[0], 0));
   char byte;
   ASSERT_EQ(1, read(fds[0], &byte, 1));

   // Only -1000 or less waits without limit.
   std::thread writer([&] {
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
      EXPECT_EQ(1, write(fds[1], "x", 1));
   });
   EXPECT_TRUE(thread->TimedWait(fds[0], -1000));
   writer.join();
   close(fds[0]);
   close(fds[1]);
}

void IgnoreSignal(int) {}

TEST_F(ThreadTest, SleepIsNotCutShortBySignals) {
   struct sigaction action = {};
   action.sa_handler = IgnoreSignal;  // no SA_RESTART: the sleep sees EINTR
   struct sigaction previous;
   sigaction(SIGUSR1, &action, &previous);
   long long slept = 0;
   std::thread sleeper([&] {
      auto start = Clock::now();
      GetThisThread()->Sleep(5000);
      slept = MicrosSince(start);
   });
   std::this_thread::sleep_for(std::chrono::milliseconds(1));
   pthread_kill(sleeper.native_handle(), SIGUSR1);
   sleeper.join();
   sigaction(SIGUSR1, &previous, nullptr);
   EXPECT_GE(slept, 5000);
}

TEST_F(ThreadTest, TlsSlotsArePerThread) {
   int key = ReserveTlsKey();
   Ref<Object> mine = new Tracked(done.Get());
   GetThisThread()->SetTls(key, mine.Get());
   std::thread([&] { EXPECT_EQ(nullptr, GetThisThread()->GetTls(key)); }).join();
   EXPECT_EQ(mine.Get(), GetThisThread()->GetTls(key));
   GetThisThread()->SetTls(key, nullptr);
   EXPECT_EQ(1, mine->GetRefCount());
   ReleaseTlsKey(key);
}

using ThreadDeathTest = ThreadTest;

TEST_F(ThreadDeathTest, NegativeSleepAndNullFunctionsPanic) {
   EXPECT_DEATH(GetThisThread()->Sleep(-1),
                "Assert Failed: \"microseconds >= 0\" @ src/system/threadPosix.cpp:[0-9]+\n");
   EXPECT_DEATH(
       {
          Ref<Thread> started;
          control->StartThread(ThreadFunction(), 256, started);
          GetThisThread()->Sleep(10000000);
       },
       "Assert Failed: \"!IsNull\\(\\)\" @ src/system/threadPosix.cpp:[0-9]+\n");
}

}  // namespace
}  // namespace Pelmora::System
