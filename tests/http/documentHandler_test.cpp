#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/http/documentHandler.h"
#include "pelmora/service/config.h"
#include "tests/support/httpClient.h"
#include "tests/support/netFixture.h"

namespace Pelmora::Http {
namespace {

using System::NetTesting::DefaultLogCapture;
using System::NetTesting::EnsurePool;
using Testing::RawClient;
using Testing::RunCommand;
namespace fs = std::filesystem;

void WriteFile(const fs::path& path, const std::string& text) {
   fs::create_directories(path.parent_path());
   std::ofstream(path, std::ios::binary) << text;
}

class DocumentHandlerTest : public ::testing::Test {
protected:
   void SetUp() override {
      EnsurePool();
      _dir = fs::path(::testing::TempDir()) / ("docs" + std::to_string(::getpid()));
      fs::remove_all(_dir);
      WriteFile(_dir / "secret.txt", "top secret");
      WriteFile(_dir / "www/hello.txt", "hello there");
      WriteFile(_dir / "www/Logo.PNG", "png bytes");
      WriteFile(_dir / "www/sub/index.html", "<p>index</p>");
      WriteFile(_dir / "www/big.bin", std::string(100000, 'b'));
      fs::create_directories(_dir / "www/empty");
      WriteFile(_dir / "assets/app.js", "let a;");
   }
   void TearDown() override {
      if (_svc) _svc->Stop();
      fs::remove_all(_dir);
   }
   void Serve(bool chunked) {
      Ref<Service::Config> config;
      Service::CreateScratchConfig(config);
      Ref<Service::Config::View> view;
      config->GetMainView(view);
      view->Set("pelmora/documentHandler/enableChunkedResponses", chunked);
      CreateHTTPDocRequestHandler({{"/", (_dir / "www").string()}, {"/static", (_dir / "assets").string()}},
                                  view.Get(), _handler);
      Ref<System::ServerSocket> socket;
      System::CreateTcpServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), socket);
      Ref<System::BindingInfo> local;
      socket->GetBindingInfo(local);
      _port = local->GetPort();
      CreateHttpSvc(socket.Get(), nullptr, nullptr, _svc);
      _svc->SetRequestHandler(_handler.Get());
      _svc->Start();
   }
   std::string Fetch(const std::string& path, const std::string& method = "GET", const std::string& version = "1.1") {
      RawClient client(_port);
      client.Send(method + " " + path + " HTTP/" + version + "\r\nHost: x\r\nConnection: close\r\n\r\n");
      return client.ReadResponse(method == "HEAD");
   }

   fs::path _dir;
   Ref<DocumentHandler> _handler;
   Ref<HttpSvc> _svc;
   int _port = 0;
};

TEST(MimeTypeTest, ExtensionsAreLowerCasedAndUnknownOnesAreBinary) {
   EXPECT_EQ(GetMimeType("/x/a.PNG"), "image/png");
   EXPECT_EQ(GetMimeType("a.htm"), "text/html");
   EXPECT_EQ(GetMimeType("svc.WSDL"), "text/xml");
   EXPECT_EQ(GetMimeType("f.woff"), "application/font-woff");
   EXPECT_EQ(GetMimeType("photo.Jpeg"), "image/jpeg");
   EXPECT_EQ(GetMimeType("app.js"), "application/javascript");
   DefaultLogCapture log;
   EXPECT_EQ(GetMimeType("archive.tar.zst"), "application/octet-stream");
   EXPECT_EQ(GetMimeType("dir.d/noextension"), "application/octet-stream");
}

