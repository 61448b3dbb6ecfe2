// Sessions: cookies and their attributes, resolution across requests of real clients,
// hostile cookie values, the count limit, idle expiry on the pool timer, invalidation,
// concurrent use, the authenticated time-outs of the connection and Secure over TLS.

#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <set>
#include <thread>
#include <vector>

#include "pelmora/http/httpSvc.h"
#include "pelmora/http/session.h"
#include "pelmora/object/weak.h"
#include "pelmora/perfCounter/registry.h"
#include "pelmora/service/config.h"
#include "pelmora/system/ssl.h"
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

class NullConnection : public virtual HttpConnection, public ObjectImpl {
public:
   void GetClientCapabilities(ClientCapabilities& out) override { out = ClientCapabilities(); }
   long long GetMaxBufferedResponseBytes() override { return -1; }
   void ResponseCompleted(bool) override {}
};

// A parsed request carrying `cookieField` (none when empty) and a response to answer it,
// on an in-process stream pair.
struct Exchange {
   explicit Exchange(const std::string& cookieField = std::string()) {
      Ref<System::Stream> client, server;
      System::CreateStreamPair(client, server);
      std::string text = "GET / HTTP/1.1\r\nHost: x\r\n";
      if (!cookieField.empty()) text += "Cookie: " + cookieField + "\r\n";
      client->Write(text.data(), static_cast<int>(text.size()));
      client->Write("\r\n", 2);
      CreateRequest(server.Get(), request);
      RequestWaiter waiter;
      request->AsyncReadHeader(waiter.Callback());
      EXPECT_TRUE(waiter.Wait(5000000));
      CreateResponse(connection.Get(), server.Get(), response);
      peer = client;
   }
   // The Set-Cookie values the response would send.
   std::vector<std::string> SetCookies() const {
      std::vector<std::string> out;
      for (const Ref<Cookie>& cookie : response->GetHeader().GetCookies()) out.push_back(cookie->ToString());
      return out;
   }

   Ref<NullConnection> connection{new NullConnection()};
   Ref<System::Stream> peer;
   Ref<Request> request;
   Ref<Response> response;
};

Ref<Service::Logger> TestLogger() {
   static Ref<Service::Logger> logger = [] {
      Ref<Service::Logger> made;
      Service::GetDefaultLogger()->CreateLogger("sessionTest", 0x7F, made);
      return made;
   }();
   return logger;
}

Ref<SessionService> MakeService(const SessionServiceConfig& config = SessionServiceConfig()) {
   Ref<SessionService> service;
   CreateSessionService(config, TestLogger().Get(), service);
   return service;
}

// A new session of `service` for a request without cookies; none when refused.
Ref<Session> NewSession(SessionService* service) {
   Exchange exchange;
   Ref<Session> session;
   service->ResolveSession(exchange.request.Get(), exchange.response.Get(), session);
   return session;
}

// The value of a session counter of the process's registry; -1 when there is none.
long long CounterValue(const std::string& cookieName, const std::string& counter) {
   std::vector<std::string> names{"/Http/Sessions/Cookie='" + cookieName + "'/" + counter};
   Ref<PerfCounter::Query> query;
   PerfCounter::GetCounterRegistry()->CreateNamesQuery(names, query);
   PerfCounter::QueryResults results;
   query->Execute(results);
   return results.empty() ? -1 : results[0].value.Get();
}

size_t Count(const std::string& text, const std::string& what) {
   size_t n = 0;
   for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
   return n;
}

class SessionTest : public ::testing::Test {
protected:
   void SetUp() override { EnsurePool(); }
};

