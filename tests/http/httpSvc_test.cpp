#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <memory>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/httpSvc.h"
#include "pelmora/service/config.h"
#include "pelmora/system/ssl.h"
#include "src/http/httpSvcImpl.h"
#include "tests/support/configViews.h"
#include "tests/support/httpClient.h"
#include "tests/support/netFixture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::Http {
namespace {

using System::NetTesting::DefaultLogCapture;
using System::NetTesting::EnsurePool;
using System::NetTesting::WaitFor;
using Testing::RawClient;
using Testing::RunCommand;

class Handler : public RequestHandlerMixin, public ObjectImpl {
public:
   explicit Handler(std::string name) : _name(std::move(name)) {}
   void HandleGet(Request* request, Response* response) override {
      if (request->GetPath() == "/slow") {
         started = true;
         std::this_thread::sleep_for(std::chrono::milliseconds(300));
      }
      if (request->GetPath() == "/fail") throw InvalidStateException("handler broke");
      if (request->GetPath() == "/file") {
         int fd = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
         if (fd < 0) throw SystemException(errno);
         struct stat info {};
         ::fstat(fd, &info);
         try {
            response->SendFile(fd, 0, info.st_size);
         } catch (...) {
            ::close(fd);
            throw;
         }
         ::close(fd);
         return;
      }
      std::string text = _name + " " + request->GetPath();
      response->GetHeader().SetContentType("text/plain");
      response->Write(text.data(), static_cast<int>(text.size()));
      response->Complete();
   }
   void HandlePost(Request* request, Response* response) override {
      std::string body;
      char piece[4096];
      for (int n; (n = request->Read(piece, sizeof piece)) > 0;) body.append(piece, static_cast<size_t>(n));
      std::string text = "posted " + std::to_string(body.size()) + " " + body.substr(0, 32);
      response->Write(text.data(), static_cast<int>(text.size()));
      response->Complete();
   }
   std::atomic<bool> started{false};
   std::string file;  // served at /file

private:
   std::string _name;
};

Ref<Service::Logger> TestLogger() {
   static Ref<Service::Logger> logger = [] {
      Ref<Service::Logger> made;
      Service::GetDefaultLogger()->CreateLogger("httpTest", 0x7F, made);
      return made;
   }();
   return logger;
}

Ref<Service::Config::View> Settings(const std::vector<std::pair<std::string, std::string>>& values) {
   return TestSupport::ScratchView("pelmora/http", values);
}

class HttpSvcTest : public ::testing::Test {
protected:
   void SetUp() override { EnsurePool(); }
   void TearDown() override {
      if (_svc) _svc->Stop();
   }
   void StartServer(const std::vector<std::pair<std::string, std::string>>& values = {}) {
      Ref<System::ServerSocket> socket;
      System::CreateTcpServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), socket);
      Ref<System::BindingInfo> local;
      socket->GetBindingInfo(local);
      _port = local->GetPort();
      CreateHttpSvc(socket.Get(), TestLogger().Get(), Settings(values).Get(), _svc);
      _default = new Handler("default");
      _sdk = new Handler("sdk");
      _svc->SetRequestHandler(_default.Get());
      _svc->AddRequestHandler("/sdk", _sdk.Get());
      _svc->Start();
   }
   std::string Url(const std::string& path) { return "http://127.0.0.1:" + std::to_string(_port) + path; }
   std::string Get(const std::string& path) {
      RawClient client(_port);
      client.Send("GET " + path + " HTTP/1.1\r\nHost: x\r\nConnection: close\r\n\r\n");
      return client.ReadResponse();
   }

   Ref<HttpSvc> _svc;
   Ref<Handler> _default;
   Ref<Handler> _sdk;
   int _port = 0;
};

