// Server sockets and connections over loopback TCP (IPv4, IPv6) and Unix-domain sockets.

#include "src/net/socketImpl.h"

#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "tests/support/netFixture.h"

namespace Pelmora::System {
namespace {

using NetTesting::Completion;

bool CloseOnExec(int fd) { return (::fcntl(fd, F_GETFD) & FD_CLOEXEC) != 0; }

bool NoDelay(int fd) {
   int value = 0;
   socklen_t size = sizeof value;
   return ::getsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &value, &size) == 0 && value != 0;
}

int NativeOf(Stream* stream) {
   if (auto* tcp = dynamic_cast<GenericStream<boost::asio::ip::tcp::socket>*>(stream))
      return tcp->GetIo().native_handle();
   if (auto* local = dynamic_cast<GenericStream<boost::asio::local::stream_protocol::socket>*>(stream))
      return local->GetIo().native_handle();
   return -1;
}

// Echoes what `stream` reads until the peer ends it.
void Echo(Stream* stream) {
   char buffer[4096];
   for (;;) {
      int n = stream->Read(buffer, sizeof buffer);
      if (n == 0) break;
      stream->Write(buffer, n);
   }
   stream->Close();
}

// One round trip each synchronously and asynchronously, then the peer's end of stream.
void ExpectEcho(Stream* client) {
   char buffer[64] = {};
   ASSERT_EQ(5, client->Write("hello", 5));
   int got = 0;
   while (got < 5) got += client->Read(buffer + got, sizeof buffer - got);
   EXPECT_EQ("hello", std::string(buffer, 5));

   Completion written;
   Completion read;
   client->AsyncWrite("async!", 6, [&](Stream*, Exception* error) { written.Done(error, 6); });
   ASSERT_TRUE(written.WaitCount(1));
   EXPECT_FALSE(written.Failed()) << written.Error();
   client->AsyncRead(buffer, 6, [&](Stream*, Exception* error, int n) { read.Done(error, n); });
   ASSERT_TRUE(read.WaitCount(1));
   EXPECT_FALSE(read.Failed()) << read.Error();
   ASSERT_GT(read.Bytes(), 0);
   got = read.Bytes();
   while (got < 6) got += client->Read(buffer + got, 6 - got);
   EXPECT_EQ("async!", std::string(buffer, 6));
}

class SocketTest : public ::testing::Test {
protected:
   void SetUp() override { NetTesting::EnsurePool(); }
};

TEST_F(SocketTest, TcpEchoOverIPv4AndIPv6WithBindingInfo) {
   for (const char* host : {"127.0.0.1", "::1"}) {
      SCOPED_TRACE(host);
      Ref<ServerSocket> server;
      CreateTcpServerSocket(host, 0, ServerSocketOptions(), server);
      Ref<BindingInfo> listening;
      server->GetBindingInfo(listening);
      ASSERT_TRUE(listening);
      ASSERT_GT(listening->GetPort(), 0);
      EXPECT_EQ(host, listening->GetAddress());

      Completion accepted;
      Ref<Stream> serverSide;
      server->AsyncAccept([&](ServerSocket* s, Exception* error, Stream* stream) {
         EXPECT_EQ(server.Get(), s);
         serverSide = stream;
         accepted.Done(error, 0);
      });
      Ref<Stream> client;
      CreateTcpConnection(host, listening->GetPort(), 5000000, client);
      ASSERT_TRUE(accepted.WaitCount(1));
      ASSERT_FALSE(accepted.Failed()) << accepted.Error();
      ASSERT_TRUE(serverSide);
      std::thread echo([&] { Echo(serverSide.Get()); });

      // Both ends see each other's address and port.
      Ref<BindingInfo> local;
      Ref<BindingInfo> peer;
      client->GetBindingInfo(typeid(InetBindingInfo), local, peer);
      ASSERT_TRUE(local && peer);
      EXPECT_EQ(listening->GetPort(), peer->GetPort());
      EXPECT_EQ(host, peer->GetAddress());
      EXPECT_EQ(std::string(host) == "::1", dynamic_cast<InetBindingInfo*>(peer.Get())->IsV6());
      Ref<BindingInfo> serverLocal;
      Ref<BindingInfo> serverPeer;
      serverSide->GetBindingInfo(typeid(BindingInfo), serverLocal, serverPeer);
      ASSERT_TRUE(serverLocal && serverPeer);
      EXPECT_EQ(local->GetPort(), serverPeer->GetPort());
      // A type the stream does not have leaves both empty.
      client->GetBindingInfo(typeid(LocalBindingInfo), local, peer);
      EXPECT_FALSE(local);
      EXPECT_FALSE(peer);
      EXPECT_NE(std::string::npos, client->ToString().find("tcp ")) << client->ToString();

      ExpectEcho(client.Get());
      client->Close();
      echo.join();
      server->Close();
   }
}

// IPv4 addresses are written out digit by digit: every width of each of the four parts.
TEST(BindingInfoTest, AddressTextsMatchTheNumericForm) {
   using boost::asio::ip::make_address;
   for (const char* text : {"0.0.0.0", "255.255.255.255", "10.0.100.9", "1.20.3.101", "127.0.0.1",
                            "99.100.199.200", "::1", "fe80::1:2", "::ffff:1.2.3.4"}) {
      Ref<BindingInfo> info = MakeBindingInfo(boost::asio::ip::tcp::endpoint(make_address(text), 8080));
      EXPECT_EQ(info->GetAddress(), text);
      EXPECT_EQ(info->GetPort(), 8080);
      EXPECT_EQ(dynamic_cast<InetBindingInfo*>(info.Get())->IsV6(), std::string(text).find(':') != std::string::npos);
   }
}

TEST_F(SocketTest, UnixDomainEchoAndStaleSocketFile) {
   std::string path = ::testing::TempDir() + "pelmora_socket_test_" + std::to_string(::getpid());
   ::unlink(path.c_str());
   Ref<ServerSocket> server;
   CreateLocalServerSocket(path, ServerSocketOptions(), server);
   Ref<Stream> serverSide;
   std::thread acceptor([&] { server->Accept(5000000, serverSide); });
   Ref<Stream> client;
   CreateLocalConnection(path, 5000000, client);
   acceptor.join();
   ASSERT_TRUE(serverSide);
   EXPECT_EQ(nullptr, dynamic_cast<FileSender*>(serverSide.Get())) << "only TCP streams send files";
   std::thread echo([&] { Echo(serverSide.Get()); });
   Ref<BindingInfo> local;
   Ref<BindingInfo> peer;
   serverSide->GetBindingInfo(typeid(LocalBindingInfo), local, peer);
   ASSERT_TRUE(local);
   EXPECT_EQ(path, local->GetAddress());
   EXPECT_EQ(-1, local->GetPort());
   ExpectEcho(client.Get());
   client->Close();
   echo.join();
   server->Close();

   // The socket file is left behind; a new server replaces it only when asked to.
   ServerSocketOptions strict;
   strict.reuseAddress = false;
   EXPECT_THROW(CreateLocalServerSocket(path, strict, server), SystemException);
   CreateLocalServerSocket(path, ServerSocketOptions(), server);
   // ... but never takes the path from a live server.
   Ref<ServerSocket> second;
   EXPECT_THROW(CreateLocalServerSocket(path, ServerSocketOptions(), second), SystemException);
   server->Close();
   ::unlink(path.c_str());
}

TEST_F(SocketTest, SocketsAreCloseOnExecWithoutDelayAndAddressesReusable) {
   Ref<ServerSocket> server;
   CreateTcpServerSocket("127.0.0.1", 0, ServerSocketOptions(), server);
   auto* impl = dynamic_cast<ServerSocketImpl<boost::asio::ip::tcp>*>(server.Get());
   ASSERT_NE(nullptr, impl);
   EXPECT_TRUE(CloseOnExec(impl->GetNativeHandle()));
   Ref<BindingInfo> listening;
   server->GetBindingInfo(listening);
   int port = listening->GetPort();

   Ref<Stream> serverSide;
   std::thread acceptor([&] { server->Accept(5000000, serverSide); });
   Ref<Stream> client;
   CreateTcpConnection("127.0.0.1", port, 5000000, client);
   acceptor.join();
   ASSERT_TRUE(serverSide);
   EXPECT_TRUE(CloseOnExec(NativeOf(client.Get())));
   EXPECT_TRUE(CloseOnExec(NativeOf(serverSide.Get())));
   EXPECT_TRUE(NoDelay(NativeOf(client.Get())));
   EXPECT_TRUE(NoDelay(NativeOf(serverSide.Get())));

   // The server side closes first, leaving its end in TIME_WAIT; SO_REUSEADDR lets a
   // new server bind the same port at once.
   serverSide->Close();
   char byte;
   EXPECT_EQ(0, client->Read(&byte, 1));
   client->Close();
   server->Close();
   Ref<ServerSocket> again;
   EXPECT_NO_THROW(CreateTcpServerSocket("127.0.0.1", port, ServerSocketOptions(), again));
   // Two listeners on one port are still refused.
   Ref<ServerSocket> clash;
   EXPECT_THROW(CreateTcpServerSocket("127.0.0.1", port, ServerSocketOptions(), clash), SystemException);
}

TEST_F(SocketTest, AcceptAndConnectFailuresAndTimeOuts) {
   Ref<ServerSocket> server;
   ServerSocketOptions options;
   options.backlog = 0;
   CreateTcpServerSocket("127.0.0.1", 0, options, server);
   Ref<BindingInfo> listening;
   server->GetBindingInfo(listening);

   Ref<Stream> none;
   try {
      server->Accept(20000, none);
      FAIL() << "no time-out";
   } catch (const TimeoutException& e) {
      EXPECT_STREQ("Operation timed out", e.what());
   }
   // The timed-out accept is over; a new one may start, and only one at a time.
   server->AsyncAccept([](ServerSocket*, Exception*, Stream*) {});
   EXPECT_THROW(server->AsyncAccept([](ServerSocket*, Exception*, Stream*) {}), InProgressException);
   server->Close();
   EXPECT_THROW(server->AsyncAccept([](ServerSocket*, Exception*, Stream*) {}), InvalidStateException);

   // Nobody listens on a closed server's port.
   Ref<Stream> client;
   EXPECT_THROW(CreateTcpConnection("127.0.0.1", listening->GetPort(), 5000000, client), SystemException);
   EXPECT_THROW(CreateLocalConnection("/nonexistent/pelmora.sock", 5000000, client), SystemException);
   EXPECT_THROW(CreateTcpConnection("no-such-host.invalid", 80, 5000000, client), NotFoundException);
}

TEST_F(SocketTest, ConnectGivesUpAtItsTimeOutWhenTheBacklogIsFull) {
   Ref<ServerSocket> server;
   ServerSocketOptions options;
   options.backlog = 0;
   CreateTcpServerSocket("127.0.0.1", 0, options, server);
   Ref<BindingInfo> listening;
   server->GetBindingInfo(listening);
   // Nobody accepts: the kernel's queue fills and later handshakes go unanswered.
   std::vector<Ref<Stream>> queued;
   bool timedOut = false;
   for (int i = 0; i < 16 && !timedOut; ++i) {
      Ref<Stream> client;
      auto start = std::chrono::steady_clock::now();
      try {
         CreateTcpConnection("127.0.0.1", listening->GetPort(), 50000, client);
         queued.push_back(client);
      } catch (const TimeoutException&) {
         timedOut = true;
         EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
      }
   }
   EXPECT_TRUE(timedOut) << queued.size() << " connections queued without a time-out";
}

}  // namespace
}  // namespace Pelmora::System