TEST_F(SessionTest, NewSessionSetsItsCookieAndTheCookieResolvesToIt) {
   Ref<SessionService> service = MakeService();
   Exchange first;
   Ref<Session> session;
   ASSERT_TRUE(ResolveSession(service.Get(), first.request.Get(), first.response.Get(), session));
   std::string id = session->GetId();
   ASSERT_EQ(id.size(), 32u);
   EXPECT_EQ(id.find_first_not_of("0123456789abcdef"), std::string::npos) << id;
   ASSERT_EQ(first.SetCookies().size(), 1u);
   EXPECT_EQ(first.SetCookies()[0], "pelmora_session=" + id + "; Path=/; HttpOnly; SameSite=Strict");
   Ref<Object> attached;
   first.response->GetSession(attached);
   EXPECT_EQ(attached.Get(), static_cast<Object*>(session.Get()));

   // Among other cookies, the service's own names the same session and sets no new one.
   Exchange again("theme=dark; pelmora_session=" + id + "; other=1");
   Ref<Session> same;
   ASSERT_TRUE(service->ResolveSession(again.request.Get(), again.response.Get(), same));
   EXPECT_EQ(same, session);
   EXPECT_TRUE(again.SetCookies().empty());
   Ref<Session> looked;
   EXPECT_TRUE(service->LookupSession(id, looked));
   EXPECT_EQ(looked, session);
   EXPECT_EQ(service->GetSessionCount(), 1u);

   // Another service's cookie name and path; fresh ids each time.
   SessionServiceConfig config;
   config.cookieName = "soap_session";
   config.cookiePath = "/sdk";
   Ref<SessionService> soap = MakeService(config);
   Exchange foreign("pelmora_session=" + id);
   Ref<Session> other;
   ASSERT_TRUE(soap->ResolveSession(foreign.request.Get(), foreign.response.Get(), other));
   EXPECT_NE(other->GetId(), id);
   EXPECT_EQ(foreign.SetCookies()[0], "soap_session=" + other->GetId() + "; Path=/sdk; HttpOnly; SameSite=Strict");
   service->Shutdown();
   soap->Shutdown();
}