TEST(LookupByPrefixTest, ShorterPrefixesAreTriedInOrder) {
   Ref<RequestHandler> a(new Handler("a")), root(new Handler("root")), ab(new Handler("ab"));
   RequestHandlerMap handlers{{"/sdk", a}, {"/", root}, {"/a/b", ab}};
   Ref<RequestHandler> out;
   EXPECT_TRUE(LookupByPrefix("/sdk/", handlers, out));
   EXPECT_EQ(out, a);
   EXPECT_TRUE(LookupByPrefix("/sdk?x=1", handlers, out));
   EXPECT_EQ(out, a);
   EXPECT_TRUE(LookupByPrefix("/sdk/deeper/more#frag", handlers, out));
   EXPECT_EQ(out, a);
   EXPECT_TRUE(LookupByPrefix("/a/b/", handlers, out));
   EXPECT_EQ(out, ab);
   // "/" is only ever an exact match.
   EXPECT_TRUE(LookupByPrefix("/", handlers, out));
   EXPECT_EQ(out, root);
   EXPECT_FALSE(LookupByPrefix("/other", handlers, out));
   EXPECT_FALSE(LookupByPrefix("/sdkx", handlers, out));
   EXPECT_FALSE(LookupByPrefix("", handlers, out));
   EXPECT_FALSE(LookupByPrefix("noslash", handlers, out));
}

TEST(LookupByPrefixTest, LogsEachCandidate) {
   DefaultLogCapture log;
   RequestHandlerMap handlers{{"/a", Ref<RequestHandler>(new Handler("a"))}};
   Ref<RequestHandler> out;
   LookupByPrefix("/a/b/", handlers, out, TestLogger().Get());
   std::string text = log.Text();
   EXPECT_NE(text.find("Lookup handler by prefix for: /a/b/"), std::string::npos);
   size_t first = text.find("Inspecting path: /a/b/"), second = text.find("Inspecting path: /a/b\n");
   EXPECT_NE(first, std::string::npos);
   EXPECT_NE(second, std::string::npos);
   EXPECT_LT(first, second);
   EXPECT_NE(text.find("Found matching path: /a"), std::string::npos);
}

TEST(HttpSvcConfigTest, DefaultsAndOverrides) {
   HttpSvcConfig defaults(TestLogger().Get(), nullptr);
   EXPECT_EQ(defaults.defaultReadTimeout, 45000000);
   EXPECT_EQ(defaults.defaultWriteTimeout, 45000000);
   EXPECT_EQ(defaults.authenticatedReadTimeout, 1200000000LL);
   EXPECT_EQ(defaults.authenticatedWriteTimeout, 1800000000LL);
   EXPECT_TRUE(defaults.xFrameOptionsEnabled);
   EXPECT_EQ(defaults.xFrameOptions, "DENY");

   DefaultLogCapture log;
   HttpSvcConfig set(TestLogger().Get(), Settings({{"readTimeoutMs", "-1"},
                                                   {"writeTimeoutMs", "0"},
                                                   {"authenticatedReadTimeoutMs", "250"},
                                                   {"maxBufferedResponseBytes", "4096"},
                                                   {"XFrameOptionsHeader", "ALLOW-FROM https://a.example"},
                                                   {"EnableXFrameOptionsHeader", "false"}})
                                              .Get());
   EXPECT_EQ(set.defaultReadTimeout, -1);
   EXPECT_EQ(set.defaultWriteTimeout, 0);
   EXPECT_EQ(set.authenticatedReadTimeout, 250000);
   EXPECT_EQ(set.maxBufferedResponseBytes, 4096);
   EXPECT_EQ(set.xFrameOptions, "ALLOW-FROM https://a.example");
   EXPECT_FALSE(set.xFrameOptionsEnabled);
   // The line is exactly the format's: the value, then its unit or "disabled".
   EXPECT_TRUE(log.Contains("Setting readTimeoutMs to -1 disabled\n"));
   EXPECT_TRUE(log.Contains("Setting writeTimeoutMs to 0 ms"));
   EXPECT_TRUE(log.Contains("Setting authenticatedReadTimeoutMs to 250 ms"));
   EXPECT_TRUE(log.Contains("Max buffered response size is 4096 bytes"));
}