TEST_F(DocumentHandlerTest, ServesFilesUnderTheirRootsWithTypes) {
   Serve(false);
   std::string hello = Fetch("/hello.txt");
   EXPECT_NE(hello.find("HTTP/1.1 200"), std::string::npos) << hello;
   EXPECT_NE(hello.find("Content-Type: text/plain"), std::string::npos) << hello;
   EXPECT_NE(hello.find("\r\n\r\nhello there"), std::string::npos) << hello;
   EXPECT_NE(Fetch("/Logo.PNG?v=2").find("Content-Type: image/png"), std::string::npos);
   std::string js = Fetch("/static/app.js");
   EXPECT_NE(js.find("application/javascript"), std::string::npos) << js;
   EXPECT_NE(js.find("let a;"), std::string::npos) << js;
   EXPECT_NE(Fetch("/missing.txt").find("HTTP/1.1 404"), std::string::npos);
   EXPECT_NE(Fetch("/staticx/app.js").find("HTTP/1.1 404"), std::string::npos);
   // With chunking off a large file goes sized.
   std::string big = Fetch("/big.bin");
   EXPECT_NE(big.find("Content-Length: 100000"), std::string::npos) << big.substr(0, 300);
   EXPECT_EQ(big.find("Transfer-Encoding"), std::string::npos);
   EXPECT_EQ(big.size() - big.find("\r\n\r\n") - 4, 100000u);
}

TEST_F(DocumentHandlerTest, TraversalIsAnsweredNotFoundHoweverEncoded) {
   Serve(false);
   for (const char* path : {"/sub/../../secret.txt", "/%2e%2e/secret.txt", "/sub/%2E%2E/%2e%2e/secret.txt",
                            "/%252e%252e/secret.txt", "/sub/..%2f..%2fsecret.txt", "/static/..%5c..%5csecret.txt",
                            "/sub/.."}) {
      std::string response = Fetch(path);
      EXPECT_NE(response.find("HTTP/1.1 404"), std::string::npos) << path << "\n" << response;
      EXPECT_EQ(response.find("top secret"), std::string::npos) << path;
   }
}

TEST_F(DocumentHandlerTest, DirectoriesRedirectOrServeTheirIndex) {
   Serve(false);
   std::string redirect = Fetch("/sub");
   EXPECT_NE(redirect.find("HTTP/1.1 301"), std::string::npos) << redirect;
   EXPECT_NE(redirect.find("Location: /sub/"), std::string::npos) << redirect;
   std::string index = Fetch("/sub/");
   EXPECT_NE(index.find("Content-Type: text/html"), std::string::npos) << index;
   EXPECT_NE(index.find("<p>index</p>"), std::string::npos) << index;
   EXPECT_NE(Fetch("/empty/").find("HTTP/1.1 404"), std::string::npos);
}

TEST_F(DocumentHandlerTest, UnreadableFilesAreForbidden) {
   if (::geteuid() == 0) GTEST_SKIP() << "root reads every file";
   Serve(false);
   ::chmod((_dir / "www/hello.txt").c_str(), 0);
   EXPECT_NE(Fetch("/hello.txt").find("HTTP/1.1 403"), std::string::npos);
}

TEST_F(DocumentHandlerTest, HeadSendsNoBodyAndChunkingFollowsTheSwitch) {
   Serve(true);
   RawClient client(_port);
   client.Send("HEAD /hello.txt HTTP/1.1\r\nHost: x\r\n\r\nGET /hello.txt HTTP/1.1\r\nHost: x\r\n\r\n");
   std::string head = client.ReadResponse(true);
   EXPECT_NE(head.find("HTTP/1.1 200"), std::string::npos) << head;
   EXPECT_NE(head.find("Content-Length: 11\r\n"), std::string::npos) << head;
   // The next response starts right after the header: no body came with HEAD.
   std::string get = client.ReadResponse();
   EXPECT_EQ(get.rfind("HTTP/1.1 200", 0), 0u) << get;
   EXPECT_NE(get.find("hello there"), std::string::npos);

   std::string big = Fetch("/big.bin");
   EXPECT_NE(big.find("Transfer-Encoding: chunked"), std::string::npos) << big.substr(0, 300);
   std::string old = Fetch("/big.bin", "GET", "1.0");
   EXPECT_NE(old.find("Content-Length: 100000"), std::string::npos) << old.substr(0, 300);
   EXPECT_EQ(RunCommand("curl -s --max-time 5 http://127.0.0.1:" + std::to_string(_port) + "/big.bin | wc -c"),
             "100000\n");
}

// The value of `field` in a response header, empty when absent.
std::string FieldOf(const std::string& response, const std::string& field) {
   size_t at = response.find("\r\n" + field + ": ");
   if (at == std::string::npos) return "";
   at += field.size() + 4;
   return response.substr(at, response.find("\r\n", at) - at);
}

