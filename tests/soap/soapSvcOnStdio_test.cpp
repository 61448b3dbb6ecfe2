#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <map>
#include <thread>

#include "pelmora/soap/soapSvc.h"
#include "src/soap/soapImpl.h"
#include "tests/support/defaultLogCapture.h"

namespace Pelmora::Soap {
namespace {

constexpr char kEcho[] =
    "<s:Envelope xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\"><s:Body><e:echoString "
    "xmlns:e=\"urn:anchor:echo\"><in>h\xC3\xA9 &amp; &lt;x&gt;</in></e:echoString></s:Body></s:Envelope>";

// Echoes "in" as "out"; a body "fail" throws.
class Echo : public virtual SoapRequestHandler, public ObjectImpl {
public:
   void HandleRequest(SoapRequest* request, Reply* reply) override {
      Ref<Xml::ElementNode> header, body;
      ParseSoapBody(nullptr, request, header, body);
      if (body->GetTag() == "fail") throw InvalidStateException("handler broke");
      request->GetSoapAction(action);
      std::string text;
      Xml::EvaluateSimplePath(body.Get(), "*/in", text);
      Ref<Xml::ElementNode> out;
      Xml::CreateElementNode("out", out);
      Ref<Xml::TextNode> value;
      Xml::CreateTextNode(text, value);
      out->AppendChild(value.Get());
      reply->WriteReply(out.Get());
   }
   std::string action;
};

Ref<Service::Logger> TestLogger() {
   static Ref<Service::Logger> logger = [] {
      Ref<Service::Logger> made;
      Service::GetDefaultLogger()->CreateLogger("soapStdioTest", 0x7F, made);
      return made;
   }();
   return logger;
}

// Runs one request through a service on pipes: `input` on its standard input, the
// environment given, and returns what it wrote and its exit status.
struct Outcome {
   int status;
   std::string output;
};

Outcome Serve(bool cgi, const std::string& input, std::map<std::string, std::string> environment = {},
            Ref<Echo> echo = new Echo()) {
   int in[2], out[2];
   EXPECT_EQ(::pipe(in), 0);
   EXPECT_EQ(::pipe(out), 0);
   std::thread feeder([&] {
      size_t done = 0;
      while (done < input.size()) {
         ssize_t n = ::write(in[1], input.data() + done, input.size() - done);
         if (n <= 0) break;
         done += static_cast<size_t>(n);
      }
      ::close(in[1]);
   });
   Ref<StdinSoapSvc> svc;
   CreateStdinSoapSvc(TestLogger().Get(), cgi, in[0], out[1],
                      [environment](const char* name) -> const char* {
                         auto found = environment.find(name);
                         return found == environment.end() ? nullptr : found->second.c_str();
                      },
                      svc);
   svc->SetSoapRequestHandler(echo.Get());
   svc->Start();
   Outcome outcome;
   outcome.status = svc->HandleStdin();
   ::close(out[1]);
   // The service may leave input unread: the inputs here fit the pipe, so the feeder ends
   // without a reader, and the read end closes only after it (no SIGPIPE).
   feeder.join();
   ::close(in[0]);
   char piece[4096];
   for (ssize_t n; (n = ::read(out[0], piece, sizeof piece)) > 0;) outcome.output.append(piece, static_cast<size_t>(n));
   ::close(out[0]);
   return outcome;
}

TEST(SoapSvcOnStdioTest, AnswersOneRequestWithTheEnvelopeAndLogsItsSteps) {
   TestSupport::DefaultLogCapture log("soapStdio");
   Outcome outcome = Serve(false, kEcho);
   EXPECT_EQ(outcome.status, 0);
   EXPECT_EQ(outcome.output.rfind("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<soapenv:Envelope\n", 0), 0u);
   EXPECT_NE(outcome.output.find("<soapenv:Body>\n<out>h\xC3\xA9 &amp; &lt;x&gt;</out>\n</soapenv:Body>"),
             std::string::npos)
       << outcome.output;
   for (const char* line : {"Dispatching stdin request", "Request dispatch complete", "SoapSvcOnStdio"})
      EXPECT_TRUE(log.Contains(line)) << line;
}

TEST(SoapSvcOnStdioTest, EmptyInputIsRetriedThenFaulted) {
   TestSupport::DefaultLogCapture log("soapStdioEmpty");
   Outcome outcome = Serve(false, "");
   EXPECT_EQ(outcome.status, 1);
   EXPECT_TRUE(log.Contains("Zero-length read on stdin, retrying"));
   EXPECT_NE(outcome.output.find("<faultcode>ClientFaultCode</faultcode>"), std::string::npos);
}

TEST(SoapSvcOnStdioTest, HandlerFailuresAreLoggedAndFaulted) {
   TestSupport::DefaultLogCapture log("soapStdioFail");
   std::string failing = kEcho;
   failing.replace(failing.find("<e:echoString"), std::string::npos, "<fail/></s:Body></s:Envelope>");
   Outcome outcome = Serve(false, failing);
   EXPECT_EQ(outcome.status, 1);
   EXPECT_TRUE(log.Contains("Exception while dispatching SOAP request: handler broke"));
   EXPECT_NE(outcome.output.find("<faultcode>ServerFaultCode</faultcode><faultstring>handler broke"),
             std::string::npos);
   outcome = Serve(false, "<not-soap/>");
   EXPECT_TRUE(log.Contains("Client sent us an invalid SOAP request: Missing SOAP Envelope element"));
   EXPECT_NE(outcome.output.find("<faultcode>ClientFaultCode</faultcode>"), std::string::npos);
}

TEST(CgiSoapSvcTest, OtherMethodsGet405WithAllow) {
   Outcome outcome = Serve(true, "", {{"REQUEST_METHOD", "GET"}, {"REQUEST_URI", "/cgi-bin/soap?wsdl"}});
   std::string text = "HTTP method GET not supported for URL: /cgi-bin/soap?wsdl";
   EXPECT_EQ(outcome.output, "Status: 405 Method Not Allowed\r\nAllow: POST\r\nContent-Length: " +
                                 std::to_string(text.size()) + "\r\nContent-Type: text/plain\r\n\r\n" + text);
   outcome = Serve(true, "", {{"REQUEST_METHOD", "PUT"}, {"SCRIPT_NAME", "/cgi-bin/soap"}, {"PATH_INFO", "svc"},
                            {"QUERY_STRING", "a=1"}});
   EXPECT_NE(outcome.output.find("\r\n\r\nHTTP method PUT not supported for URL: /cgi-bin/soap/svc?a=1"),
             std::string::npos)
       << outcome.output;
   TestSupport::DefaultLogCapture log("soapCgiMissing");
   outcome = Serve(true, "", {});
   EXPECT_EQ(outcome.status, 1);
   EXPECT_TRUE(log.Contains("Missing environment variable REQUEST_METHOD"));
   EXPECT_EQ(outcome.output.rfind("Status: 400 Bad Request\r\n", 0), 0u);
}

TEST(CgiSoapSvcTest, PostReadsContentLengthBytesAndTheRequestFields) {
   std::string body = kEcho;
   Ref<Echo> echo(new Echo());
   // Bytes past CONTENT_LENGTH are not part of the request.
   Outcome outcome = Serve(true, body + "trailing garbage",
                         {{"REQUEST_METHOD", "POST"}, {"CONTENT_LENGTH", std::to_string(body.size())},
                          {"CONTENT_TYPE", "text/xml"}, {"HTTP_SOAPACTION", "\"urn:anchor:echo#echoString\""}},
                         echo);
   EXPECT_EQ(outcome.status, 0);
   EXPECT_EQ(outcome.output.rfind("Status: 200 OK\r\nContent-Length: ", 0), 0u) << outcome.output;
   EXPECT_NE(outcome.output.find("<out>h\xC3\xA9 &amp; &lt;x&gt;</out>"), std::string::npos);
   EXPECT_EQ(echo->action, "urn:anchor:echo#echoString");
}

TEST(CgiSoapSvcTest, OversizedRequestsAreRefusedUnread) {
   Outcome outcome = Serve(true, kEcho, {{"REQUEST_METHOD", "POST"}, {"CONTENT_LENGTH", "99999999999"}});
   EXPECT_EQ(outcome.status, 1);
   EXPECT_EQ(outcome.output.rfind("Status: 500 Internal Server Error\r\n", 0), 0u);
   EXPECT_NE(outcome.output.find("<faultstring>SOAP request exceeds 10485760 bytes</faultstring>"),
             std::string::npos);
}

#ifdef PELMORA_SOAP_ECHO
// The example program as a web server or a parent process would run it.
Outcome RunProgram(const std::vector<std::string>& arguments, const std::map<std::string, std::string>& environment,
                   const std::string& input) {
   int in[2], out[2];
   EXPECT_EQ(::pipe(in), 0);
   EXPECT_EQ(::pipe(out), 0);
   pid_t child = ::fork();
   if (child == 0) {
      ::dup2(in[0], 0);
      ::dup2(out[1], 1);
      ::close(in[1]);
      ::close(out[0]);
      ::clearenv();
      for (const auto& [name, value] : environment) ::setenv(name.c_str(), value.c_str(), 1);
      std::vector<char*> argv{const_cast<char*>(PELMORA_SOAP_ECHO)};
      for (const std::string& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
      argv.push_back(nullptr);
      ::execv(argv[0], argv.data());
      ::_exit(127);
   }
   ::close(in[0]);
   ::close(out[1]);
   ssize_t written = ::write(in[1], input.data(), input.size());
   EXPECT_EQ(written, static_cast<ssize_t>(input.size()));
   ::close(in[1]);
   Outcome outcome;
   char piece[4096];
   for (ssize_t n; (n = ::read(out[0], piece, sizeof piece)) > 0;) outcome.output.append(piece, static_cast<size_t>(n));
   ::close(out[0]);
   int status = 0;
   ::waitpid(child, &status, 0);
   outcome.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
   return outcome;
}

TEST(SoapEchoProgramTest, StdioModeThroughAPipe) {
   Outcome outcome = RunProgram({"--stdio"}, {}, kEcho);
   EXPECT_EQ(outcome.status, 0);
   EXPECT_NE(outcome.output.find("<ns:echoStringResponse xmlns:ns=\"urn:anchor:echo\"><out>h\xC3\xA9 &amp; "
                                 "&lt;x&gt;</out></ns:echoStringResponse>"),
             std::string::npos)
       << outcome.output;
   outcome = RunProgram({"--stdio"}, {}, "<broken");
   EXPECT_EQ(outcome.status, 1);
   EXPECT_NE(outcome.output.find("ClientFaultCode"), std::string::npos);
}

TEST(SoapEchoProgramTest, CgiModeWithAWebServersEnvironment) {
   std::string body = kEcho;
   Outcome outcome = RunProgram({}, {{"GATEWAY_INTERFACE", "CGI/1.1"}, {"REQUEST_METHOD", "POST"},
                                     {"CONTENT_LENGTH", std::to_string(body.size())},
                                     {"CONTENT_TYPE", "text/xml; charset=utf-8"}},
                                body);
   EXPECT_EQ(outcome.status, 0);
   EXPECT_EQ(outcome.output.rfind("Status: 200 OK\r\n", 0), 0u) << outcome.output;
   EXPECT_NE(outcome.output.find("\r\nContent-Type: text/xml; charset=utf-8\r\n\r\n<?xml"), std::string::npos);
   EXPECT_NE(outcome.output.find("<out>h\xC3\xA9 &amp; &lt;x&gt;</out>"), std::string::npos);
   outcome = RunProgram({"--cgi"}, {{"REQUEST_METHOD", "GET"}, {"REQUEST_URI", "/soap"}}, "");
   EXPECT_EQ(outcome.status, 1);
   EXPECT_EQ(outcome.output.rfind("Status: 405 Method Not Allowed\r\nAllow: POST\r\n", 0), 0u) << outcome.output;
}
#endif

}  // namespace
}  // namespace Pelmora::Soap