TEST(HttpSvcConfigTest, BadFrameOptionsAndAgentExpressionsFallBack) {
   EnsurePool();
   DefaultLogCapture log;
   HttpSvcConfig frame(TestLogger().Get(), Settings({{"XFrameOptionsHeader", "allow"}}).Get());
   EXPECT_EQ(frame.xFrameOptions, "DENY");
   EXPECT_TRUE(log.Contains(
       "Invalid value provided for X-Frame-Options response header: allow. Set to default value."));

   Ref<HttpSvc> svc;
   CreateHttpSvc(nullptr, TestLogger().Get(),
                 Settings({{"nonChunkingAgents", "Bad(Agent"}, {"agentsNeedingContentLength", ""}}).Get(), svc);
   auto* impl = dynamic_cast<HttpSvcImpl*>(svc.Get());
   EXPECT_TRUE(log.Contains("Unable to parse nonChunkingAgents: 'Bad(Agent'.  Using default: '"));
   EXPECT_TRUE(log.Contains("Parameter agentsNeedingContentLength is empty"));
   EXPECT_TRUE(impl->IsNonChunkingAgent("Norvex-desktop/7.1"));
   EXPECT_FALSE(impl->IsNonChunkingAgent("curl/8.0 Norvex-desktop/7.1"));
   EXPECT_FALSE(impl->NeedsContentLength("Norvex-client/3.2"));

   CreateHttpSvc(nullptr, TestLogger().Get(), Settings({{"agentsNeedingContentLength", "Tool/.*"}}).Get(), svc);
   EXPECT_TRUE(log.Contains("Loaded agentsNeedingContentLength: 'Tool/.*'"));
   EXPECT_TRUE(log.Contains("Using default for nonChunkingAgents: '"));
   EXPECT_TRUE(dynamic_cast<HttpSvcImpl*>(svc.Get())->NeedsContentLength("Tool/1"));
}

// The answer remembered for the last agent must not leak to the next, different one.
TEST(HttpSvcConfigTest, ClassifiedAgentsKeepTheirOwnAnswers) {
   EnsurePool();
   Ref<HttpSvc> svc;
   CreateHttpSvc(nullptr, TestLogger().Get(), Settings({{"agentsNeedingContentLength", "Tool/.*"}}).Get(), svc);
   auto* impl = dynamic_cast<HttpSvcImpl*>(svc.Get());
   struct Case {
      const char* agent;
      bool nonChunking;
      bool needsLength;
   } cases[] = {{"Norvex-desktop/7.1", true, false}, {"Norvex-desktop/7.1", true, false},
                {"Tool/2", false, true},             {"curl/8.0", false, false},
                {"Norvex-desktop/7.1", true, false}, {"Tool/2", false, true}};
   for (const Case& c : cases) {
      bool nonChunking = !c.nonChunking, needsLength = !c.needsLength;
      impl->ClassifyAgent(c.agent, nonChunking, needsLength);
      EXPECT_EQ(nonChunking, c.nonChunking) << c.agent;
      EXPECT_EQ(needsLength, c.needsLength) << c.agent;
   }
}

TEST_F(HttpSvcTest, StartRefusesWithoutSocketOrHandlerAndDescribesItself) {
   Ref<HttpSvc> svc;
   CreateHttpSvc(nullptr, TestLogger().Get(), nullptr, svc);
   try {
      svc->Start();
      ADD_FAILURE() << "started without a socket";
   } catch (const InvalidStateException& e) {
      EXPECT_EQ(e.GetMessage(), "ServerSocket not set");
   }
   Ref<System::ServerSocket> socket;
   System::CreateTcpServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), socket);
   CreateHttpSvc(socket.Get(), TestLogger().Get(), nullptr, svc);
   try {
      svc->Start();
      ADD_FAILURE() << "started without a handler";
   } catch (const InvalidStateException& e) {
      EXPECT_EQ(e.GetMessage(), "No RequestHandler has been set");
   }
   std::string text = svc->ToString();
   EXPECT_EQ(text.rfind("HttpSvcImpl @0x", 0), 0u) << text;
   EXPECT_NE(text.find(" {_logger=["), std::string::npos) << text;
   EXPECT_NE(text.find(", _socket=listening 127.0.0.1:"), std::string::npos) << text;
   EXPECT_NE(text.find(", _defaultRequestHandler=(null), _opState=0}"), std::string::npos) << text;
   socket->Close();
}

