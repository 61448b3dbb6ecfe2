// TLS over loopback with throw-away certificates made by the openssl command: echo,
// verification against the right and the wrong CA, bad settings, and no leaked
// descriptors after a failed handshake.

#include <dirent.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "tests/support/netFixture.h"

namespace Pelmora::System {
namespace {

using NetTesting::Completion;

// A CA, a server certificate it signed for localhost and 127.0.0.1, and an unrelated CA.
struct Certificates {
   std::string dir;
   bool ok = false;
   std::string Path(const char* name) const { return dir + "/" + name; }
};

const Certificates& GetCertificates() {
   static Certificates certificates = [] {
      Certificates made;
      made.dir = ::testing::TempDir() + "pelmora_tls_" + std::to_string(::getpid());
      std::string d = made.dir;
      std::ofstream(d + ".ext") << "subjectAltName=DNS:localhost,IP:127.0.0.1\n";
      std::string key = " -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes";
      std::string script =
          "set -e; mkdir -p " + d + "; cd " + d + "; mv " + d + ".ext ext.cnf;" +
          " openssl req -x509" + key + " -keyout ca.key -out ca.pem -days 2 -subj /CN=PelmoraTestCA;" +
          " openssl req -x509" + key + " -keyout other.key -out other.pem -days 2 -subj /CN=OtherCA;" +
          " openssl req" + key + " -keyout server.key -out server.csr -subj /CN=localhost;" +
          " openssl x509 -req -in server.csr -CA ca.pem -CAkey ca.key -CAcreateserial" +
          " -out server.pem -days 2 -extfile ext.cnf";
      made.ok = std::system(("(" + script + ") >/dev/null 2>&1").c_str()) == 0;
      return made;
   }();
   return certificates;
}

// This process's descriptors; with `port`, only those on IPv4 TCP sockets bound to local
// `port`: the listener and the server ends of its connections.
int CountDescriptors(int port = -1) {
   std::set<std::string> inodes;
   std::ifstream table("/proc/net/tcp");
   std::string line;
   std::getline(table, line);
   while (port >= 0 && std::getline(table, line)) {
      std::istringstream fields(line);
      std::string slot, local, remote, state, queues, timer, retransmits, uid, timeout, inode;
      fields >> slot >> local >> remote >> state >> queues >> timer >> retransmits >> uid >> timeout >> inode;
      size_t colon = local.find(':');
      if (colon != std::string::npos && std::stoi(local.substr(colon + 1), nullptr, 16) == port) {
         inodes.insert("socket:[" + inode + "]");
      }
   }
   int count = 0;
   DIR* dir = ::opendir("/proc/self/fd");
   while (dirent* entry = ::readdir(dir)) {
      if (entry->d_name[0] == '.') continue;
      char target[64] = {};
      std::string path = std::string("/proc/self/fd/") + entry->d_name;
      if (port < 0 || (::readlink(path.c_str(), target, sizeof target - 1) > 0 && inodes.count(target) != 0))
         ++count;
   }
   ::closedir(dir);
   return count;
}

class SslStreamTest : public ::testing::Test {
protected:
   void SetUp() override {
      NetTesting::EnsurePool();
      const Certificates& certificates = GetCertificates();
      ASSERT_TRUE(certificates.ok) << "the openssl command could not make certificates";
      serverContext = ServerContext(kSslDefaultMinVersion);
      port = Listen(ServerSocketOptions(), serverContext.Get(), server);
   }
   void TearDown() override {
      if (server) server->Close();
   }

   static Ref<SslContext> ServerContext(const char* minVersion) {
      SslServerOptions options;
      options.certificateChainFile = GetCertificates().Path("server.pem");
      options.privateKeyFile = GetCertificates().Path("server.key");
      options.minVersion = minVersion;
      Ref<SslContext> context;
      CreateSslServerContext(options, context);
      return context;
   }
   // A TLS server socket on a free loopback port; returns the port.
   static int Listen(const ServerSocketOptions& options, SslContext* context,
                     Ref<ServerSocket>& out) {
      CreateSslServerSocket("127.0.0.1", 0, options, context, out);
      return PortOf(out.Get());
   }
   static int PortOf(ServerSocket* socket) {
      Ref<BindingInfo> listening;
      socket->GetBindingInfo(listening);
      return listening->GetPort();
   }
   // The port of `stream`'s peer end, or of its own end.
   static int PortOf(Stream* stream, bool peerEnd) {
      Ref<BindingInfo> local;
      Ref<BindingInfo> peer;
      stream->GetBindingInfo(typeid(InetBindingInfo), local, peer);
      return peerEnd ? peer->GetPort() : local->GetPort();
   }
   static Functor<void, ServerSocket*, Exception*, Stream*> Into(Completion& done) {
      return [&done](ServerSocket*, Exception* error, Stream*) { done.Done(error, 0); };
   }