TEST_F(SessionTest, MalformedOrUnknownCookiesGetANewSession) {
   Ref<SessionService> service = MakeService();
   Ref<Session> known = NewSession(service.Get());
   ASSERT_TRUE(known);
   std::string id = known->GetId();
   std::string upper = id;
   for (char& c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
   if (upper == id) upper[0] = 'G';
   const std::string cookies[] = {
       "pelmora_session=" + id.substr(1),                   // one digit short
       "pelmora_session=" + id + "0",                       // one too many
       "pelmora_session=" + upper,                          // upper case
       "pelmora_session=" + id.substr(0, 31) + "g",         // not hex
       "pelmora_session=" + std::string(32, '0'),           // well formed, unknown
       "pelmora_session=" + id.substr(0, 16) + " " + id.substr(16),
       "PELMORA_SESSION=" + id,                             // another name
   };
   std::set<std::string> ids{id};
   for (const std::string& cookie : cookies) {
      Exchange exchange(cookie);
      Ref<Session> session;
      ASSERT_TRUE(service->ResolveSession(exchange.request.Get(), exchange.response.Get(), session)) << cookie;
      EXPECT_NE(session, known) << cookie;
      EXPECT_EQ(exchange.SetCookies().size(), 1u) << cookie;
      ids.insert(session->GetId());
   }
   EXPECT_EQ(ids.size(), 1 + std::size(cookies));
   EXPECT_EQ(service->GetSessionCount(), 1 + std::size(cookies));

   // A bad value ahead of a good one does not hide it.
   Exchange mixed("pelmora_session=nonsense; pelmora_session=" + id);
   Ref<Session> session;
   ASSERT_TRUE(service->ResolveSession(mixed.request.Get(), mixed.response.Get(), session));
   EXPECT_EQ(session, known);
   EXPECT_FALSE(service->LookupSession(upper, session));
   EXPECT_FALSE(session);
   EXPECT_FALSE(service->LookupSession("", session));
   service->Shutdown();
}

TEST_F(SessionTest, MaximumCountRefusesWithOneWarningPerBurst) {
   DefaultLogCapture log;
   SessionServiceConfig config;
   config.maxSessionCount = 2;
   config.cookieName = "limited_session";
   Ref<SessionService> service = MakeService(config);
   Ref<Session> a = NewSession(service.Get()), b = NewSession(service.Get()), refused;
   ASSERT_TRUE(a && b);
   for (int i = 0; i < 3; ++i) {
      Exchange refusedExchange;
      EXPECT_FALSE(ResolveSession(service.Get(), refusedExchange.request.Get(), refusedExchange.response.Get(),
                                  refused));
      EXPECT_FALSE(refused);
      EXPECT_TRUE(refusedExchange.SetCookies().empty());
      Ref<Object> attached;
      refusedExchange.response->GetSession(attached);
      EXPECT_FALSE(attached);
   }
   const std::string warning = "Refusing new HTTP sessions: 2 sessions exist, the maximum";
   EXPECT_EQ(Count(log.Text(), warning), 1u) << log.Text();
   // Existing sessions still resolve while new ones are refused.
   Exchange existing("limited_session=" + a->GetId());
   Ref<Session> found;
   ASSERT_TRUE(service->ResolveSession(existing.request.Get(), existing.response.Get(), found));
   EXPECT_EQ(found, a);

   // Room again, then a second burst warns again.
   a->Invalidate();
   EXPECT_TRUE(NewSession(service.Get()));
   EXPECT_FALSE(NewSession(service.Get()));
   EXPECT_EQ(Count(log.Text(), warning), 2u) << log.Text();
   EXPECT_EQ(CounterValue("limited_session", "Created"), 3);
   EXPECT_EQ(CounterValue("limited_session", "Refused"), 4);
   EXPECT_EQ(CounterValue("limited_session", "Active"), 2);
   EXPECT_EQ(CounterValue("limited_session", "Expired"), 0);
   service->Shutdown();
   EXPECT_EQ(CounterValue("limited_session", "Created"), -1);  // unregistered
}

TEST_F(SessionTest, IdleSessionsExpireOnTheTimerWhileUsedOnesStay) {
   SessionServiceConfig config;
   config.idleTimeout = 50000;
   config.expiryInterval = 10000;
   Ref<SessionService> service = MakeService(config);
   Ref<Session> idle = NewSession(service.Get()), used = NewSession(service.Get());
   ASSERT_TRUE(idle && used);
   std::string cookie = "pelmora_session=" + used->GetId();
   // Every access restarts the clock: touched every 10 ms, `used` outlives `idle`.
   ASSERT_TRUE(WaitFor(
       [&] {
          Exchange touch(cookie);
          Ref<Session> again;
          EXPECT_TRUE(service->ResolveSession(touch.request.Get(), touch.response.Get(), again));
          EXPECT_EQ(again, used);
          std::this_thread::sleep_for(std::chrono::milliseconds(10));
          return !idle->IsValid();
       },
       "idle session expired"));
   EXPECT_TRUE(used->IsValid());
   EXPECT_EQ(service->GetSessionCount(), 1u);
   Ref<Session> gone;
   EXPECT_FALSE(service->LookupSession(idle->GetId(), gone));
   ASSERT_TRUE(WaitFor([&] { return service->GetSessionCount() == 0; }, "used session expired once left"));
   EXPECT_FALSE(used->IsValid());

   // Its cookie then gets a new session and a new cookie.
   Exchange late(cookie);
   Ref<Session> fresh;
   ASSERT_TRUE(service->ResolveSession(late.request.Get(), late.response.Get(), fresh));
   EXPECT_NE(fresh->GetId(), used->GetId());
   EXPECT_EQ(late.SetCookies().size(), 1u);
   service->Shutdown();
}

TEST_F(SessionTest, IdleSessionsEndOnLookupAndOnExplicitExpiry) {
   SessionServiceConfig config;
   config.idleTimeout = 30000;
   config.expiryInterval = 0;  // no timer: only explicit expiry and lookups
   config.cookieName = "idle_session";
   Ref<SessionService> service = MakeService(config);
   std::vector<Ref<Session>> sessions(4);
   for (auto& session : sessions) {
      session = NewSession(service.Get());
      ASSERT_TRUE(session);
   }
   auto made = std::chrono::steady_clock::now();
   ASSERT_TRUE(WaitFor([&] { return std::chrono::steady_clock::now() - made > std::chrono::milliseconds(40); },
                       "idle time passed"));
   EXPECT_EQ(service->GetSessionCount(), 4u);
   // Every idle session a request names ends, not only the last one.
   Exchange both("idle_session=" + sessions[0]->GetId() + "; idle_session=" + sessions[1]->GetId());
   Ref<Session> fresh, out;
   ASSERT_TRUE(service->ResolveSession(both.request.Get(), both.response.Get(), fresh));
   EXPECT_FALSE(sessions[0]->IsValid());
   EXPECT_FALSE(sessions[1]->IsValid());
   EXPECT_EQ(both.SetCookies().size(), 1u);
   EXPECT_FALSE(service->LookupSession(sessions[2]->GetId(), out));
   EXPECT_FALSE(sessions[2]->IsValid());
   EXPECT_TRUE(sessions[3]->IsValid());  // nobody asked for it yet
   size_t ended = service->ExpireIdleSessions();
   EXPECT_FALSE(sessions[3]->IsValid());
   EXPECT_EQ(ended, fresh->IsValid() ? 1u : 2u);  // `fresh` too when this thread stalled
   EXPECT_EQ(service->GetSessionCount(), fresh->IsValid() ? 1u : 0u);
   EXPECT_EQ(CounterValue("idle_session", "Expired"), fresh->IsValid() ? 4 : 5);

   // Sessions still held elsewhere end with a service dropped without Shutdown.
   Ref<SessionService> dropped = MakeService();
   Ref<Session> orphan = NewSession(dropped.Get());
   ASSERT_TRUE(orphan);
   dropped.Reset();
   EXPECT_FALSE(orphan->IsValid());
   orphan->Invalidate();

   // A negative time-out never expires.
   config.idleTimeout = -1;
   Ref<SessionService> forever = MakeService(config);
   Ref<Session> kept = NewSession(forever.Get());
   ASSERT_TRUE(kept);
   std::this_thread::sleep_for(std::chrono::milliseconds(5));
   EXPECT_EQ(forever->ExpireIdleSessions(), 0u);
   EXPECT_TRUE(forever->LookupSession(kept->GetId(), out));
   service->Shutdown();
   forever->Shutdown();
}

TEST_F(SessionTest, InvalidateAndShutdownEndSessionsAndTheirValues) {
   Ref<SessionService> service = MakeService();
   Ref<Session> session = NewSession(service.Get());
   ASSERT_TRUE(session);
   Ref<Object> value(new ObjectImpl()), out;
   session->SetAttribute("user", value.Get());
   ASSERT_TRUE(session->GetAttribute("user", out));
   EXPECT_EQ(out, value);
   session->SetAttribute("user", nullptr);
   EXPECT_FALSE(session->GetAttribute("user", out));
   EXPECT_FALSE(out);
   session->SetAttribute("user", value.Get());
   session->SetAuthenticated(true);
   EXPECT_TRUE(session->IsAuthenticated());

   session->Invalidate();
   EXPECT_FALSE(session->IsValid());
   EXPECT_FALSE(session->GetAttribute("user", out));
   EXPECT_EQ(service->GetSessionCount(), 0u);
   session->Invalidate();  // twice is harmless
   Exchange again("pelmora_session=" + session->GetId());
   Ref<Session> fresh;
   ASSERT_TRUE(service->ResolveSession(again.request.Get(), again.response.Get(), fresh));
   EXPECT_NE(fresh->GetId(), session->GetId());
   EXPECT_FALSE(fresh->IsAuthenticated());
   ASSERT_EQ(again.SetCookies().size(), 1u);
   EXPECT_NE(again.SetCookies()[0].find(fresh->GetId()), std::string::npos);

   service->Shutdown();
   EXPECT_FALSE(fresh->IsValid());
   EXPECT_EQ(service->GetSessionCount(), 0u);
   fresh->Invalidate();  // after its service ended
}

TEST_F(SessionTest, TheTimerNeitherKeepsTheServiceAliveNorRacesShutdown) {
   SessionServiceConfig config;
   config.idleTimeout = 0;
   config.expiryInterval = 1000;
   for (int round = 0; round < 20; ++round) {
      Ref<SessionService> service = MakeService(config);
      Ref<Session> session = NewSession(service.Get());
      ASSERT_TRUE(session);
      std::this_thread::sleep_for(std::chrono::microseconds(500 * (round % 5)));
      service->Shutdown();
      EXPECT_EQ(service->GetSessionCount(), 0u);
   }
   Ref<SessionService> service = MakeService(config);
   WeakRef<SessionService> weak(service);
   Ref<Session> session = NewSession(service.Get());
   ASSERT_TRUE(session);
   ASSERT_TRUE(WaitFor([&] { return !session->IsValid(); }, "timer ran"));
   service.Reset();  // without Shutdown; a timer callback in progress may hold it briefly
   EXPECT_TRUE(WaitFor([&] { return weak.IsDetached(); }, "service released", std::chrono::milliseconds(2000)));
}

TEST_F(SessionTest, ConcurrentResolutionFromSeveralThreads) {
   Pelmora::Testing::Watchdog watchdog("concurrent session resolution");
   Ref<SessionService> service = MakeService();
   Ref<Session> shared = NewSession(service.Get());
   ASSERT_TRUE(shared);
   constexpr int kThreads = 4, kRounds = 100;
   std::atomic<int> sameCount{0}, newCount{0}, failures{0};
   std::vector<std::thread> threads;
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&, t] {
         Exchange known("pelmora_session=" + shared->GetId());
         Exchange unknown;
         for (int i = 0; i < kRounds; ++i) {
            Ref<Session> out;
            Exchange& use = (i + t) % 2 == 0 ? known : unknown;
            if (!ResolveSession(service.Get(), use.request.Get(), use.response.Get(), out)) {
               ++failures;
               continue;
            }
            if (out == shared) {
               ++sameCount;
            } else {
               ++newCount;
               if (i % 3 == 0) out->Invalidate();
               out->SetAttribute("n", new ObjectImpl());
            }
            use.response->Reset();
            if (i % 10 == 0) service->ExpireIdleSessions();
         }
      });
   }
   for (auto& thread : threads) thread.join();
   EXPECT_EQ(failures.load(), 0);
   EXPECT_EQ(sameCount.load(), kThreads * kRounds / 2);
   EXPECT_EQ(newCount.load(), kThreads * kRounds / 2);
   int invalidated = 0;
   for (int t = 0; t < kThreads; ++t)
      for (int i = 0; i < kRounds; ++i)
         if ((i + t) % 2 != 0 && i % 3 == 0) ++invalidated;
   EXPECT_EQ(service->GetSessionCount(), static_cast<size_t>(1 + newCount.load() - invalidated));
   service->Shutdown();
}