TEST_F(HttpSvcTest, DispatchesByPrefixAndKeepsConnectionsAlive) {
   DefaultLogCapture log;
   StartServer();
   _svc->Start();
   EXPECT_TRUE(log.Contains("Request to start ignored, already started"));
   EXPECT_TRUE(log.Contains("Http Service started: HttpSvcImpl @"));

   RawClient client(_port);
   ASSERT_TRUE(client.Connected());
   client.Send("GET /sdk/ HTTP/1.1\r\nHost: x\r\n\r\n");
   std::string first = client.ReadResponse();
   EXPECT_NE(first.find("HTTP/1.1 200"), std::string::npos) << first;
   EXPECT_NE(first.find("X-Frame-Options: DENY"), std::string::npos) << first;
   EXPECT_NE(first.find("sdk /sdk/"), std::string::npos) << first;
   // The same connection serves the next request, pipelined ones in order.
   client.Send("GET /sdk?x=1 HTTP/1.1\r\nHost: x\r\n\r\nGET /other HTTP/1.1\r\nHost: x\r\n\r\n");
   EXPECT_NE(client.ReadResponse().find("sdk /sdk?x=1"), std::string::npos);
   EXPECT_NE(client.ReadResponse().find("default /other"), std::string::npos);
   EXPECT_TRUE(log.Contains("ProcessRequest: using default handler"));
   client.Send("POST /echo HTTP/1.1\r\nHost: x\r\nContent-Length: 5\r\n\r\nhello");
   EXPECT_NE(client.ReadResponse().find("posted 5 hello"), std::string::npos);
   EXPECT_EQ(_svc->GetConnectionCount(), 1);
}

TEST_F(HttpSvcTest, AccessLogIsOffUnlessAsked) {
   DefaultLogCapture log;
   StartServer();
   EXPECT_NE(Get("/quiet").find("default /quiet"), std::string::npos);
   _svc->Stop();
   EXPECT_FALSE(log.Contains("GET /quiet 200"));
   StartServer({{"accessLog", "true"}, {"maxRequestBodyBytes", "100"}});
   EXPECT_NE(Get("/sdk/x?y=1").find("sdk /sdk/x?y=1"), std::string::npos);
   RawClient client(_port);
   client.Send("POST /big HTTP/1.1\r\nContent-Length: 200\r\n\r\n");
   EXPECT_NE(client.ReadResponse().find("413"), std::string::npos);
   // Each access line is written after its answer went out, so wait for both.
   ASSERT_TRUE(WaitFor([&] { return log.Contains("POST /big 413 ") && log.Contains("GET /sdk/x?y=1 200 "); },
                       "access lines of both requests"));
   std::string text = log.Text();
   size_t line = text.find("GET /sdk/x?y=1 200 ");
   ASSERT_NE(line, std::string::npos) << text;
   std::string rest = text.substr(line, text.find('\n', line) - line);
   // Status, the bytes of the whole answer, microseconds and the peer.
   EXPECT_NE(rest.find(" 127.0.0.1:"), std::string::npos) << rest;
   long long bytes = std::stoll(rest.substr(std::string("GET /sdk/x?y=1 200 ").size()));
   EXPECT_GT(bytes, 100);
   EXPECT_LT(bytes, 400);
}

TEST_F(HttpSvcTest, Http10ClosesUnlessKeepAliveIsAsked) {
   StartServer();
   RawClient plain(_port);
   plain.Send("GET /a HTTP/1.0\r\n\r\n");
   std::string response = plain.ReadResponse();
   EXPECT_NE(response.find("default /a"), std::string::npos) << response;
   EXPECT_TRUE(plain.Closed());

   RawClient kept(_port);
   kept.Send("GET /a HTTP/1.0\r\nConnection: Keep-Alive\r\n\r\n");
   EXPECT_NE(kept.ReadResponse().find("default /a"), std::string::npos);
   kept.Send("GET /b HTTP/1.0\r\nConnection: Keep-Alive\r\n\r\n");
   EXPECT_NE(kept.ReadResponse().find("default /b"), std::string::npos);

   RawClient closing(_port);
   closing.Send("GET /c HTTP/1.1\r\nConnection: close\r\n\r\n");
   EXPECT_NE(closing.ReadResponse().find("default /c"), std::string::npos);
   EXPECT_TRUE(closing.Closed());
}

