// Streams over real asio objects: a Unix-domain socket pair.

#include "src/net/genericStream.h"

#include <gtest/gtest.h>

#include <boost/asio/local/stream_protocol.hpp>

#include <string>
#include <thread>
#include <vector>

#include "tests/support/netFixture.h"

namespace Pelmora::System {
namespace {

using NetTesting::Completion;
using NetTesting::WaitFor;

class StreamPairTest : public ::testing::Test {
protected:
   void SetUp() override {
      NetTesting::EnsurePool();
      CreateStreamPair(a, b);
   }
   Ref<Stream> a;
   Ref<Stream> b;
};

TEST_F(StreamPairTest, SynchronousEchoAndPeerCloseGivesEndOfStream) {
   std::string big(1 << 20, 'x');
   for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>('a' + i % 26);
   std::thread echo([&] {
      std::vector<char> buffer(65536);
      for (;;) {
         int n = b->Read(buffer.data(), static_cast<int>(buffer.size()));
         if (n == 0) break;
         EXPECT_EQ(n, b->Write(buffer.data(), n));
      }
      b->Close();
   });
   // Writes are whole even when far larger than the socket buffer.
   std::string received;
   std::thread reader([&] {
      std::vector<char> buffer(65536);
      while (received.size() < big.size()) {
         int n = a->Read(buffer.data(), static_cast<int>(buffer.size()));
         if (n == 0) break;
         received.append(buffer.data(), n);
      }
   });
   EXPECT_EQ(static_cast<int>(big.size()), a->Write(big.data(), static_cast<int>(big.size())));
   reader.join();
   EXPECT_EQ(big, received);
   // Ending our side ends the echo, whose close reaches us as a 0-byte read.
   a->Close();
   echo.join();
}

TEST_F(StreamPairTest, AsynchronousEchoRunsOnThePool) {
   const char message[] = "ping";
   char buffer[16] = {};
   Completion written;
   Completion read;
   b->AsyncRead(buffer, sizeof buffer, [&](Stream* s, Exception* error, int n) {
      EXPECT_EQ(b.Get(), s);
      // The completion thread may ask; nobody consumed this completion yet.
      EXPECT_FALSE(s->HasReadCompleted());
      read.Done(error, n);
   });
   a->AsyncWrite(message, 4, [&](Stream*, Exception* error) { written.Done(error, 4); });
   ASSERT_TRUE(written.WaitCount(1));
   ASSERT_TRUE(read.WaitCount(1));
   EXPECT_FALSE(read.Failed());
   EXPECT_EQ(4, read.Bytes());
   EXPECT_EQ("ping", std::string(buffer, 4));

   Completion eof;
   b->AsyncRead(buffer, sizeof buffer, [&](Stream*, Exception* error, int n) { eof.Done(error, n); });
   a->Close();
   ASSERT_TRUE(eof.WaitCount(1));
   EXPECT_FALSE(eof.Failed());
   EXPECT_EQ(0, eof.Bytes());
}

TEST_F(StreamPairTest, CloseCompletesAnOutstandingReadWithAFailure) {
   char buffer[8];
   Completion read;
   a->AsyncRead(buffer, sizeof buffer, [&](Stream*, Exception* error, int n) { read.Done(error, n); });
   a->Close();
   ASSERT_TRUE(read.WaitCount(1));
   EXPECT_TRUE(read.Failed());
   EXPECT_THROW(a->Read(buffer, sizeof buffer), InvalidStateException);
   // The peer sees the end of the stream.
   EXPECT_EQ(0, b->Read(buffer, sizeof buffer));
}

TEST_F(StreamPairTest, ReadTimeOutClosesTheRealStream) {
   NetTesting::DefaultLogCapture log;
   long long saved = GetStreamTimeoutTick();
   SetStreamTimeoutTick(10000);
   char buffer[8];
   Completion read;
   a->SetReadTimeout(15000, Service::Logger::LOG_WARNING, "pair");
   a->AsyncRead(buffer, sizeof buffer, [&](Stream*, Exception* error, int n) { read.Done(error, n); });
   ASSERT_TRUE(read.WaitCount(1));
   EXPECT_TRUE(read.Failed());
   EXPECT_EQ("Operation was canceled", read.Error());
   EXPECT_TRUE(WaitFor([&] { return log.Contains("pair : Read timeout after approximately 20ms"); },
                       "the time-out line"))
       << log.Text();
   SetStreamTimeoutTick(saved);
}

TEST_F(StreamPairTest, WorkQueueReceivesTheCompletions) {
   Ref<WorkQueue> queue;
   GetThreadPool()->CreateSerialWorkQueue(WorkQueueSpec("streamPairTest", 5), queue);
   using Socket = boost::asio::local::stream_protocol::socket;
   char buffer[4];
   std::atomic<bool> onQueue{false};
   Completion read;
   // A stream given a queue runs its completion there.
   auto* generic = dynamic_cast<GenericStream<Socket>*>(a.Get());
   ASSERT_NE(nullptr, generic);
   Ref<Stream> queued = new GenericStream<Socket>(std::move(generic->GetIo()), queue.Get(), "queued");
   queued->AsyncRead(buffer, sizeof buffer, [&](Stream*, Exception* error, int n) {
      onQueue = GetThreadPool()->GetCurrentWorkQueue() == queue.Get();
      read.Done(error, n);
   });
   b->Write("abcd", 4);
   ASSERT_TRUE(read.WaitCount(1));
   EXPECT_TRUE(onQueue.load());
   queued->Close();
}

}  // namespace
}  // namespace Pelmora::System