// Servers: the session service behind a real HttpSvc.

class SessionHandler : public RequestHandlerMixin, public ObjectImpl {
public:
   explicit SessionHandler(SessionService* service) : _service(service) {}
   void HandleGet(Request* request, Response* response) override {
      Ref<Session> session;
      if (!ResolveSession(_service.Get(), request, response, session)) {
         response->SendError(ResponseCode::ServiceUnavailable);
         return;
      }
      if (request->GetPath() == "/login") session->SetAuthenticated(true);
      if (request->GetPath() == "/logout") session->SetAuthenticated(false);
      Ref<Object> hits;
      int count = 1;
      if (session->GetAttribute("hits", hits)) count = static_cast<int>(dynamic_cast<Counter*>(hits.Get())->value) + 1;
      session->SetAttribute("hits", new Counter(count));
      std::string text = session->GetId() + " " + std::to_string(count);
      response->Write(text.data(), static_cast<int>(text.size()));
      response->Complete();
   }

private:
   struct Counter : public ObjectImpl {
      explicit Counter(int v) : value(v) {}
      int value;
   };
   Ref<SessionService> _service;
};

Ref<Service::Config::View> Settings(const std::vector<std::pair<std::string, std::string>>& values) {
   return TestSupport::ScratchView("pelmora/http", values);
}