TEST_F(HttpSvcTest, BadRequestsEndTheirConnectionOnly) {
   DefaultLogCapture log;
   StartServer({{"maxHeaderFields", "4"}, {"maxRequestBodyBytes", "100"}});
   const std::string chunk(60, 'c'), chunked = "POST / HTTP/1.1\r\nTransfer-Encoding: chunked\r\n\r\n3c\r\n" + chunk;
   struct Case {
      std::string request;
      const char* answer;  // empty: closed without one
      bool closes;
      const char* logged;
   } cases[] = {
       {"BREW /pot HTTP/1.1\r\nHost: x\r\n\r\n", "HTTP/1.1 501", false, "HTTP parser failed: "},
       {"GET / HTTP/1.1\r\nX-Big: " + std::string(Request::kHeaderAreaSize, 'a') + "\r\n\r\n", "", true,
        "Ill-formed header on stream 0x"},
       {"GET / HTTP/1.1\r\nA: 1\r\nB: 2\r\nC: 3\r\nD: 4\r\nE: 5\r\n\r\n", "HTTP/1.1 431", true, nullptr},
       {"POST / HTTP/1.1\r\nContent-Length: 101\r\n\r\n", "HTTP/1.1 413", false, nullptr},
       // A chunked body has no length to refuse up front: it is cut when it passes the
       // limit while the handler reads it.
       {chunked + "\r\n3c\r\n" + chunk + "\r\n0\r\n\r\n", "HTTP/1.1 413", true, nullptr},
       {chunked + "\r\n0\r\n\r\n", "posted 60 cccc", false, nullptr},
       {"GET /caf\xC3 HTTP/1.1\r\n\r\n", "HTTP/1.1 400", false, nullptr},
       {"GET /fail HTTP/1.1\r\n\r\n", "HTTP/1.1 500", false, "HTTP Transaction failed on stream 0x"},
       // HEAD is not served by the test handler: the base class refuses it.
       {"HEAD /sdk HTTP/1.1\r\n\r\n", "HTTP/1.1 400", false,
        "UnimplementedRequestHandler: HTTP method HEAD not supported for URI /sdk"},
   };
   for (const Case& c : cases) {
      SCOPED_TRACE(c.request.substr(0, 40));
      RawClient client(_port);
      client.Send(c.request);
      std::string answer = client.ReadResponse(c.request.rfind("HEAD ", 0) == 0);
      if (*c.answer != '\0') {
         EXPECT_NE(answer.find(c.answer), std::string::npos) << answer;
      } else {
         EXPECT_EQ(answer, "");
      }
      if (c.closes) {
         EXPECT_TRUE(client.Closed());
      }
      if (c.logged != nullptr) {
         EXPECT_TRUE(WaitFor([&] { return log.Contains(c.logged); }, c.logged));
      }
   }
   EXPECT_NE(Get("/still").find("default /still"), std::string::npos);
}

TEST_F(HttpSvcTest, ThousandsOfIdleConnectionsDoNotHoldThreads) {
   StartServer();
   std::vector<std::unique_ptr<RawClient>> idle;
   for (int i = 0; i < 2000; ++i) idle.push_back(std::make_unique<RawClient>(_port));
   ASSERT_TRUE(WaitFor([&] { return _svc->GetConnectionCount() == 2000; }, "2000 connections accepted"));
   // Far more idle connections than pool threads, and requests still get through.
   EXPECT_NE(Get("/busy").find("default /busy"), std::string::npos);
   idle[7]->Send("GET /late HTTP/1.1\r\n\r\n");
   EXPECT_NE(idle[7]->ReadResponse().find("default /late"), std::string::npos);
   idle.clear();
   EXPECT_TRUE(WaitFor([&] { return _svc->GetConnectionCount() == 0; }, "closed connections ended"));
}

TEST_F(HttpSvcTest, IdleClientsTimeOut) {
   long long tick = System::GetStreamTimeoutTick();
   System::SetStreamTimeoutTick(20000);
   StartServer({{"readTimeoutMs", "100"}});
   {
      RawClient silent(_port);
      RawClient between(_port);
      between.Send("GET /one HTTP/1.1\r\n\r\n");
      EXPECT_NE(between.ReadResponse().find("default /one"), std::string::npos);
      // Neither the client that never asked nor the one that went quiet after its
      // answer is kept.
      EXPECT_TRUE(silent.Closed());
      EXPECT_TRUE(between.Closed());
      EXPECT_TRUE(WaitFor([&] { return _svc->GetConnectionCount() == 0; }, "idle connections closed"));
   }
   System::SetStreamTimeoutTick(tick);
}