   Ref<SslContext> ClientContext(const char* caName) {
      SslClientOptions options;
      options.caFile = GetCertificates().Path(caName);
      Ref<SslContext> context;
      CreateSslClientContext(options, context);
      return context;
   }

   Ref<SslContext> serverContext;
   Ref<ServerSocket> server;
   int port = 0;
};

TEST_F(SslStreamTest, EchoSynchronousAndAsynchronousAfterVerifiedHandshake) {
   Completion accepted;
   Ref<Stream> serverSide;
   server->AsyncAccept([&](ServerSocket*, Exception* error, Stream* stream) {
      serverSide = stream;
      accepted.Done(error, 0);
   });
   Ref<SslContext> client = ClientContext("ca.pem");
   Ref<Stream> stream;
   CreateSslConnection("127.0.0.1", port, 10000000, client.Get(), stream);
   ASSERT_TRUE(accepted.WaitCount(1));
   ASSERT_FALSE(accepted.Failed()) << accepted.Error();
   std::thread echo([&] {
      char buffer[8192];
      for (;;) {
         int n = serverSide->Read(buffer, sizeof buffer);
         if (n == 0) break;
         serverSide->Write(buffer, n);
      }
      serverSide->Close();
   });
   EXPECT_NE(std::string::npos, stream->ToString().find("tls 127.0.0.1:")) << stream->ToString();
   EXPECT_EQ(port, PortOf(stream.Get(), true));

   // 200 KiB both ways at once: reads and writes share the TLS engine.
   std::string big(200 * 1024, 0);
   for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7);
   std::string back;
   Completion wrote;
   stream->AsyncWrite(big.data(), static_cast<int>(big.size()),
                      [&](Stream*, Exception* error) { wrote.Done(error, 0); });
   char buffer[8192];
   while (back.size() < big.size()) {
      int n = stream->Read(buffer, sizeof buffer);
      ASSERT_GT(n, 0);
      back.append(buffer, n);
   }
   ASSERT_TRUE(wrote.WaitCount(1));
   EXPECT_FALSE(wrote.Failed()) << wrote.Error();
   EXPECT_TRUE(big == back);

