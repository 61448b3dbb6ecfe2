#include <gtest/gtest.h>

#include <cstring>
#include <fstream>
#include <string>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/request.h"
#include "pelmora/http/response.h"
#include "pelmora/object/weak.h"
#include "pelmora/system/socket.h"
#include "tests/support/httpClient.h"
#include "tests/support/netFixture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::Http {
namespace {

using System::NetTesting::EnsurePool;
using Testing::RunCommand;

class TestConnection : public virtual HttpConnection, public ObjectImpl {
public:
   void GetClientCapabilities(ClientCapabilities& out) override { out = capabilities; }
   long long GetMaxBufferedResponseBytes() override { return maxBuffered; }
   void ResponseCompleted(bool keepAlive) override {
      ++completions;
      lastKeepAlive = keepAlive;
   }

   ClientCapabilities capabilities;
   long long maxBuffered = -1;
   int completions = 0;
   bool lastKeepAlive = true;
};

class ResponseTest : public ::testing::Test {
protected:
   void SetUp() override {
      EnsurePool();
      SetBufferSize(64);
      System::CreateStreamPair(_server, _client);
      _connection = new TestConnection();
      CreateResponse(_connection.Get(), _server.Get(), _response);
   }
   void TearDown() override {
      SetBufferSize(8192);
      _client->Close();
      _server->Close();
   }
   // Everything the client received once the server end is closed.
   std::string Received() {
      _server->Close();
      std::string out;
      char piece[4096];
      for (int n; (n = _client->Read(piece, sizeof piece)) > 0;) out.append(piece, static_cast<size_t>(n));
      return out;
   }
   static std::string WithoutDate(const std::string& text) {
      size_t at = text.find("Date: ");
      if (at == std::string::npos) return text;
      return text.substr(0, at) + text.substr(text.find("\r\n", at) + 2);
   }