TEST_F(HttpSvcTest, SlowlorisIsClosedWhileOthersAreServed) {
   DefaultLogCapture log;
   StartServer({{"requestDeadlineMs", "300"}});
   // Sends `text` a byte every 100 ms, serving another client meanwhile; true when the
   // server cut the connection within two seconds.
   auto trickle = [&](RawClient& slow, const std::string& text) {
      auto began = std::chrono::steady_clock::now();
      for (char c : text) {
         if (!slow.Send(std::string(1, c))) return true;
         EXPECT_NE(Get("/other").find("default /other"), std::string::npos);
         std::this_thread::sleep_for(std::chrono::milliseconds(100));
         if (std::chrono::steady_clock::now() - began > std::chrono::seconds(2)) break;
      }
      return slow.Closed();
   };
   RawClient header(_port, 3000);
   EXPECT_TRUE(trickle(header, "GET /slowly HTTP/1.1\r\nHost: x\r\nX-Padding: aaaaaaaaaaaaaaaaaaaaaaaaaaaaaa\r\n\r\n"));
   EXPECT_TRUE(log.Contains("Request not complete within 300 ms; closing stream"));

   // The deadline covers the body too, while the handler waits for it.
   RawClient body(_port, 3000);
   body.Send("POST /up HTTP/1.1\r\nContent-Length: 64\r\n\r\n");
   EXPECT_TRUE(trickle(body, std::string(64, 'b')));
   EXPECT_EQ(_svc->GetConnectionCount(), 0);

   // A handler busy after its body is in is not cut.
   RawClient busy(_port);
   busy.Send("GET /slow HTTP/1.1\r\n\r\n");
   EXPECT_NE(busy.ReadResponse().find("default /slow"), std::string::npos);
}

