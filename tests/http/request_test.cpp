#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/request.h"
#include "tests/support/netFixture.h"

namespace Pelmora::Http {
namespace {

using System::NetTesting::EnsurePool;

// A server end reading requests and the client end writing them.
class RequestTest : public ::testing::Test {
protected:
   void SetUp() override {
      EnsurePool();
      System::CreateStreamPair(_server, _client);
      CreateRequest(_server.Get(), _request);
   }
   void TearDown() override {
      _client->Close();
      _server->Close();
   }

   void Send(const std::string& bytes) {
      if (!bytes.empty()) _client->Write(bytes.data(), static_cast<int>(bytes.size()));
   }
   // Reads one header; the failure text (empty on success) and whether one was read.
   std::string ReadHeader(bool& got) {
      RequestWaiter waiter;
      _request->AsyncReadHeader(waiter.Callback());
      try {
         got = waiter.Wait(10000000);
         return "";
      } catch (const Exception& e) {
         got = false;
         return e.GetMessage();
      }
   }
   std::string ReadBody() {
      std::string body;
      char piece[7];
      for (int n; (n = _request->Read(piece, sizeof piece)) > 0;) body.append(piece, static_cast<size_t>(n));
      return body;
   }

   Ref<System::Stream> _server;
   Ref<System::Stream> _client;
   Ref<Request> _request;
};

TEST_F(RequestTest, HeaderSplitAtEveryByteBoundaryArrivesWhole) {
   const std::string header = "\r\nPOST /a%20b HTTP/1.1\r\nHost: h\r\nContent-Length: 3\r\n\r\n";
   for (size_t split = 1; split < header.size(); ++split) {
      RequestWaiter waiter;
      _request->AsyncReadHeader(waiter.Callback());
      Send(header.substr(0, split));
      // Give the first piece a moment to be read alone.
      std::this_thread::sleep_for(std::chrono::microseconds(200));
      Send(header.substr(split) + "xyz");
      ASSERT_TRUE(waiter.Wait(10000000)) << split;
      EXPECT_EQ(_request->GetMethod(), RequestHeader::POST);
      EXPECT_EQ(_request->GetPath(), "/a b");
      EXPECT_EQ(_request->GetHttpVersion(), 272);
      EXPECT_EQ(_request->GetContentLength(), 3);
      EXPECT_EQ(ReadBody(), "xyz") << split;
      _request->ResetStream(_server.Get());
   }
}

TEST_F(RequestTest, HeaderAreaHoldsExactly10240Bytes) {
   const std::string start = "GET /big HTTP/1.1\r\nX-Fill: ";
   const std::string end = "\r\n\r\n";
   std::string exact = start + std::string(10240 - start.size() - end.size(), 'f') + end;
   ASSERT_EQ(exact.size(), 10240u);
   Send(exact);
   bool got = false;
   EXPECT_EQ(ReadHeader(got), "");
   EXPECT_TRUE(got);
   EXPECT_EQ(_request->GetPath(), "/big");

   std::string over = start + std::string(10241 - start.size() - end.size(), 'f') + end;
   _request->ResetStream(_server.Get());
   Send(over);
   EXPECT_EQ(ReadHeader(got), "Request header unexpectedly large");
   EXPECT_FALSE(got);
}

TEST_F(RequestTest, PeerClosingIdleGivesNoRequestAndNoError) {
   _client->Close();
   bool got = true;
   EXPECT_EQ(ReadHeader(got), "");
   EXPECT_FALSE(got);
}

TEST_F(RequestTest, PeerClosingInsideTheHeaderFails) {
   Send("GET / HTTP/1.1\r\nHo");
   _client->Close();
   bool got = true;
   EXPECT_EQ(ReadHeader(got), "The HTTP client closed the stream prematurely after 18 bytes.");
}

TEST_F(RequestTest, BadHeadersReachTheCallback) {
   struct Case {
      std::string bytes;
      const char* text;
   } cases[] = {
      {std::string("GET / HTTP/1.1\r\nA: \0\r\n\r\n", 24), "invalid value 0 "},
      {"GET / HTTP/1.1\r\nContent-Length: -1\r\n\r\n", "Content-Length is a negative value"},
      {"BREW /pot HTTP/1.1\r\n\r\n", "Not Supported"},
   };
   for (const Case& c : cases) {
      Ref<System::Stream> server, client;
      System::CreateStreamPair(server, client);
      CreateRequest(server.Get(), _request);
      client->Write(c.bytes.data(), static_cast<int>(c.bytes.size()));
      RequestWaiter waiter;
      _request->AsyncReadHeader(waiter.Callback());
      try {
         waiter.Wait(10000000);
         ADD_FAILURE() << c.text;
      } catch (const Exception& e) {
         EXPECT_EQ(e.GetMessage(), c.text);
      }
      client->Close();
      server->Close();
   }
}

TEST_F(RequestTest, PipelinedRequestsKeepTheirBodiesApart) {
   Send("POST /one HTTP/1.1\r\nContent-Length: 5\r\n\r\nhello"
        "PUT /two HTTP/1.1\r\nTransfer-Encoding: chunked\r\n\r\n3\r\nabc\r\n0\r\n\r\n"
        "GET /three HTTP/1.0\r\nConnection: close\r\n\r\n"
        "POST /four HTTP/1.1\r\nContent-Length: 4\r\n\r\nlast");
   bool got = false;
   ASSERT_EQ(ReadHeader(got), "");
   EXPECT_EQ(_request->GetPath(), "/one");
   EXPECT_EQ(ReadBody(), "hello");
   _request->ResetStream(_server.Get());
   ASSERT_EQ(ReadHeader(got), "");
   EXPECT_EQ(_request->GetPath(), "/two");
   EXPECT_TRUE(_request->IsChunkedEncoded());
   EXPECT_EQ(ReadBody(), "abc");
   _request->ResetStream(_server.Get());
   ASSERT_EQ(ReadHeader(got), "");
   EXPECT_EQ(_request->GetPath(), "/three");
   EXPECT_FALSE(_request->GetKeepAlive());
   EXPECT_EQ(_request->GetHttpVersion(), 256);
   EXPECT_EQ(ReadBody(), "");
   _request->ResetStream(_server.Get());
   ASSERT_EQ(ReadHeader(got), "");
   EXPECT_EQ(_request->GetPath(), "/four");
   EXPECT_EQ(ReadBody(), "last");
}

TEST_F(RequestTest, ChunkedBodyWithExtensionsAndTrailersThroughAsyncRead) {
   Send("POST /c HTTP/1.1\r\nTransfer-Encoding: chunked\r\nExpect: 100-Continue\r\n\r\n"
        "4;name=value\r\nWiki\r\n");
   bool got = false;
   ASSERT_EQ(ReadHeader(got), "");
   EXPECT_TRUE(_request->IsContinueExpected());
   std::string body;
   char piece[3];
   System::NetTesting::Completion completion;
   // One AsyncRead; its byte count, or -1 when it failed or never completed.
   auto readOnce = [&]() {
      int before = completion.Count();
      _request->AsyncRead(piece, sizeof piece, [&](Request*, Exception* error, int n) {
         if (error == nullptr && n > 0) body.append(piece, static_cast<size_t>(n));
         completion.Done(error, n);
      });
      if (!completion.WaitCount(before + 1) || completion.Failed()) return -1;
      return completion.Bytes();
   };
   while (body.size() < 4) ASSERT_GT(readOnce(), 0) << completion.Error();
   Send("5\r\npedia\r\n0\r\nX-Checksum: 1\r\nX-Other: 2\r\n\r\n");
   for (int n; (n = readOnce()) != 0;) ASSERT_GT(n, 0) << completion.Error();
   EXPECT_EQ(body, "Wikipedia");
}

TEST_F(RequestTest, BodyFailures) {
   Send("POST /c HTTP/1.1\r\nTransfer-Encoding: chunked\r\n\r\n" + std::string(600, '1') + "\r\n");
   bool got = false;
   ASSERT_EQ(ReadHeader(got), "");
   char piece[16];
   try {
      _request->Read(piece, sizeof piece);
      FAIL();
   } catch (const Exception& e) {
      EXPECT_EQ(e.GetMessage(), "Malformed chunk header.");
   }
   // A sized body cut short by the peer.
   Ref<System::Stream> server, client;
   System::CreateStreamPair(server, client);
   Ref<Request> request;
   CreateRequest(server.Get(), request);
   std::string bytes = "POST / HTTP/1.1\r\nContent-Length: 10\r\n\r\nabc";
   client->Write(bytes.data(), static_cast<int>(bytes.size()));
   client->Close();
   RequestWaiter waiter;
   request->AsyncReadHeader(waiter.Callback());
   ASSERT_TRUE(waiter.Wait(10000000));
   EXPECT_EQ(request->Read(piece, sizeof piece), 3);
   EXPECT_THROW(request->Read(piece, sizeof piece), Exception);
   server->Close();
}

TEST(RequestWaiterTest, TimesOutAndRethrowsWithTheType) {
   RequestWaiter idle;
   EXPECT_THROW(idle.Wait(1000), TimeoutException);
   RequestWaiter failed;
   MalformedHeaderException error("bad");
   failed.Complete(nullptr, &error, false);
   EXPECT_THROW(failed.Wait(), MalformedHeaderException);
}

}  // namespace
}  // namespace Pelmora::Http
