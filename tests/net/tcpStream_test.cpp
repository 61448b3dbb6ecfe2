// Files sent over plain TCP streams with sendfile: exact bytes, ranges, short files,
// waiting for a slow reader without a thread, and the write time-out and Close ending it.

#include "src/net/tcpStream.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

#include "tests/support/netFixture.h"

namespace Pelmora::System {
namespace {

using NetTesting::Completion;

// A pair of connected TCP streams over loopback: the accepted end and the client end.
struct Connected {
   Ref<ServerSocket> server;
   Ref<Stream> accepted;
   Ref<Stream> client;
};

// Small socket buffers, so that a file of a few MiB cannot sit in them whole.
void Squeeze(Connected& pair) {
   int size = 65536;
   int sending = dynamic_cast<TcpStream*>(pair.accepted.Get())->GetIo().native_handle();
   int receiving = dynamic_cast<TcpStream*>(pair.client.Get())->GetIo().native_handle();
   ::setsockopt(sending, SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
   ::setsockopt(receiving, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
}

Connected Connect(const char* host = "127.0.0.1") {
   Connected pair;
   CreateTcpServerSocket(host, 0, ServerSocketOptions(), pair.server);
   Ref<BindingInfo> local;
   pair.server->GetBindingInfo(local);
   std::thread acceptor([&] { pair.server->Accept(5000000, pair.accepted); });
   CreateTcpConnection(host, local->GetPort(), 5000000, pair.client);
   acceptor.join();
   return pair;
}

// Bytes that differ from offset to offset, so a misplaced piece shows.
std::string Pattern(size_t size) {
   std::string text(size, '\0');
   unsigned int state = 12345;
   for (char& c : text) {
      state = state * 1103515245u + 12345u;
      c = static_cast<char>(state >> 16);
   }
   return text;
}

std::string ReadAll(Stream* stream, size_t size) {
   std::string got(size, '\0');
   size_t have = 0;
   while (have < size) {
      int n = stream->Read(got.data() + have, static_cast<int>(std::min<size_t>(size - have, 1 << 20)));
      if (n <= 0) break;
      have += static_cast<size_t>(n);
   }
   got.resize(have);
   return got;
}

class TcpStreamTest : public ::testing::Test {
protected:
   void SetUp() override {
      NetTesting::EnsurePool();
      _path = ::testing::TempDir() + "tcpstream_" + std::to_string(::getpid());
      _content = Pattern(6 << 20);
      std::ofstream(_path, std::ios::binary) << _content;
      _fd = ::open(_path.c_str(), O_RDONLY | O_CLOEXEC);
      ASSERT_GE(_fd, 0);
   }
   void TearDown() override {
      ::close(_fd);
      ::unlink(_path.c_str());
   }

   std::string _path;
   std::string _content;
   int _fd = -1;
};

TEST_F(TcpStreamTest, SendsWholeFilesRangesAndShortFilesExactly) {
   Connected pair = Connect();
   ASSERT_TRUE(pair.accepted);
   auto* sender = dynamic_cast<FileSender*>(pair.accepted.Get());
   ASSERT_NE(sender, nullptr) << typeid(*pair.accepted.Get()).name();
   ASSERT_TRUE(sender->CanSendFile());
   EXPECT_NE(dynamic_cast<FileSender*>(pair.client.Get()), nullptr) << "client ends are TCP as well";

   std::string got;
   std::thread reader([&] { got = ReadAll(pair.client.Get(), _content.size()); });
   EXPECT_EQ(sender->SendFile(_fd, 0, static_cast<long long>(_content.size())),
             static_cast<long long>(_content.size()));
   reader.join();
   EXPECT_TRUE(got == _content) << "whole file differs";
   EXPECT_EQ(::lseek(_fd, 0, SEEK_CUR), 0) << "the descriptor's position moved";

   // A range from the middle, then a request past the end that gets what is there.
   reader = std::thread([&] { got = ReadAll(pair.client.Get(), 3000000 + 10); });
   EXPECT_EQ(sender->SendFile(_fd, 1234567, 3000000), 3000000);
   EXPECT_EQ(sender->SendFile(_fd, static_cast<long long>(_content.size()) - 10, 100), 10);
   reader.join();
   EXPECT_TRUE(got == _content.substr(1234567, 3000000) + _content.substr(_content.size() - 10));

   EXPECT_THROW(sender->SendFile(_fd, -1, 10), InvalidArgumentException);
   pair.client->Close();
   pair.accepted->Close();
   pair.server->Close();
}

TEST_F(TcpStreamTest, SlowReaderIsWaitedForOnTheIoServiceAndEveryByteArrives) {
   Connected pair = Connect();
   Squeeze(pair);
   auto* sender = dynamic_cast<FileSender*>(pair.accepted.Get());
   ASSERT_NE(sender, nullptr);
   // Nobody reads yet: the socket fills and the rest waits.
   long long now = sender->TrySendFile(_fd, 0, static_cast<long long>(_content.size()));
   EXPECT_GT(now, 0);
   EXPECT_LT(now, static_cast<long long>(_content.size()));
   Completion done;
   long long sent = -1;
   sender->AsyncSendFile(_fd, now, static_cast<long long>(_content.size()) - now,
                         [&](Stream*, Exception* error, long long n) {
                            sent = n;
                            done.Done(error, 0);
                         });
   EXPECT_EQ(done.Count(), 0);
   std::string got;
   got.reserve(_content.size());
   char piece[8192];
   // The reader takes small pieces with pauses; the sender holds no thread meanwhile.
   for (int i = 0; got.size() < _content.size(); ++i) {
      int n = pair.client->Read(piece, sizeof piece);
      ASSERT_GT(n, 0);
      got.append(piece, static_cast<size_t>(n));
      if (i % 64 == 0) std::this_thread::sleep_for(std::chrono::milliseconds(1));
   }
   ASSERT_TRUE(done.WaitCount(1));
   EXPECT_FALSE(done.Failed()) << done.Error();
   EXPECT_EQ(sent, static_cast<long long>(_content.size()) - now);
   EXPECT_TRUE(got == _content) << "bytes differ";
   pair.server->Close();
}

TEST_F(TcpStreamTest, WriteTimeOutAndCloseEndASendToAStalledReader) {
   long long tick = GetStreamTimeoutTick();
   SetStreamTimeoutTick(20000);
   NetTesting::DefaultLogCapture log;
   for (bool timeOut : {true, false}) {
      SCOPED_TRACE(timeOut ? "time-out" : "close");
      Connected pair = Connect();
      Squeeze(pair);
      auto* sender = dynamic_cast<FileSender*>(pair.accepted.Get());
      ASSERT_NE(sender, nullptr);
      if (timeOut) pair.accepted->SetWriteTimeout(100000, Service::Logger::LOG_WARNING, "file stalled");
      Completion done;
      sender->AsyncSendFile(_fd, 0, static_cast<long long>(_content.size()),
                            [&](Stream*, Exception* error, long long) { done.Done(error, 0); });
      if (!timeOut) {
         std::this_thread::sleep_for(std::chrono::milliseconds(50));
         EXPECT_EQ(done.Count(), 0);
         pair.accepted->Close();
      }
      ASSERT_TRUE(done.WaitCount(1));
      EXPECT_TRUE(done.Failed());
      if (timeOut) {
         EXPECT_TRUE(log.Contains("file stalled : Write timeout after approximately"));
      }
      pair.server->Close();
   }
   SetStreamTimeoutTick(tick);
}

}  // namespace
}  // namespace Pelmora::System