   Ref<System::Stream> _server;
   Ref<System::Stream> _client;
   Ref<TestConnection> _connection;
   Ref<Response> _response;
};

TEST_F(ResponseTest, SmallBodyGoesOutWithContentLengthAtComplete) {
   _response->SetStatusCode(ResponseCode::UnsupportedMediaType);
   _response->GetHeader().SetContentType("text/plain");
   _response->Write("hello ", 6);
   _response->Write("world", 5);
   EXPECT_FALSE(_response->IsHeaderSent());
   _response->Complete();
   EXPECT_TRUE(_response->IsResponseComplete());
   EXPECT_EQ(_connection->completions, 1);
   EXPECT_TRUE(_connection->lastKeepAlive);
   EXPECT_EQ(WithoutDate(Received()),
             "HTTP/1.1 415 Unsuppored Media Type\r\nConnection: Keep-Alive\r\nContent-Length: 11\r\n"
             "Content-Type: text/plain\r\n\r\nhello world");
}

// A body outgrowing the buffer goes chunked. Responses on one connection share that
// buffer: nothing of a chunked, a whole-buffered or an abandoned answer may show in the
// next, nor may a buffer of the old size be used after the size changed.
TEST_F(ResponseTest, NextResponsesStartFromAnEmptyBuffer) {
   std::string chunked;
   for (int i = 0; i < 300; ++i) chunked += static_cast<char>('A' + i % 26);
   std::string body(150, 'x');
   auto next = [this](const char* text) {
      _response->Reset();
      _response->Write(text, static_cast<int>(std::strlen(text)));
      _response->Complete();
   };
   _response->SetChunkedEncodingAllowed();
   _response->Write(chunked.data(), 100);
   EXPECT_TRUE(_response->IsHeaderSent());
   _response->Write(chunked.data() + 100, 200);
   _response->Complete();
   next("one");
   _response->Reset();
   _response->Write(body.data(), static_cast<int>(body.size()));  // no chunking: kept whole
   _response->Complete();
   next("two");
   _response->Reset();
   _response->Write("dropped", 7);  // never completed
   SetBufferSize(128);
   next("three");
   std::string wire = Received();
   for (std::string stripped; (stripped = WithoutDate(wire)) != wire;) wire = stripped;
   std::string first = "HTTP/1.1 200 OK\r\nConnection: Keep-Alive\r\nTransfer-Encoding: chunked\r\n\r\n";
   for (size_t at = 0; at < 256; at += 64) first += "40\r\n" + chunked.substr(at, 64) + "\r\n";
   first += "2C\r\n" + chunked.substr(256) + "\r\n0\r\n\r\n";
   auto sized = [](const std::string& text) {
      return "HTTP/1.1 200 OK\r\nConnection: Keep-Alive\r\nContent-Length: " + std::to_string(text.size()) +
             "\r\n\r\n" + text;
   };
   EXPECT_EQ(wire, first + sized("one") + sized(body) + sized("two") + sized("three"));
}

TEST_F(ResponseTest, PresetLengthSendsSizedAndNoChunkingBuffersWhole) {
   std::string body(150, 'p');
   _response->SetContentLength(150);
   _response->Write(body.data(), 150);
   _response->Complete();
   std::string wire = WithoutDate(Received());
   EXPECT_NE(wire.find("Content-Length: 150\r\n"), std::string::npos);
   EXPECT_EQ(wire.find("Transfer-Encoding"), std::string::npos);
   EXPECT_EQ(wire.substr(wire.size() - 150), body);

   // No preset length and no chunking: the whole body waits, up to the maximum.
   Ref<System::Stream> server, client;
   System::CreateStreamPair(server, client);
   _connection->maxBuffered = 200;
   Ref<Response> response;
   CreateResponse(_connection.Get(), server.Get(), response);
   response->Write(body.data(), 150);
   EXPECT_FALSE(response->IsHeaderSent());
   try {
      response->Write(body.data(), 51);
      FAIL();
   } catch (const Exception& e) {
      EXPECT_EQ(e.GetMessage(), "Write would exceeded maximum buffered response size");
   }
   response->Write(body.data(), 50);
   response->Complete();
   server->Close();
   std::string got;
   char piece[1024];
   for (int n; (n = client->Read(piece, sizeof piece)) > 0;) got.append(piece, static_cast<size_t>(n));
   EXPECT_NE(got.find("Content-Length: 200\r\n"), std::string::npos);
   client->Close();
}

TEST_F(ResponseTest, ClientNeedingContentLengthIsBufferedUpToTheMaximum) {
   _connection->capabilities.needsContentLength = true;
   _connection->capabilities.canKeepAlive = false;
   _connection->maxBuffered = 100000;
   _response->SetChunkedEncodingAllowed();
   std::string body(70000, 'b');
   _response->Write(body.data(), static_cast<int>(body.size()));
   EXPECT_FALSE(_response->IsHeaderSent());
   try {
      _response->Write(body.data(), 30001);
      FAIL();
   } catch (const Exception& e) {
      EXPECT_EQ(e.GetMessage(),
                "Response body length exceeds configured maximum, 100000, for a client  that requires Content-Length");
   }
   _response->Complete();
   EXPECT_FALSE(_connection->lastKeepAlive);
   std::string wire = WithoutDate(Received());
   std::string head = "HTTP/1.1 200 OK\r\nConnection: close\r\nContent-Length: 70000\r\n\r\n";
   EXPECT_EQ(wire, head + body);
}

// A connection may hold its response by a weak link, which sees the response go.
TEST_F(ResponseTest, AWeakLinkSeesTheResponseGo) {
   Ref<System::Stream> server, client;
   System::CreateStreamPair(server, client);
   Ref<Response> response;
   CreateResponse(_connection.Get(), server.Get(), response);
   auto* linkable = dynamic_cast<WeakLinkable*>(response.Get());
   ASSERT_NE(linkable, nullptr);
   Ref<WeakLink> link;
   linkable->AttachWeakRef(link);
   Ref<Object> promoted;
   EXPECT_TRUE(link->Promote(promoted));
   promoted.Reset();
   response.Reset();
   EXPECT_FALSE(link->Promote(promoted));
}

TEST_F(ResponseTest, ErrorsContinueAndStateRules) {
   _response->SendContinue();
   _response->Write("discarded", 9);
   _response->SendError(ResponseCode::NotFound);
   EXPECT_THROW(_response->Write("x", 1), InvalidStateException);
   EXPECT_FALSE(_connection->lastKeepAlive);
   std::string wire = WithoutDate(Received());
   EXPECT_EQ(wire,
             "HTTP/1.1 100 Continue\r\n\r\n"
             "HTTP/1.1 404 Not Found\r\nConnection: close\r\nContent-Length: 14\r\n"
             "Content-Type: text/plain; charset=utf-8\r\n\r\n404 Not Found\n");

   Ref<System::Stream> server, client;
   System::CreateStreamPair(server, client);
   _response->ResetStream(server.Get());
   _response->Reset();
   _response->SetChunkedEncodingAllowed();
   std::string body(100, 'c');
   _response->Write(body.data(), 100);
   ASSERT_TRUE(_response->IsHeaderSent());
   try {
      _response->SendError(ResponseCode::InternalServerError, "late");
      FAIL();
   } catch (const IOException& e) {
      EXPECT_NE(e.GetMessage().find("Header already sent to client."), std::string::npos);
   }
   try {
      _response->SendContinue();
      FAIL();
   } catch (const InvalidStateException& e) {
      EXPECT_EQ(e.GetMessage(), "Cannot send continue -- not in state where output is valid.");
   }
   _response->Complete();
   client->Close();
   server->Close();
}

TEST_F(ResponseTest, LargeHeaderIsWrittenAheadOfTheBody) {
   _response->GetHeader().SetField("X-Large", std::string(2000, 'h'));
   _response->Write("body", 4);
   _response->Complete();
   std::string wire = Received();
   EXPECT_NE(wire.find("X-Large: " + std::string(2000, 'h') + "\r\n"), std::string::npos);
   EXPECT_EQ(wire.substr(wire.size() - 8), "\r\n\r\nbody");
}

TEST(ResponseDeathTest, CompletingTwiceIsAFault) {
   EnsurePool();
   Ref<System::Stream> server, client;
   System::CreateStreamPair(server, client);
   Ref<TestConnection> connection = new TestConnection();
   Ref<Response> response;
   CreateResponse(connection.Get(), server.Get(), response);
   response->Complete();
   EXPECT_DEATH(response->Complete(), "!IsResponseComplete\\(\\)");
   client->Close();
   server->Close();
}

// A real client reads back what the server sends: Python's http.client over TCP.
TEST(ResponseClientTest, PythonClientReadsAChunkedResponseByteExact) {
   EnsurePool();
   SetBufferSize(1000);
   Ref<System::ServerSocket> listener;
   System::CreateTcpServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), listener);
   Ref<System::BindingInfo> local;
   listener->GetBindingInfo(local);
   std::string body;
   for (int i = 0; i < 50000; ++i) body += static_cast<char>((i * 7919) % 251);
   std::string script = ::testing::TempDir() + "response_client.py";
   std::ofstream(script) << "import http.client, sys\n"
                            "c = http.client.HTTPConnection('127.0.0.1', "
                         << local->GetPort()
                         << ", timeout=20)\n"
                            "c.request('GET', '/data?x=1')\n"
                            "r = c.getresponse()\n"
                            "data = r.read()\n"
                            "sys.stdout.write('%d %s %d\\n' % (r.status, r.getheader('Transfer-Encoding'), len(data)))\n"
                            "sys.stdout.flush()\n"
                            "sys.stdout.buffer.write(data)\n";
   std::string output;
   std::thread client([&] { output = RunCommand("python3 " + script); });
   {
      Pelmora::Testing::Watchdog watchdog("the Python client");
      Ref<System::Stream> stream;
      listener->Accept(20000000, stream);
      Ref<Request> request;
      CreateRequest(stream.Get(), request);
      RequestWaiter waiter;
      request->AsyncReadHeader(waiter.Callback());
      ASSERT_TRUE(waiter.Wait(20000000));
      EXPECT_EQ(request->GetPath(), "/data?x=1");
      Ref<TestConnection> connection = new TestConnection();
      Ref<Response> response;
      CreateResponse(connection.Get(), stream.Get(), response);
      response->SetChunkedEncodingAllowed();
      response->GetHeader().SetContentType("application/octet-stream");
      for (size_t at = 0; at < body.size(); at += 777) {
         size_t n = std::min<size_t>(777, body.size() - at);
         response->Write(body.data() + at, static_cast<int>(n));
      }
      response->Complete();
      Pelmora::Testing::Join(client, "the Python client");
      stream->Close();
   }
   SetBufferSize(8192);
   listener->Close();
   std::string first = "200 chunked 50000\n";
   ASSERT_EQ(output.substr(0, first.size()), first) << output.substr(0, 300);
   EXPECT_TRUE(output.substr(first.size()) == body);
}

}  // namespace
}  // namespace Pelmora::Http