class SessionServerTest : public ::testing::Test {
protected:
   void SetUp() override {
      EnsurePool();
      _sessions = MakeService();
   }
   void TearDown() override {
      if (_svc) _svc->Stop();
      if (_socket) _socket->Close();
      _sessions->Shutdown();
   }
   void Start(System::ServerSocket* socket, const std::vector<std::pair<std::string, std::string>>& values = {}) {
      _socket = socket;
      Ref<System::BindingInfo> local;
      socket->GetBindingInfo(local);
      _port = local->GetPort();
      CreateHttpSvc(socket, TestLogger().Get(), Settings(values).Get(), _svc);
      _svc->SetRequestHandler(new SessionHandler(_sessions.Get()));
      _svc->Start();
   }
   void StartPlain(const std::vector<std::pair<std::string, std::string>>& values = {}) {
      Ref<System::ServerSocket> socket;
      System::CreateTcpServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), socket);
      Start(socket.Get(), values);
   }
   std::string Url(const std::string& path, const char* scheme = "http") {
      return std::string(scheme) + "://127.0.0.1:" + std::to_string(_port) + path;
   }

   Ref<SessionService> _sessions;
   Ref<System::ServerSocket> _socket;
   Ref<HttpSvc> _svc;
   int _port = 0;
};