std::string BodyOf(const std::string& response) { return response.substr(response.find("\r\n\r\n") + 4); }

TEST_F(DocumentHandlerTest, ConditionalRequestsAreAnsweredNotModified) {
   Serve(false);
   std::string first = Fetch("/hello.txt");
   std::string tag = FieldOf(first, "ETag");
   std::string modified = FieldOf(first, "Last-Modified");
   ASSERT_FALSE(tag.empty()) << first;
   ASSERT_FALSE(modified.empty()) << first;
   EXPECT_EQ(FieldOf(first, "Accept-Ranges"), "bytes");

   RawClient client(_port);
   auto ask = [&](const std::string& fields) {
      client.Send("GET /hello.txt HTTP/1.1\r\nHost: x\r\n" + fields + "\r\n");
      // A 304 has no body: what follows on the connection is the next answer.
      return client.ReadResponse(true);
   };
   std::string answer = ask("If-None-Match: " + tag + "\r\n");
   EXPECT_EQ(answer.rfind("HTTP/1.1 304", 0), 0u) << answer;
   EXPECT_EQ(FieldOf(answer, "ETag"), tag);
   answer = ask("If-Modified-Since: " + modified + "\r\n");
   EXPECT_EQ(answer.rfind("HTTP/1.1 304", 0), 0u) << answer;
   // A tag that does not match wins over a date that does.
   client.Send("GET /hello.txt HTTP/1.1\r\nIf-None-Match: \"other\"\r\nIf-Modified-Since: " + modified + "\r\n\r\n");
   answer = client.ReadResponse();
   EXPECT_EQ(answer.rfind("HTTP/1.1 200", 0), 0u) << answer;
   EXPECT_EQ(BodyOf(answer), "hello there");
   client.Send("GET /hello.txt HTTP/1.1\r\nIf-Modified-Since: Thu, 01 Jan 1998 00:00:00 GMT\r\n\r\n");
   EXPECT_EQ(BodyOf(client.ReadResponse()), "hello there");

   std::string url = "http://127.0.0.1:" + std::to_string(_port) + "/hello.txt";
   EXPECT_EQ(RunCommand("curl -s -o /dev/null -w '%{http_code}' --max-time 5 -H 'If-None-Match: " + tag + "' " + url),
             "304");
   EXPECT_EQ(RunCommand("curl -s -o /dev/null -w '%{http_code}' --max-time 5 -z '" + modified + "' " + url), "304");

   // Rewritten, the file gets a new tag and the old one no longer matches.
   WriteFile(_dir / "www/hello.txt", "hello again, longer");
   answer = Fetch("/hello.txt");
   EXPECT_NE(FieldOf(answer, "ETag"), tag);
   EXPECT_EQ(RunCommand("curl -s --max-time 5 -H 'If-None-Match: " + tag + "' " + url), "hello again, longer");
}