TEST_F(HttpSvcTest, FailedAcceptsBackOffAndRecover) {
#if defined(__SANITIZE_ADDRESS__)
   // The sanitizer runtime opens files for its checks; with every descriptor taken it
   // reports faults that are not there.
   GTEST_SKIP() << "the sanitizer runtime needs descriptors of its own";
#endif
   DefaultLogCapture log;
   StartServer();
   // The client's socket is made before the descriptors run out; it connects after.
   int client = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
   ASSERT_GE(client, 0);
   rlimit saved{};
   ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &saved), 0);
   int highest = 0;
   for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
      highest = std::max(highest, std::stoi(entry.path().filename().string()));
   rlimit lowered = saved;
   lowered.rlim_cur = static_cast<rlim_t>(highest + 16);
   ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &lowered), 0);
   std::vector<int> filler;
   for (int fd; (fd = ::open("/dev/null", O_RDONLY | O_CLOEXEC)) >= 0;) filler.push_back(fd);
   rusage before{}, after{};
   ::getrusage(RUSAGE_SELF, &before);

   sockaddr_in address{};
   address.sin_family = AF_INET;
   address.sin_port = htons(static_cast<uint16_t>(_port));
   address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
   EXPECT_EQ(::connect(client, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
   EXPECT_TRUE(WaitFor([&] { return log.Contains("accept failure "); }, "accept failure"));
   std::this_thread::sleep_for(std::chrono::milliseconds(300));
   ::getrusage(RUSAGE_SELF, &after);
   for (int fd : filler) ::close(fd);
   ::setrlimit(RLIMIT_NOFILE, &saved);

   std::string text = log.Text();
   size_t failures = 0;
   for (size_t at = 0; (at = text.find("accept failure ", at)) != std::string::npos; ++at) ++failures;
   EXPECT_EQ(failures, 1u) << "one line per burst";
   auto cpu = [](const rusage& r) {
      return (r.ru_utime.tv_sec + r.ru_stime.tv_sec) * 1000000LL + r.ru_utime.tv_usec + r.ru_stime.tv_usec;
   };
   EXPECT_LT(cpu(after) - cpu(before), 150000) << "accepts retried in a busy loop";

   // With descriptors back the waiting client is served.
   std::string request = "GET /back HTTP/1.1\r\nConnection: close\r\n\r\n";
   ASSERT_EQ(::send(client, request.data(), request.size(), MSG_NOSIGNAL), static_cast<ssize_t>(request.size()));
   timeval tv{5, 0};
   ::setsockopt(client, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
   std::string answer;
   char piece[4096];
   for (ssize_t n; (n = ::recv(client, piece, sizeof piece, 0)) > 0;) answer.append(piece, static_cast<size_t>(n));
   ::close(client);
   EXPECT_NE(answer.find("default /back"), std::string::npos) << answer;
   EXPECT_TRUE(log.Contains("Accepting again after failed accepts"));
}

TEST_F(HttpSvcTest, ConnectionLimitMakesNewClientsWait) {
   StartServer({{"maxConnections", "2"}});
   RawClient a(_port), b(_port);
   a.Send("GET /a HTTP/1.1\r\n\r\n");
   b.Send("GET /b HTTP/1.1\r\n\r\n");
   EXPECT_NE(a.ReadResponse().find("default /a"), std::string::npos);
   EXPECT_NE(b.ReadResponse().find("default /b"), std::string::npos);
   RawClient waiting(_port, 300);
   waiting.Send("GET /c HTTP/1.1\r\nConnection: close\r\n\r\n");
   EXPECT_EQ(waiting.ReadResponse(), "");  // still in the backlog
   EXPECT_EQ(_svc->GetConnectionCount(), 2);
   a.Send("GET /a HTTP/1.1\r\nConnection: close\r\n\r\n");
   EXPECT_NE(a.ReadResponse().find("default /a"), std::string::npos);
   RawClient patient(_port);
   patient.Send("GET /d HTTP/1.1\r\nConnection: close\r\n\r\n");
   EXPECT_NE(patient.ReadResponse().find("default /d"), std::string::npos);
}

TEST_F(HttpSvcTest, StopFinishesRequestsInFlightAndClosesIdleAtOnce) {
   DefaultLogCapture log;
   StartServer({{"shutdownDeadlineMs", "3000"}});
   RawClient idle(_port);
   RawClient busy(_port);
   RawClient late(_port);
   late.Send("GET /late HTTP/1.1\r\n");
   busy.Send("GET /slow HTTP/1.1\r\n\r\n");
   ASSERT_TRUE(WaitFor([&] { return _default->started.load(); }, "slow request started"));
   auto began = std::chrono::steady_clock::now();
   std::thread stopper([&] { _svc->Stop(); });
   ASSERT_TRUE(WaitFor([&] { return log.Contains("Stopped HTTP service"); }, "stop begun"));
   // A request completed while the service stops is not served; the line names the
   // state (stopping).
   late.Send("\r\n");
   EXPECT_TRUE(late.Closed());
   stopper.join();
   EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(2));
   EXPECT_TRUE(log.Contains("Ignored pending request. State: 2\n"));
   EXPECT_NE(busy.ReadResponse().find("default /slow"), std::string::npos);
   EXPECT_TRUE(idle.Closed());
   EXPECT_TRUE(log.Contains("Stopped HTTP service"));
   EXPECT_FALSE(log.Contains("at shutdown with a request in progress"));
   EXPECT_EQ(_svc->GetConnectionCount(), 0);
}

TEST_F(HttpSvcTest, StopPastItsDeadlineClosesWithALogLine) {
   DefaultLogCapture log;
   StartServer({{"shutdownDeadlineMs", "50"}});
   RawClient busy(_port);
   busy.Send("GET /slow HTTP/1.1\r\n\r\n");
   ASSERT_TRUE(WaitFor([&] { return _default->started.load(); }, "slow request started"));
   _svc->Stop();
   EXPECT_TRUE(log.Contains("at shutdown with a request in progress"));
   EXPECT_TRUE(WaitFor([&] { return _svc->GetConnectionCount() == 0; }, "connection gone"));
}

TEST_F(HttpSvcTest, ServesSeveralListenersOverTcpUnixAndTls) {
   StartServer();
   std::string dir = ::testing::TempDir() + "httpsvc_listeners_" + std::to_string(::getpid());
   std::filesystem::remove_all(dir);
   std::filesystem::create_directories(dir);
   std::string content;
   for (int i = 0; i < 300000; ++i) content += static_cast<char>('a' + i * 7 % 26);
   std::ofstream(dir + "/file.bin", std::ios::binary) << content;
   _default->file = dir + "/file.bin";
   auto fetchFile = [&](const std::string& curl) {
      return RunCommand(curl + " -o " + dir + "/got.bin && cmp -s " + dir + "/got.bin " + dir + "/file.bin && echo same");
   };
   std::vector<std::string> urls;  // curl arguments naming each listener, /file appended

   urls.push_back(Url(""));
   Ref<System::ServerSocket> v6;
   try {
      System::CreateTcpServerSocket("::1", 0, System::ServerSocketOptions(), v6);
   } catch (const Exception& e) {
      std::cout << "[  SKIPPED ] IPv6 listener: no ::1 on this machine (" << e.GetMessage() << ")\n";
   }
   if (v6) {
      Ref<System::BindingInfo> local;
      v6->GetBindingInfo(local);
      _svc->AddServerSocket(v6.Get());
      urls.push_back("-g http://[::1]:" + std::to_string(local->GetPort()));
   }

   std::string path = dir + "/http.sock";
   Ref<System::ServerSocket> unix;
   System::CreateLocalServerSocket(path, System::ServerSocketOptions(), unix);
   _svc->AddServerSocket(unix.Get());
   urls.push_back("--unix-socket " + path + " http://local");

   RunCommand("cd " + dir +
              " && openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -keyout key.pem"
              " -out cert.pem -days 2 -subj /CN=localhost 2>/dev/null");
   System::SslServerOptions options;
   options.certificateChainFile = dir + "/cert.pem";
   options.privateKeyFile = dir + "/key.pem";
   Ref<System::SslContext> context;
   System::CreateSslServerContext(options, context);
   Ref<System::ServerSocket> tls;
   System::CreateSslServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), context.Get(), tls);
   Ref<System::BindingInfo> tlsLocal;
   tls->GetBindingInfo(tlsLocal);
   _svc->AddServerSocket(tls.Get());
   urls.push_back("-k https://127.0.0.1:" + std::to_string(tlsLocal->GetPort()));

   // Plain TCP sends the file with sendfile, TLS and Unix streams copy it: every one
   // gets the same bytes.
   for (const std::string& url : urls) {
      SCOPED_TRACE(url);
      EXPECT_EQ(RunCommand("curl -s --max-time 5 " + url + "/where"), "default /where");
      EXPECT_EQ(fetchFile("curl -s --max-time 10 " + url + "/file"), "same\n");
   }
   _svc->Stop();
   for (const std::string& url : urls)
      EXPECT_EQ(RunCommand("curl -s --max-time 2 " + url + "/after"), "") << url;
   std::filesystem::remove_all(dir);
}