TEST_F(SessionServerTest, RealClientsKeepTheirSessionThroughTheCookie) {
   StartPlain();
   std::string jar = ::testing::TempDir() + "session_jar_" + std::to_string(::getpid());
   std::remove(jar.c_str());
   std::string first = RunCommand("curl -s --max-time 5 -c " + jar + " " + Url("/a"));
   std::string second = RunCommand("curl -s --max-time 5 -b " + jar + " -c " + jar + " " + Url("/b"));
   ASSERT_EQ(first.size(), 34u) << first;
   EXPECT_EQ(first.substr(32), " 1");
   EXPECT_EQ(second, first.substr(0, 32) + " 2");
   std::ifstream stored(jar);
   std::string jarText((std::istreambuf_iterator<char>(stored)), std::istreambuf_iterator<char>());
   EXPECT_NE(jarText.find("#HttpOnly_127.0.0.1"), std::string::npos) << jarText;
   std::remove(jar.c_str());

   std::string script =
       "import http.client,sys\n"
       "c=http.client.HTTPConnection('127.0.0.1'," + std::to_string(_port) + ",timeout=5)\n"
       "c.request('GET','/x'); r=c.getresponse(); body=r.read().decode()\n"
       "cookie=r.getheader('Set-Cookie').split(';')[0]\n"
       "for p in ('/y','/z'):\n"
       "  c.request('GET',p,headers={'Cookie':cookie}); r=c.getresponse()\n"
       "  body+='|'+r.read().decode()+'|'+str(r.getheader('Set-Cookie'))\n"
       "c.request('GET','/w'); r=c.getresponse(); body+='|'+r.read().decode()\n"
       "sys.stdout.write(body)\n";
   std::string path = ::testing::TempDir() + "session_client.py";
   std::ofstream(path) << script;
   std::string out = RunCommand("python3 " + path);
   ASSERT_GE(out.size(), 32u) << out;
   std::string id = out.substr(0, 32);
   std::string other = out.substr(out.rfind('|') + 1, 32);
   EXPECT_EQ(out, id + " 1|" + id + " 2|None|" + id + " 3|None|" + other + " 1");
   EXPECT_NE(id, other);
}

