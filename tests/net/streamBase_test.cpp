// The per-direction state machine, completions and time-outs, driven through a stream
// whose transport the test completes by hand.

#include "src/net/streamBase.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "tests/support/netFixture.h"

namespace Pelmora::System {
namespace {

using NetTesting::Completion;
using NetTesting::DefaultLogCapture;
using NetTesting::WaitFor;

class ManualStream : public StreamBase {
public:
   ManualStream() : StreamBase("manual stream") {}
   using StreamBase::CompleteIO;
   std::atomic<int> reads{0};
   std::atomic<int> writes{0};
   std::atomic<int> closes{0};

protected:
   void StartRead(char*, int) override { ++reads; }
   void StartWrite(const char*, int) override { ++writes; }
   void CloseIo() override { ++closes; }
};

using ReadFun = Functor<void, Stream*, Exception*, int>;

ReadFun Into(Completion& done) {
   return [&done](Stream*, Exception* error, int bytes) { done.Done(error, bytes); };
}

// Returns once another thread waits for `stream`'s read: a second waiter is refused then.
bool AwaitReadWaiter(StreamBase* stream) {
   return WaitFor(
       [&] {
          try {
             stream->TimedWaitRead(0);
          } catch (const InProgressException&) {
             return true;
          } catch (const TimeoutException&) {
          }
          return false;
       },
       "the waiter");
}

TEST(StreamBaseTest, OneOperationPerDirectionAndNoneAfterClose) {
   Ref<ManualStream> stream = new ManualStream();
   Completion read;
   stream->AsyncRead(nullptr, 10, Into(read));
   EXPECT_THROW(stream->AsyncRead(nullptr, 10, Into(read)), InProgressException);
   // The other direction is independent.
   stream->AsyncWrite("x", 1, [](Stream*, Exception*) {});
   EXPECT_EQ(1, stream->reads.load());
   EXPECT_EQ(1, stream->writes.load());
   EXPECT_EQ(StreamBase::STATE_PENDING, stream->GetState(false));

   stream->Close();
   EXPECT_EQ(1, stream->closes.load());
   EXPECT_EQ(StreamBase::STATE_CLOSED, stream->GetState(false));
   EXPECT_EQ(StreamBase::STATE_CLOSED, stream->GetState(true));
   EXPECT_THROW(stream->AsyncWrite("x", 1, [](Stream*, Exception*) {}), InvalidStateException);
   EXPECT_THROW(stream->WaitRead(), InvalidStateException);
   stream->Close();  // closing twice closes the transport once
   EXPECT_EQ(1, stream->closes.load());
   // A completion after close still reaches its callback and leaves the stream closed.
   CanceledException canceled;
   stream->CompleteIO(false, &canceled, 0);
   ASSERT_EQ(1, read.Count());
   EXPECT_EQ("Operation was canceled", read.Error());
   EXPECT_EQ(StreamBase::STATE_CLOSED, stream->GetState(false));
}

TEST(StreamBaseTest, WaitingWithNothingOutstandingOrASecondWaiterFails) {
   Ref<ManualStream> stream = new ManualStream();
   try {
      stream->WaitRead();
      FAIL() << "no exception";
   } catch (const NotInProgressException& e) {
      EXPECT_STREQ("Operation is not in progress", e.what());
   }
   EXPECT_THROW(stream->TimedWaitWrite(1000), NotInProgressException);

   stream->AsyncRead(nullptr, 4, ReadFun());
   std::atomic<int> result{-1};
   std::thread waiter([&] { result = stream->WaitRead(); });
   ASSERT_TRUE(AwaitReadWaiter(stream.Get()));
   // A new operation while someone waits is refused too.
   EXPECT_THROW(stream->AsyncRead(nullptr, 4, ReadFun()), InProgressException);
   stream->CompleteIO(false, nullptr, 4);
   waiter.join();
   EXPECT_EQ(4, result.load());
   EXPECT_EQ(StreamBase::STATE_IDLE, stream->GetState(false));
}

TEST(StreamBaseTest, SynchronousWaitsReturnBytesOrRethrowAndTimeOut) {
   Ref<ManualStream> stream = new ManualStream();
   stream->AsyncWrite("abc", 3, Functor<void, Stream*, Exception*>());
   try {
      stream->TimedWaitWrite(2000);
      FAIL() << "no time-out";
   } catch (const TimeoutException& e) {
      EXPECT_STREQ("Operation timed out", e.what());
   }
   // Still pending: a later wait gets the result.
   EXPECT_EQ(StreamBase::STATE_PENDING, stream->GetState(true));
   std::thread completer([&] { stream->CompleteIO(true, nullptr, 3); });
   EXPECT_EQ(3, stream->TimedWaitWrite(5000000));
   completer.join();

   stream->AsyncRead(nullptr, 8, ReadFun());
   SystemException reset(104, "Connection reset by peer");
   stream->CompleteIO(false, &reset, 0);
   try {
      stream->WaitRead();
      FAIL() << "no exception";
   } catch (const SystemException& e) {
      EXPECT_EQ(104, e.GetError());
   }
   // The failure was consumed with the wait.
   EXPECT_EQ(StreamBase::STATE_IDLE, stream->GetState(false));
   EXPECT_THROW(stream->WaitRead(), NotInProgressException);

   // A failed wait with close-on-failure closes its direction.
   stream->SetCloseOnFailure(true);
   stream->AsyncRead(nullptr, 8, ReadFun());
   EXPECT_THROW(stream->TimedWaitRead(0), TimeoutException);
   EXPECT_EQ(StreamBase::STATE_CLOSED, stream->GetState(false));
}

TEST(StreamBaseTest, CloseWakesAWaiterWithInvalidState) {
   Ref<ManualStream> stream = new ManualStream();
   stream->AsyncRead(nullptr, 8, ReadFun());
   std::atomic<bool> invalid{false};
   std::thread waiter([&] {
      try {
         stream->WaitRead();
      } catch (const InvalidStateException&) {
         invalid = true;
      }
   });
   ASSERT_TRUE(AwaitReadWaiter(stream.Get()));
   stream->Close();
   waiter.join();
   EXPECT_TRUE(invalid.load());
}

TEST(StreamBaseTest, CompletionMarksItsThreadAndIsConsumedAfterTheCallback) {
   Ref<ManualStream> stream = new ManualStream();
   try {
      stream->HasReadCompleted();
      FAIL() << "no exception";
   } catch (const WrongThreadException& e) {
      EXPECT_STREQ("Wrong Thread", e.what());
   }
   bool consumedInside = true;
   bool writeSideWrongThread = false;
   bool restarted = false;
   stream->AsyncRead(nullptr, 8, [&](Stream* s, Exception*, int) {
      consumedInside = s->HasReadCompleted();
      try {
         s->HasWriteCompleted();
      } catch (const WrongThreadException&) {
         writeSideWrongThread = true;
      }
      // The callback may start the next read of its direction.
      s->AsyncRead(nullptr, 8, ReadFun());
      restarted = true;
   });
   stream->CompleteIO(false, nullptr, 5);
   EXPECT_FALSE(consumedInside);
   EXPECT_TRUE(writeSideWrongThread);
   ASSERT_TRUE(restarted);
   EXPECT_THROW(stream->HasReadCompleted(), WrongThreadException);
   // The restarted read is pending, not swallowed by the first one's consumption.
   EXPECT_EQ(StreamBase::STATE_PENDING, stream->GetState(false));
   stream->CompleteIO(false, nullptr, 2);
   EXPECT_EQ(2, stream->WaitRead());

   // A callback that does not restart leaves the direction idle.
   stream->AsyncRead(nullptr, 8, [](Stream*, Exception*, int) {});
   stream->CompleteIO(false, nullptr, 1);
   EXPECT_EQ(StreamBase::STATE_IDLE, stream->GetState(false));
}

TEST(StreamBaseTest, ExceptionsEscapingCallbacksAreLoggedNotPropagated) {
   DefaultLogCapture log;
   Ref<ManualStream> stream = new ManualStream();
   stream->AsyncRead(nullptr, 8, [](Stream*, Exception*, int) { throw InvalidArgumentException("boom"); });
   EXPECT_NO_THROW(stream->CompleteIO(false, nullptr, 3));
   stream->AsyncWrite("x", 1, [](Stream*, Exception*) { throw NotSupportedException(); });
   EXPECT_NO_THROW(stream->CompleteIO(true, nullptr, 1));
   EXPECT_TRUE(log.Contains("Unexpected exception in readFun.Invoke: Invalid argument : boom : 3"))
       << log.Text();
   EXPECT_TRUE(log.Contains("Unexpected exception in writeFun.Invoke: Not Supported")) << log.Text();
   EXPECT_EQ(StreamBase::STATE_IDLE, stream->GetState(false));
   EXPECT_EQ(StreamBase::STATE_IDLE, stream->GetState(true));
}

TEST(StreamBaseTest, TickCountsAreTimeOutOverTickPlusOneAndReloadOnCompletion) {
   Ref<ManualStream> stream = new ManualStream();
   stream->SetReadTimeout(12000000, Service::Logger::LOG_WARNING, nullptr);
   EXPECT_EQ(3, stream->GetTicksLeft(false));
   stream->SetWriteTimeout(0, Service::Logger::LOG_WARNING, nullptr);
   EXPECT_EQ(1, stream->GetTicksLeft(true));
   // A negative time-out never counts down, never closes.
   stream->SetWriteTimeout(-1, Service::Logger::LOG_WARNING, nullptr);
   EXPECT_EQ(0, stream->GetTicksLeft(true));
   stream->AsyncWrite("x", 1, Functor<void, Stream*, Exception*>());
   for (int i = 0; i < 100; ++i) stream->TimeoutTick("d");
   EXPECT_EQ(StreamBase::STATE_PENDING, stream->GetState(true));
   stream->CompleteIO(true, nullptr, 1);

   // An idle direction is skipped by the tick.
   stream->TimeoutTick("d");
   EXPECT_EQ(3, stream->GetTicksLeft(false));

   stream->AsyncRead(nullptr, 8, ReadFun());
   stream->TimeoutTick("d");
   stream->TimeoutTick("d");
   EXPECT_EQ(1, stream->GetTicksLeft(false));
   stream->CompleteIO(false, nullptr, 8);
   EXPECT_EQ(3, stream->GetTicksLeft(false));  // one operation is measured, not the stream's life
   EXPECT_EQ(8, stream->WaitRead());
   EXPECT_EQ(0, stream->closes.load());
}

TEST(StreamBaseTest, TimedOutDirectionLogsAndClosesWriteSideFirst) {
   DefaultLogCapture log;
   Ref<ManualStream> stream = new ManualStream();
   stream->SetReadTimeout(0, Service::Logger::LOG_WARNING, "idle client");
   stream->SetWriteTimeout(4999999, Service::Logger::LOG_WARNING, "idle client");
   stream->AsyncRead(nullptr, 8, ReadFun());
   stream->AsyncWrite("x", 1, Functor<void, Stream*, Exception*>());
   stream->TimeoutTick("conn 7");
   EXPECT_EQ(1, stream->closes.load());
   EXPECT_TRUE(log.Contains("idle client : Write timeout after approximately 5000ms. Closing stream conn 7"))
       << log.Text();
   // The write time-out ended the tick: the read side was not counted down.
   EXPECT_EQ(1, stream->GetTicksLeft(false));
   EXPECT_FALSE(log.Contains("Read timeout"));

   Ref<ManualStream> quiet = new ManualStream();
   quiet->SetReadTimeout(5000000, Service::Logger::LOG_WARNING, "");
   quiet->AsyncRead(nullptr, 8, ReadFun());
   quiet->TimeoutTick("conn 8");
   EXPECT_EQ(0, quiet->closes.load());
   quiet->TimeoutTick("conn 8");
   EXPECT_EQ(1, quiet->closes.load());
   EXPECT_TRUE(log.Contains("Read timeout after approximately 10000ms. Closing stream conn 8"))
       << log.Text();
   EXPECT_FALSE(log.Contains(" : Read timeout"));

   // A level the default logger does not want closes without a line.
   Ref<ManualStream> unlogged = new ManualStream();
   unlogged->SetReadTimeout(0, Service::Logger::LOG_TRIVIA, "trivial");
   unlogged->AsyncRead(nullptr, 8, ReadFun());
   unlogged->TimeoutTick("conn 9");
   EXPECT_EQ(1, unlogged->closes.load());
   EXPECT_FALSE(log.Contains("trivial"));
}

TEST(StreamBaseTest, TickerClosesOnThePoolAndForgetsReleasedStreams) {
   NetTesting::EnsurePool();
   DefaultLogCapture log;
   long long saved = GetStreamTimeoutTick();
   TimeoutTicker& ticker = TimeoutTicker::GetInstance();
   int before = ticker.GetStreamCount();
   {
      // Armed at the production tick first: shortening the tick must restart the timer.
      Ref<ManualStream> stream = new ManualStream();
      stream->SetReadTimeout(0, Service::Logger::LOG_WARNING, "ticker");
      EXPECT_EQ(before + 1, ticker.GetStreamCount());
      SetStreamTimeoutTick(10000);
      stream->SetReadTimeout(0, Service::Logger::LOG_WARNING, "ticker");
      stream->AsyncRead(nullptr, 8, ReadFun());
      EXPECT_TRUE(WaitFor([&] { return stream->closes.load() == 1; }, "the ticker's close",
                          std::chrono::milliseconds(2000)));
      EXPECT_TRUE(log.Contains("ticker : Read timeout after approximately 10ms. Closing stream manual stream"))
          << log.Text();
   }
   EXPECT_EQ(before, ticker.GetStreamCount());
   SetStreamTimeoutTick(saved);
}

}  // namespace
}  // namespace Pelmora::System