   stream->Close();
   echo.join();
}

TEST_F(SslStreamTest, WrongCaFailsTheHandshakeOnBothSidesWithoutLeaks) {
   Ref<SslContext> wrong = ClientContext("other.pem");
   // Warm up the pool and the resolver so that their descriptors are counted before.
   std::vector<Ref<InetBindingInfo>> ignored;
   ResolveAddress("127.0.0.1", port, false, ignored);
   int before = CountDescriptors();
   for (int i = 0; i < 3; ++i) {
      Completion accepted;
      server->AsyncAccept(Into(accepted));
      Ref<Stream> stream;
      try {
         CreateSslConnection("127.0.0.1", port, 10000000, wrong.Get(), stream);
         FAIL() << "the handshake succeeded";
      } catch (const SslException& e) {
         EXPECT_NE(std::string::npos, std::string(e.what()).find("certificate verify failed")) << e.what();
      }
      EXPECT_FALSE(stream);
      ASSERT_TRUE(accepted.WaitCount(1));
      EXPECT_TRUE(accepted.Failed());
      EXPECT_EQ(0u, accepted.Error().rfind("SSL error: ", 0)) << accepted.Error();
   }
   // The server side lets go of a failed connection on a pool thread, soon after.
   EXPECT_TRUE(NetTesting::WaitFor([&] { return CountDescriptors() <= before; }, "descriptors released"))
       << CountDescriptors() << " descriptors open, " << before << " before";

   // The certificate names localhost and 127.0.0.1, nothing else.
   SslClientOptions options;
   options.caFile = GetCertificates().Path("ca.pem");
   options.serverName = "elsewhere.example";
   Ref<SslContext> misnamed;
   CreateSslClientContext(options, misnamed);
   Completion accepted;
   server->AsyncAccept(Into(accepted));
   Ref<Stream> stream;
   EXPECT_THROW(CreateSslConnection("127.0.0.1", port, 10000000, misnamed.Get(), stream), SslException);
   ASSERT_TRUE(accepted.WaitCount(1));
}

TEST_F(SslStreamTest, AStalledHandshakeTimesOutOnBothSides) {
   ServerSocketOptions options;
   options.handshakeTimeoutMicroseconds = 30000;
   Ref<ServerSocket> slow;
   int slowPort = Listen(options, serverContext.Get(), slow);
   Completion accepted;
   slow->AsyncAccept(Into(accepted));
   // A plain TCP client that never speaks TLS.
   Ref<Stream> silent;
   CreateTcpConnection("127.0.0.1", slowPort, 5000000, silent);
   ASSERT_TRUE(accepted.WaitCount(1));
   EXPECT_TRUE(accepted.Failed());
   EXPECT_EQ(0u, accepted.Error().rfind("SSL error: ", 0)) << accepted.Error();
   slow->Close();

   // A TLS client against a plain server that never answers gives up at its time-out.
   Ref<ServerSocket> plain;
   CreateTcpServerSocket("127.0.0.1", 0, ServerSocketOptions(), plain);
   Ref<Stream> stream;
   EXPECT_THROW(CreateSslConnection("127.0.0.1", PortOf(plain.Get()), 30000,
                                    ClientContext("ca.pem").Get(), stream),
                TimeoutException);
   plain->Close();
}

TEST_F(SslStreamTest, ASilentClientHoldsUpOtherHandshakesOnlyAtTheLimit) {
   using Clock = std::chrono::steady_clock;
   Ref<SslContext> client = ClientContext("ca.pem");
   // With room for more, a client that never sends a ClientHello does not delay the next
   // one; with room for one, it takes the only slot until its handshake times out.
   for (int limit : {4, 1}) {
      SCOPED_TRACE("limit " + std::to_string(limit));
      ServerSocketOptions options;
      options.maxPendingAccepts = limit;
      long long timeout = limit == 1 ? 200000 : 3000000;
      options.handshakeTimeoutMicroseconds = timeout;
      Ref<ServerSocket> socket;
      int socketPort = Listen(options, serverContext.Get(), socket);
      Ref<Stream> silent;
      CreateTcpConnection("127.0.0.1", socketPort, 5000000, silent);

      auto started = Clock::now();
      Completion first;
      Ref<Stream> firstStream;
      socket->AsyncAccept([&](ServerSocket*, Exception* error, Stream* stream) {
         firstStream = stream;
         first.Done(error, 0);
      });
      // The client connects on another thread (joined when the scope ends, also on a failed
      // assertion); the test waits for the server side first.
      Ref<Stream> tlsStream;
      std::string failure;
      std::jthread tls([&] {
         try {
            CreateSslConnection("127.0.0.1", socketPort, 10000000, client.Get(), tlsStream);
         } catch (const Exception& e) {
            failure = e.GetMessage();
         }
      });
      ASSERT_TRUE(first.WaitCount(1));
      if (limit > 1) {
         EXPECT_FALSE(first.Failed()) << first.Error();
         EXPECT_LT(Clock::now() - started, std::chrono::microseconds(timeout));
      } else {
         EXPECT_TRUE(first.Failed());
         EXPECT_EQ(0u, first.Error().rfind("SSL error: ", 0)) << first.Error();
         Ref<Stream> second;
         socket->Accept(5000000, second);
         EXPECT_TRUE(second);
      }
      tls.join();
      EXPECT_EQ("", failure);
      EXPECT_TRUE(tlsStream);
      if (tlsStream) tlsStream->Close();
      if (firstStream) firstStream->Close();
      silent->Close();
      socket->Close();
   }
}

TEST_F(SslStreamTest, HandshakesFinishWithoutAWaitingAcceptAndQueue) {
   // An accept that times out starts the background accepting and leaves it running.
   Ref<Stream> none;
   EXPECT_THROW(server->Accept(20000, none), TimeoutException);
   Ref<SslContext> client = ClientContext("ca.pem");
   std::map<int, Ref<Stream>> clients;  // by local port
   for (int i = 0; i < 3; ++i) {
      Ref<Stream> stream;
      CreateSslConnection("127.0.0.1", port, 5000000, client.Get(), stream);
      clients[PortOf(stream.Get(), false)] = stream;
   }
   // Each queued stream is the server end of one of the clients, and works.
   for (int i = 0; i < 3; ++i) {
      Ref<Stream> accepted;
      server->Accept(5000000, accepted);
      ASSERT_TRUE(accepted);
      auto match = clients.find(PortOf(accepted.Get(), true));
      ASSERT_NE(clients.end(), match) << accepted->ToString();
      match->second->Write("x", 1);
      char byte = 0;
      EXPECT_EQ(1, accepted->Read(&byte, 1));
      EXPECT_EQ('x', byte);
      accepted->Close();
      match->second->Close();
      clients.erase(match);
   }
}

TEST_F(SslStreamTest, CloseEndsHandshakesAndDropsQueuedStreamsWithoutLeaks) {
   Ref<SslContext> client = ClientContext("ca.pem");
   Completion outstanding;
   // One socket with a finished stream nobody took, one with an accept waiting; both
   // with silent clients in handshake (the default time-out: far away).
   Ref<ServerSocket> queued;
   Ref<ServerSocket> waiting;
   int queuedPort = Listen(ServerSocketOptions(), serverContext.Get(), queued);
   int waitingPort = Listen(ServerSocketOptions(), serverContext.Get(), waiting);

   Ref<Stream> none;
   EXPECT_THROW(queued->Accept(1000, none), TimeoutException);
   Ref<Stream> tls;
   CreateSslConnection("127.0.0.1", queuedPort, 5000000, client.Get(), tls);
   waiting->AsyncAccept(Into(outstanding));
   std::vector<Ref<Stream>> silent(4);
   for (size_t i = 0; i < silent.size(); ++i) {
      CreateTcpConnection("127.0.0.1", i % 2 == 0 ? queuedPort : waitingPort, 5000000, silent[i]);
   }
   // Listener, the TLS stream and two in handshake; listener and two in handshake.
   ASSERT_TRUE(NetTesting::WaitFor(
       [&] { return CountDescriptors(queuedPort) == 4 && CountDescriptors(waitingPort) == 3; },
       "connections accepted"))
       << CountDescriptors(queuedPort) << " " << CountDescriptors(waitingPort);
   EXPECT_EQ(0, outstanding.Count());

   queued->Close();
   waiting->Close();
   EXPECT_THROW(queued->AsyncAccept([](ServerSocket*, Exception*, Stream*) {}), InvalidStateException);
   EXPECT_TRUE(NetTesting::WaitFor(
       [&] { return CountDescriptors(queuedPort) + CountDescriptors(waitingPort) == 0; },
       "descriptors released"))
       << CountDescriptors(queuedPort) << " " << CountDescriptors(waitingPort);
   ASSERT_TRUE(outstanding.WaitCount(1));
   EXPECT_TRUE(outstanding.Failed());
   // The queued stream was closed, not just forgotten: its client hears the end.
   char byte = 0;
   EXPECT_EQ(0, tls->Read(&byte, 1));
   tls->Close();
   for (Ref<Stream>& stream : silent) stream->Close();
   EXPECT_EQ(1, outstanding.Count());
}

TEST_F(SslStreamTest, BadSettingsAreSslExceptions) {
   const Certificates& certificates = GetCertificates();
   Ref<SslContext> context;
   SslServerOptions options;
   options.certificateChainFile = certificates.Path("server.pem");
   options.privateKeyFile = certificates.Path("other.key");  // not the certificate's key
   EXPECT_THROW(CreateSslServerContext(options, context), SslException);
   options.privateKeyFile = certificates.Path("server.key");
   options.certificateChainFile = certificates.Path("missing.pem");
   EXPECT_THROW(CreateSslServerContext(options, context), SslException);
   options.certificateChainFile = certificates.Path("server.pem");
   options.minVersion = "TLSv1.0";
   EXPECT_THROW(CreateSslServerContext(options, context), SslException);
   options.minVersion = "TLSv1.2";
   options.cipherList = "NO-SUCH-CIPHER";
   EXPECT_THROW(CreateSslServerContext(options, context), SslException);

   SslClientOptions client;
   client.caFile = certificates.Path("missing.pem");
   EXPECT_THROW(CreateSslClientContext(client, context), SslException);
   // A client context cannot serve, nor a server context connect.
   Ref<ServerSocket> socket;
   EXPECT_THROW(CreateSslServerSocket("127.0.0.1", 0, ServerSocketOptions(), ClientContext("ca.pem").Get(), socket),
                InvalidArgumentException);
   Ref<Stream> stream;
   EXPECT_THROW(CreateSslConnection("127.0.0.1", port, 1000000, serverContext.Get(), stream),
                InvalidArgumentException);
}

TEST_F(SslStreamTest, MinimumVersionIsEnforced) {
   // A server that wants TLS 1.3 refuses a TLS 1.2 client, and takes a TLS 1.3 one.
   Ref<SslContext> strict = ServerContext("TLSv1.3");
   Ref<ServerSocket> strictServer;
   int strictPort = Listen(ServerSocketOptions(), strict.Get(), strictServer);
   for (const char* version : {"-tls1_2", "-tls1_3"}) {
      Completion accepted;
      strictServer->AsyncAccept(Into(accepted));
      std::string command = "openssl s_client -connect 127.0.0.1:" + std::to_string(strictPort) +
                            " " + version + " </dev/null >/dev/null 2>&1";
      int status = std::system(command.c_str());
      ASSERT_TRUE(accepted.WaitCount(1));
      if (std::string(version) == "-tls1_2") {
         EXPECT_NE(0, status);
         EXPECT_TRUE(accepted.Failed());
      } else {
         EXPECT_FALSE(accepted.Failed()) << accepted.Error();
      }
   }
   strictServer->Close();
}

}  // namespace
}  // namespace Pelmora::System