TEST_F(SessionServerTest, AuthenticatedSessionsWaitUnderTheAuthenticatedTimeout) {
   long long tick = System::GetStreamTimeoutTick();
   System::SetStreamTimeoutTick(20000);
   StartPlain({{"readTimeoutMs", "100"}, {"authenticatedReadTimeoutMs", "10000"}});
   {
      RawClient authenticated(_port), plain(_port);
      authenticated.Send("GET /login HTTP/1.1\r\n\r\n");
      std::string answer = authenticated.ReadResponse();
      size_t at = answer.find("pelmora_session=");
      ASSERT_NE(at, std::string::npos) << answer;
      std::string cookie = answer.substr(at, 16 + 32);
      plain.Send("GET /plain HTTP/1.1\r\n\r\n");
      EXPECT_NE(plain.ReadResponse().find(" 1"), std::string::npos);
      EXPECT_TRUE(plain.Closed());  // the short time-out ran out
      // The authenticated one outlived it, and keeps going while its session stays so.
      authenticated.Send("GET /again HTTP/1.1\r\nCookie: " + cookie + "\r\n\r\n");
      EXPECT_NE(authenticated.ReadResponse().find(" 2"), std::string::npos);
      authenticated.Send("GET /logout HTTP/1.1\r\nCookie: " + cookie + "\r\n\r\n");
      EXPECT_NE(authenticated.ReadResponse().find(" 3"), std::string::npos);
      auto began = std::chrono::steady_clock::now();
      EXPECT_TRUE(authenticated.Closed());
      EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(3));
   }
   System::SetStreamTimeoutTick(tick);
}

// A throw-away self-signed certificate for 127.0.0.1; empty when openssl failed.
std::string MakeCertificate() {
   static std::string dir = [] {
      std::string d = ::testing::TempDir() + "pelmora_session_tls_" + std::to_string(::getpid());
      std::string command = "mkdir -p " + d + " && cd " + d +
                            " && openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes"
                            " -keyout key.pem -out cert.pem -days 2 -subj /CN=localhost"
                            " -addext subjectAltName=IP:127.0.0.1 >/dev/null 2>&1";
      return std::system(command.c_str()) == 0 ? d : std::string();
   }();
   return dir;
}

TEST_F(SessionServerTest, CookiesAreSecureOnlyOverTls) {
   std::string dir = MakeCertificate();
   ASSERT_FALSE(dir.empty()) << "openssl could not make a certificate";
   System::SslServerOptions options;
   options.certificateChainFile = dir + "/cert.pem";
   options.privateKeyFile = dir + "/key.pem";
   Ref<System::SslContext> context;
   System::CreateSslServerContext(options, context);
   Ref<System::ServerSocket> socket;
   System::CreateSslServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), context.Get(), socket);
   Start(socket.Get());
   std::string out = RunCommand("curl -sk -D - --max-time 5 " + Url("/tls", "https"));
   size_t at = out.find("Set-Cookie: ");
   ASSERT_NE(at, std::string::npos) << out;
   EXPECT_EQ(out.substr(at, out.find("\r\n", at) - at),
             "Set-Cookie: pelmora_session=" + out.substr(out.find("\r\n\r\n") + 4, 32) +
                 "; Path=/; Secure; HttpOnly; SameSite=Strict");

   _svc->Stop();
   _socket->Close();
   StartPlain();
   out = RunCommand("curl -s -D - --max-time 5 " + Url("/plain"));
   ASSERT_NE(out.find("Set-Cookie: pelmora_session="), std::string::npos) << out;
   EXPECT_EQ(out.find("Secure"), std::string::npos) << out;
}

}  // namespace
}  // namespace Pelmora::Http
