#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <mutex>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "pelmora/soap/soapSvc.h"
#include "tests/support/httpClient.h"
#include "tests/support/netFixture.h"

namespace Pelmora::Soap {
namespace {

using System::NetTesting::DefaultLogCapture;
using System::NetTesting::EnsurePool;
using Http::Testing::RawClient;

constexpr char kRequest[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<SOAP-ENV:Envelope xmlns:SOAP-ENV=\"http://schemas.xmlsoap.org/soap/envelope/\" xmlns:ns=\"urn:anchor:echo\">\n"
    " <SOAP-ENV:Body>\n  <ns:echoString>\n   <in>&lt;b&gt; &amp; \"q\" \xC3\xA9</in>\n  </ns:echoString>\n"
    " </SOAP-ENV:Body>\n</SOAP-ENV:Envelope>";

constexpr char kEnvelopeHead[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<soapenv:Envelope\n"
    " xmlns:soapenc=\"http://schemas.xmlsoap.org/soap/encoding/\"\n"
    " xmlns:soapenv=\"http://schemas.xmlsoap.org/soap/envelope/\"\n"
    " xmlns:xsd=\"http://www.w3.org/2001/XMLSchema\"\n"
    " xmlns:xsi=\"http://www.w3.org/2001/XMLSchema-instance\">\n<soapenv:Body>\n";
constexpr char kEnvelopeTail[] = "\n</soapenv:Body>\n</soapenv:Envelope>";

// echoString: `in` back as `out`, times `repeat` when given; remembers the request's fields.
class EchoHandler : public virtual BodyHandler, public ObjectImpl {
public:
   void GetBodyHandlerInfo(BodyHandlerInfo& out) const override { out = {"urn:anchor:echo", "echoString"}; }
   void HandleBody(SoapRequest* request, Xml::ElementNode*, Xml::ElementNode* body, Reply* reply) override {
      {
         std::lock_guard<std::mutex> lock(mutex);
         action = agent = client = "(none)";
         request->GetSoapAction(action);
         request->GetUserAgent(agent);
         request->GetNorvexClient(client);
         Ref<Http::Session> session;
         sessionId = request->GetSession(session) ? session->GetId() : "(none)";
      }
      std::string text, repeat;
      Xml::EvaluateSimplePath(body, "*/in", text);
      std::string out = text;
      if (Xml::EvaluateSimplePath(body, "*/repeat", repeat))
         for (int i = 1; i < std::stoi(repeat); ++i) out += text;
      Ref<Xml::ElementNode> response, outElement;
      Xml::CreateElementNode("ns:echoStringResponse", response);
      response->DefineAttribute("xmlns:ns", "urn:anchor:echo");
      Xml::CreateElementNode("out", outElement);
      Ref<Xml::TextNode> value;
      Xml::CreateTextNode(out, value);
      outElement->AppendChild(value.Get());
      response->AppendChild(outElement.Get());
      reply->WriteReply(response.Get());
   }
   std::mutex mutex;
   std::string action, agent, client, sessionId;
};

// Answers what the SOAP service does not serve.
class Fallback : public Http::RequestHandlerMixin, public ObjectImpl {};

Ref<Service::Logger> TestLogger() {
   static Ref<Service::Logger> logger = [] {
      Ref<Service::Logger> made;
      Service::GetDefaultLogger()->CreateLogger("soapTest", 0x7F, made);
      return made;
   }();
   return logger;
}

class SoapSvcOnHttpTest : public ::testing::Test {
protected:
   void SetUp() override { EnsurePool(); }
   void TearDown() override {
      if (_soap) _soap->Stop();
      if (_http) _http->Stop();
   }
   void Start(const std::vector<std::pair<std::string, std::string>>& soapSettings = {},
              const std::vector<std::pair<std::string, std::string>>& httpSettings = {}, bool setHandler = true) {
      Ref<Service::Config> config;
      Service::CreateScratchConfig(config);
      Ref<Service::Config::View> httpView, soapView;
      config->GetView("pelmora/http", httpView);
      config->GetView("pelmora/soap", soapView);
      for (const auto& [key, value] : httpSettings) httpView->Set(key, value.c_str());
      for (const auto& [key, value] : soapSettings) soapView->Set(key, value.c_str());
      Ref<System::ServerSocket> socket;
      System::CreateTcpServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), socket);
      Ref<System::BindingInfo> local;
      socket->GetBindingInfo(local);
      _port = local->GetPort();
      Http::CreateHttpSvc(socket.Get(), TestLogger().Get(), httpView.Get(), _http);
      CreateSoapSvcOnHttp(TestLogger().Get(), _http.Get(), soapView.Get(), _soap);
      CreateBodyHandlerMap(TestLogger().Get(), "urn:anchor:echo", _map);
      _echo = new EchoHandler();
      _map->AddBodyHandler(_echo.Get());
      if (setHandler) _soap->SetSoapRequestHandler(_map.Get());
      _soap->Start();
      _http->SetRequestHandler(new Fallback());
      _http->Start();
   }
   static std::string Post(const std::string& body, const std::string& extra = "",
                           const std::string& version = "HTTP/1.1") {
      return "POST /soap " + version + "\r\nHost: x\r\nContent-Type: text/xml; charset=utf-8\r\n" + extra +
             "Content-Length: " + std::to_string(body.size()) + "\r\n\r\n" + body;
   }
   std::string Exchange(const std::string& request) {
      RawClient client(_port);
      client.Send(request);
      return client.ReadResponse();
   }
   std::string Get(const std::string& path) {
      return Exchange("GET " + path + " HTTP/1.1\r\nHost: x\r\nConnection: close\r\n\r\n");
   }
   static std::string Body(const std::string& response) {
      size_t at = response.find("\r\n\r\n");
      return at == std::string::npos ? std::string() : response.substr(at + 4);
   }

   Ref<Http::HttpSvc> _http;
   Ref<HttpSoapSvc> _soap;
   Ref<BodyHandlerMap> _map;
   Ref<EchoHandler> _echo;
   int _port = 0;
};

TEST_F(SoapSvcOnHttpTest, EchoRepliesCarryTheExactEnvelopeOnAKeptConnection) {
   Start();
   RawClient client(_port);
   for (int round = 0; round < 2; ++round) {
      client.Send(Post(kRequest));
      std::string response = client.ReadResponse();
      EXPECT_EQ(response.rfind("HTTP/1.1 200 OK\r\n", 0), 0u) << response;
      EXPECT_NE(response.find("Content-Type: text/xml; charset=utf-8\r\n"), std::string::npos) << response;
      EXPECT_EQ(Body(response), std::string(kEnvelopeHead) +
                                    "<ns:echoStringResponse xmlns:ns=\"urn:anchor:echo\"><out>&lt;b&gt; &amp; "
                                    "&quot;q&quot; \xC3\xA9</out></ns:echoStringResponse>" +
                                    kEnvelopeTail);
   }
}

TEST_F(SoapSvcOnHttpTest, RequestFieldsReachTheHandler) {
   Start();
   Exchange(Post(kRequest, "SOAPAction: \"urn:anchor:echo#echoString\"\r\nUser-Agent: tester/1\r\n"
                           "norvex_client: console\r\n"));
   {
      std::lock_guard<std::mutex> lock(_echo->mutex);
      EXPECT_EQ(_echo->action, "urn:anchor:echo#echoString");
      EXPECT_EQ(_echo->agent, "tester/1");
      EXPECT_EQ(_echo->client, "console");
   }
   Exchange(Post(kRequest));
   std::lock_guard<std::mutex> lock(_echo->mutex);
   EXPECT_EQ(_echo->action, "(none)");
   EXPECT_EQ(_echo->client, "(none)");
}

TEST_F(SoapSvcOnHttpTest, CallsKeepTheirSessionByCookieUntilTheLimit) {
   Start({{"maxSessionCount", "1"}});
   std::string response = Exchange(Post(kRequest));
   EXPECT_EQ(response.rfind("HTTP/1.1 200 OK", 0), 0u) << response;
   size_t at = response.find("Set-Cookie: norvex_soap_session=");
   ASSERT_NE(at, std::string::npos) << response;
   std::string id = response.substr(at + 32, 32);
   {
      std::lock_guard<std::mutex> lock(_echo->mutex);
      EXPECT_EQ(_echo->sessionId, id);
   }
   // The cookie brings the same session back, on another connection, and sets nothing new.
   response = Exchange(Post(kRequest, "Cookie: norvex_soap_session=" + id + "\r\n"));
   EXPECT_EQ(response.rfind("HTTP/1.1 200 OK", 0), 0u) << response;
   EXPECT_EQ(response.find("Set-Cookie"), std::string::npos) << response;
   {
      std::lock_guard<std::mutex> lock(_echo->mutex);
      EXPECT_EQ(_echo->sessionId, id);
   }
   // A caller without the cookie would need a second session.
   response = Exchange(Post(kRequest));
   EXPECT_EQ(response.rfind("HTTP/1.1 503 ", 0), 0u) << response;
   Ref<Http::SessionService> sessions;
   _soap->GetSessionService(sessions);
   ASSERT_TRUE(sessions);
   EXPECT_EQ(sessions->GetSessionCount(), 1u);

   // A count of zero turns sessions off: every call is served, none gets a cookie.
   _soap->Stop();
   _http->Stop();
   Start({{"maxSessionCount", "0"}});
   for (int i = 0; i < 2; ++i) {
      response = Exchange(Post(kRequest));
      EXPECT_EQ(response.rfind("HTTP/1.1 200 OK", 0), 0u) << response;
      EXPECT_EQ(response.find("Set-Cookie"), std::string::npos);
   }
   std::lock_guard<std::mutex> lock(_echo->mutex);
   EXPECT_EQ(_echo->sessionId, "(none)");
}

TEST_F(SoapSvcOnHttpTest, UnacceptableEnvelopesGetClientFaults) {
   Start({{"maxRequestBytes", "2048"}}, {{"maxRequestBodyBytes", "100000"}});
   std::string response = Exchange(Post("<oops>"));
   EXPECT_EQ(response.rfind("HTTP/1.1 500 ", 0), 0u) << response;
   EXPECT_NE(response.find("<faultcode>ClientFaultCode</faultcode>"), std::string::npos) << response;

   std::string entities = "<?xml version=\"1.0\"?><!DOCTYPE x [<!ENTITY a \"aaaa\">]>" + std::string(kRequest).substr(39);
   response = Exchange(Post(entities));
   EXPECT_NE(response.find("<faultcode>ClientFaultCode</faultcode>"), std::string::npos) << response;

   // A chunked body carries no length the HTTP server could refuse up front.
   std::string big = std::string(kRequest);
   big.insert(big.find("</in>"), std::string(4096, 'z'));
   char size[16];
   std::snprintf(size, sizeof size, "%zx", big.size());
   response = Exchange("POST /soap HTTP/1.1\r\nHost: x\r\nTransfer-Encoding: chunked\r\n\r\n" + std::string(size) +
                       "\r\n" + big + "\r\n0\r\n\r\n");
   EXPECT_NE(response.find("<faultstring>SOAP request exceeds 2048 bytes</faultstring>"), std::string::npos)
       << response;

   EXPECT_EQ(Exchange(Post(kRequest)).rfind("HTTP/1.1 200 OK", 0), 0u);
   response = Exchange(Post(std::string(200000, ' ')));
   EXPECT_EQ(response.rfind("HTTP/1.1 413 ", 0), 0u) << response;
}

TEST_F(SoapSvcOnHttpTest, WsdlDocumentsComeFromTheWsdlRoot) {
   DefaultLogCapture log;
   Start();
   std::string response = Get("/soap/echo.wsdl?wsdl");
   EXPECT_EQ(response.rfind("HTTP/1.1 501 ", 0), 0u) << response;
   EXPECT_TRUE(log.Contains("Empty WSDL root, failing"));

   char directory[] = "/tmp/soapWsdlXXXXXX";
   ASSERT_NE(::mkdtemp(directory), nullptr);
   std::ofstream(std::string(directory) + "/echo.wsdl") << "<definitions/>";
   _soap->SetWsdlRoot(directory);
   for (const char* path : {"/soap/echo.wsdl?wsdl", "/soap/echo?wsdl"}) {
      response = Get(path);
      EXPECT_EQ(response.rfind("HTTP/1.1 200 OK", 0), 0u) << path << response;
      EXPECT_NE(response.find("Content-Type: text/xml; charset=utf-8\r\n"), std::string::npos) << response;
      EXPECT_EQ(Body(response), "<definitions/>");
   }
   EXPECT_EQ(Get("/soap/missing.wsdl?wsdl").rfind("HTTP/1.1 404 ", 0), 0u);
   EXPECT_EQ(Get("/soap/../soap/echo.wsdl?wsdl").rfind("HTTP/1.1 404 ", 0), 0u);
   EXPECT_EQ(Get("/soap/echo.wsdl").rfind("HTTP/1.1 501 ", 0), 0u);
   std::remove((std::string(directory) + "/echo.wsdl").c_str());
   ::rmdir(directory);
}

TEST_F(SoapSvcOnHttpTest, ServiceStateNamesTheInstance) {
   Start();
   const std::string& id = _soap->GetInstanceId();
   EXPECT_EQ(id.size(), 36u);
   EXPECT_EQ(id[14], '4');
   for (const char* path : {"/serviceState", "/serviceState?x=1"}) {
      std::string response = Get(path);
      EXPECT_EQ(response.rfind("HTTP/1.1 200 OK", 0), 0u) << response;
      EXPECT_EQ(Body(response), "<?xml version=\"1.0\" encoding=\"UTF-8\"?><service><instanceId>" + id +
                                    "</instanceId></service>");
   }
   // Another service has another identifier.
   Ref<HttpSoapSvc> other;
   CreateSoapSvcOnHttp(nullptr, _http.Get(), nullptr, other);
   EXPECT_NE(other->GetInstanceId(), id);
}

TEST_F(SoapSvcOnHttpTest, ChunkingNeedsTheFlagAndHttp11) {
   std::string request = kRequest;
   request.insert(request.find("</ns:echoString>"), "<repeat>2000</repeat>");
   Start();  // off by default
   std::string response = Exchange(Post(request));
   EXPECT_EQ(response.find("Transfer-Encoding: chunked"), std::string::npos);
   EXPECT_NE(response.find("</soapenv:Envelope>"), std::string::npos);
   _soap->Stop();
   _http->Stop();
   Start({{"enableChunkedResponses", "true"}});
   response = Exchange(Post(request));
   EXPECT_NE(response.find("Transfer-Encoding: chunked"), std::string::npos) << response.substr(0, 300);
   response = Exchange(Post(request, "", "HTTP/1.0"));
   EXPECT_EQ(response.find("Transfer-Encoding: chunked"), std::string::npos);
   EXPECT_NE(response.find("Content-Length: "), std::string::npos);
}

TEST_F(SoapSvcOnHttpTest, StopUnregistersThePaths) {
   Start();
   _soap->Stop();
   std::string response = Exchange(Post(kRequest));
   EXPECT_EQ(response.find("echoStringResponse"), std::string::npos) << response;
}

class SoapSvcOnHttpDeathTest : public SoapSvcOnHttpTest {};

TEST_F(SoapSvcOnHttpDeathTest, APostWithoutRequestHandlerPanics) {
   EXPECT_DEATH(
       {
          Start({}, {}, false);
          Exchange(Post(kRequest));
          std::_Exit(0);
       },
       "_soapRequestHandler != __null");
}

}  // namespace
}  // namespace Pelmora::Soap
