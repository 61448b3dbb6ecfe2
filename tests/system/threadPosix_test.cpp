#include <gtest/gtest.h>

#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <stdexcept>
#include <thread>

#include "pelmora/exception.h"
#include "pelmora/system.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

using Clock = std::chrono::steady_clock;

long long MicrosSince(Clock::time_point start) {
   return std::chrono::duration_cast<std::chrono::microseconds>(Clock::now() - start).count();
}

// Yields (at most a generous 10 s, normally a few milliseconds) until `done` says so.
template <class F>
bool Eventually(F done) {
   auto start = Clock::now();
   while (!done() && MicrosSince(start) < 10000000) std::this_thread::yield();
   return done();
}

class ThreadTest : public testing::Test {
protected:
   ThreadTest() { GetSystemFactory()->CreateThreadControl(control); }
   ~ThreadTest() override { ReleaseTlsKey(key); }

   // Sets `released` when its last reference goes, wherever that happens.
   class Tracked : public ObjectImpl {
   public:
      explicit Tracked(std::atomic<bool>* released) : _released(released) {}
      ~Tracked() override { *_released = true; }

   private:
      std::atomic<bool>* _released;
   };

   Ref<ThreadControl> control;
   std::atomic<bool> released{false};
   int key = ReserveTlsKey();
};

TEST_F(ThreadTest, AStartedThreadOwnsItsObjectAndReleasesItsTlsWhenItEnds) {
   Ref<Thread> started;
   Thread* seen = nullptr;
   bool existed = false;
   long long id = 0;
   control->StartThread(
       [&] {
          existed = ThisThreadExists();
          seen = GetThisThread();
          id = GetThreadId();
          seen->SetTls(key, new Tracked(&released));
       },
       256, started);
   ASSERT_TRUE(Eventually([&] { return released.load(); }));
   EXPECT_TRUE(existed);
   EXPECT_EQ(started.Get(), seen);
   EXPECT_NE(GetThreadId(), id);
   // The ending thread drops its reference to its object right after its TLS.
   EXPECT_TRUE(Eventually([&] { return started->GetRefCount() == 1; }));
}

TEST_F(ThreadTest, AForeignThreadGetsAnObjectOnFirstUseAndTlsSlotsArePerThread) {
   Ref<Object> mine = new Tracked(&released);
   GetThisThread()->SetTls(key, mine.Get());
   std::thread([&] {
      EXPECT_FALSE(ThisThreadExists());
      Thread* thread = GetThisThread();
      EXPECT_TRUE(ThisThreadExists());
      EXPECT_EQ(thread, GetThisThread());
      EXPECT_EQ(nullptr, thread->GetTls(key));
      thread->SetTls(key, new Tracked(&released));
      EXPECT_NE(nullptr, thread->GetTls(key));
   }).join();
   EXPECT_TRUE(released);  // the foreign thread's object went with it
   EXPECT_EQ(mine.Get(), GetThisThread()->GetTls(key));
   GetThisThread()->SetTls(key, nullptr);
   EXPECT_EQ(1, mine->GetRefCount());
}

TEST_F(ThreadTest, TheStackSizeIsInKilobytesAndARefusedThreadThrows) {
   size_t stackSize = 0;
   std::atomic<bool> finished{false};
   Ref<Thread> started;
   control->StartThread(
       [&] {
          pthread_attr_t attributes;
          pthread_getattr_np(pthread_self(), &attributes);
          pthread_attr_getstacksize(&attributes, &stackSize);
          pthread_attr_destroy(&attributes);
          finished = true;
       },
       256, started);
   ASSERT_TRUE(Eventually([&] { return finished.load(); }));
#ifdef __SANITIZE_THREAD__
   // The thread sanitizer adds room of its own to every stack.
   EXPECT_GE(stackSize, 256u * 1024);
   EXPECT_LT(stackSize, 2048u * 1024);  // neither megabytes nor the 8 MB default
#else
   EXPECT_EQ(256u * 1024, stackSize);
#endif
   Ref<Thread> refused;
   try {
      control->StartThread([] {}, 1, refused);
      FAIL() << "a 1 KB stack was accepted";
   } catch (const SystemException& e) {
      EXPECT_EQ(EINVAL, e.GetError());
   }
   EXPECT_TRUE(refused.IsNull());
}

TEST_F(ThreadTest, WaitOnADescriptorNeverWaitsBelowOneMillisecond) {
   int fds[2];
   ASSERT_EQ(0, pipe(fds));
   Thread* thread = GetThisThread();
   auto start = Clock::now();
   EXPECT_FALSE(thread->TimedWait(fds[0], 500));
   EXPECT_FALSE(thread->TimedWait(fds[0], -999));
   EXPECT_LT(MicrosSince(start), 100000);
   start = Clock::now();
   EXPECT_FALSE(thread->TimedWait(fds[0], 3000));
   EXPECT_GE(MicrosSince(start), 3000);

   ASSERT_EQ(1, write(fds[1], "x", 1));
   EXPECT_TRUE(thread->TimedWait(fds[0], 0));
   char byte;
   ASSERT_EQ(1, read(fds[0], &byte, 1));
   // Only -1000 or less waits without limit.
   std::thread writer([&] {
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
      EXPECT_EQ(1, write(fds[1], "x", 1));
   });
   EXPECT_TRUE(thread->TimedWait(fds[0], -1000));
   Pelmora::Testing::Join(writer, "writer to finish");
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
   Pelmora::Testing::Join(sleeper, "sleeper to finish");
   sigaction(SIGUSR1, &previous, nullptr);
   EXPECT_GE(slept, 5000);
}

using ThreadDeathTest = ThreadTest;

// Outside the anonymous namespace: backtraces resolve exported symbols only.
}  // namespace
[[gnu::noinline]] void ThrowFromAStartedThread() { throw InvalidStateException("lost in a thread"); }
namespace {

// An exception leaving a started thread's function panics with its text and the backtrace
// of where it was thrown, instead of ending in std::terminate with no report.
TEST_F(ThreadDeathTest, AnExceptionEscapingAStartedThreadPanicsWithItsTextAndBacktrace) {
   auto startAndWait = [&](ThreadFunction function) {
      Ref<Thread> started;
      control->StartThread(function, 256, started);
      GetThisThread()->Sleep(10000000);
   };
   EXPECT_DEATH(startAndWait([] { ThrowFromAStartedThread(); }),
                "\n\nPanic: lost in a thread\nBacktrace:\n(.*\n)*.*ThrowFromAStartedThread");
   EXPECT_DEATH(startAndWait([] { throw std::runtime_error("plain"); }),
                "\n\nPanic: Exception escaped a thread: plain\n");
   EXPECT_DEATH(startAndWait([] { throw 7; }),
                "\n\nPanic: Exception of unknown type escaped a thread\n");
}

TEST_F(ThreadDeathTest, NegativeSleepAndNullFunctionsPanic) {
   const std::string where = "\" @ src/system/threadPosix.cpp:[0-9]+\n";
   EXPECT_DEATH(GetThisThread()->Sleep(-1), "Assert Failed: \"microseconds >= 0" + where);
   EXPECT_DEATH(
       {
          Ref<Thread> started;
          control->StartThread(ThreadFunction(), 256, started);
          GetThisThread()->Sleep(10000000);
       },
       "Assert Failed: \"!IsNull\\(\\)" + where);
}

}  // namespace
}  // namespace Pelmora::System