TEST_F(DocumentHandlerTest, SingleRangesArePartialAndOthersWhole) {
   std::string content;
   for (int i = 0; i < 10000; ++i) content += std::to_string(i % 10);
   WriteFile(_dir / "www/digits.txt", content);
   Serve(false);
   auto ranged = [&](const std::string& range, const std::string& extra = "") {
      RawClient client(_port);
      client.Send("GET /digits.txt HTTP/1.1\r\nHost: x\r\nConnection: close\r\nRange: " + range + "\r\n" + extra +
                  "\r\n");
      return client.ReadResponse();
   };
   std::string answer = ranged("bytes=3-12");
   EXPECT_EQ(answer.rfind("HTTP/1.1 206", 0), 0u) << answer;
   EXPECT_EQ(FieldOf(answer, "Content-Range"), "bytes 3-12/10000");
   EXPECT_EQ(BodyOf(answer), content.substr(3, 10));
   answer = ranged("bytes=-3");
   EXPECT_EQ(FieldOf(answer, "Content-Range"), "bytes 9997-9999/10000");
   EXPECT_EQ(BodyOf(answer), "789");
   answer = ranged("bytes=10000-");
   EXPECT_EQ(answer.rfind("HTTP/1.1 416", 0), 0u) << answer;
   EXPECT_EQ(FieldOf(answer, "Content-Range"), "bytes */10000");

   // Several ranges and a stale If-Range get the whole file.
   answer = ranged("bytes=0-1,5-6");
   EXPECT_EQ(answer.rfind("HTTP/1.1 200", 0), 0u) << answer;
   EXPECT_EQ(BodyOf(answer), content);
   EXPECT_EQ(ranged("bytes=0-1", "If-Range: \"stale\"\r\n").rfind("HTTP/1.1 200", 0), 0u);
   std::string tag = FieldOf(Fetch("/digits.txt"), "ETag");
   EXPECT_EQ(BodyOf(ranged("bytes=0-1", "If-Range: " + tag + "\r\n")), "01");

   std::string url = "http://127.0.0.1:" + std::to_string(_port) + "/digits.txt";
   EXPECT_EQ(RunCommand("curl -s --max-time 5 -r 100-104 " + url), "01234");
   EXPECT_EQ(RunCommand("curl -s -o /dev/null -w '%{http_code}' --max-time 5 -r 20000-30000 " + url), "416");
}

TEST_F(DocumentHandlerTest, LargeFilesAndRangesArriveExactlyEvenToSlowReaders) {
   std::string content(5 << 20, '\0');
   unsigned int state = 7;
   for (char& c : content) {
      state = state * 1103515245u + 12345u;
      c = static_cast<char>(state >> 16);
   }
   WriteFile(_dir / "www/large.bin", content);
   Serve(false);
   std::string url = "http://127.0.0.1:" + std::to_string(_port) + "/large.bin";
   std::string copy = (_dir / "copy.bin").string();
   RunCommand("curl -s --max-time 20 -o " + copy + " " + url);
   EXPECT_EQ(RunCommand("cmp " + copy + " " + (_dir / "www/large.bin").string() + " && echo same"), "same\n");
   RunCommand("curl -s --max-time 20 -r 1000000-3999999 -o " + copy + " " + url);
   std::ifstream part(copy, std::ios::binary);
   std::string got((std::istreambuf_iterator<char>(part)), std::istreambuf_iterator<char>());
   EXPECT_TRUE(got == content.substr(1000000, 3000000)) << "range differs, " << got.size() << " bytes";

   // Readers that take nothing for a while: the rest of their file waits on the I/O
   // service, other requests are answered, and each gets every byte in the end.
   std::vector<std::unique_ptr<RawClient>> stalled;
   for (int i = 0; i < 12; ++i) {
      stalled.push_back(std::make_unique<RawClient>(_port, 10000));
      int size = 65536;
      stalled.back()->SetReceiveBuffer(size);
      stalled.back()->Send("GET /large.bin HTTP/1.1\r\nHost: x\r\nConnection: close\r\n\r\n");
   }
   std::this_thread::sleep_for(std::chrono::milliseconds(100));
   EXPECT_NE(Fetch("/hello.txt").find("hello there"), std::string::npos);
   for (auto& reader : stalled) {
      std::string answer = reader->ReadResponse();
      ASSERT_NE(answer.find("\r\n\r\n"), std::string::npos);
      EXPECT_TRUE(BodyOf(answer) == content) << "a stalled reader got other bytes";
   }
}

TEST_F(DocumentHandlerTest, SubHandlersComeBeforeFiles) {
   Serve(false);
   _handler->RegisterURIHandler("/hello.txt", [](Request*, Response* response) {
      response->Write("generated", 9);
      response->Complete();
   });
   URIHandler found;
   EXPECT_TRUE(_handler->GetURIHandler("/hello.txt", found));
   EXPECT_NE(Fetch("/hello.txt?q=1").find("generated"), std::string::npos);
   _handler->UnregisterURIHandler("/hello.txt");
   EXPECT_FALSE(_handler->GetURIHandler("/hello.txt", found));
   EXPECT_NE(Fetch("/hello.txt").find("hello there"), std::string::npos);
}

}  // namespace
}  // namespace Pelmora::Http