TEST_F(HttpSvcTest, RealClientsReuseConnectionsAndUploadChunked) {
   StartServer();
   std::string out = RunCommand("curl -sv --max-time 5 " + Url("/one") + " " + Url("/two") + " 2>&1");
   EXPECT_NE(out.find("default /one"), std::string::npos) << out;
   EXPECT_NE(out.find("default /two"), std::string::npos) << out;
   EXPECT_NE(out.find("Re-using existing connection"), std::string::npos) << out;

   out = RunCommand("curl -s --http1.0 --max-time 5 " + Url("/old"));
   EXPECT_EQ(out, "default /old");

   out = RunCommand("printf 'abcdefgh' | curl -s --max-time 5 -H 'Transfer-Encoding: chunked' --data-binary @- " +
                    Url("/up"));
   EXPECT_EQ(out, "posted 8 abcdefgh");

   std::string script =
       "import http.client,sys\n"
       "c=http.client.HTTPConnection('127.0.0.1'," + std::to_string(_port) + ",timeout=5)\n"
       "for p in ('/p1','/sdk/p2'):\n"
       "  c.request('GET',p); r=c.getresponse(); sys.stdout.write(r.read().decode()+'|')\n"
       "c.request('POST','/p3',body=b'x'*70000); r=c.getresponse(); sys.stdout.write(r.read().decode()[:9])\n";
   std::string path = ::testing::TempDir() + "httpsvc_client.py";
   std::ofstream(path) << script;
   out = RunCommand("python3 " + path);
   EXPECT_EQ(out, "default /p1|sdk /sdk/p2|posted 70") << out;
}

}  // namespace
}  // namespace Pelmora::Http
