#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/header.h"

namespace Pelmora::Http {
namespace {

TEST(HeaderTest, MethodsVersionsAndPaths) {
   struct Case {
      const char* line;
      int method;
      const char* path;
      int version;
   } cases[] = {
      {"GET / HTTP/1.1\r\n\r\n", RequestHeader::GET, "/", 272},
      {"PUT /a%20b+c HTTP/1.0\r\n", RequestHeader::PUT, "/a b c", 256},
      {"POST   /x   HTTP/1.1\r\n", RequestHeader::POST, "/x", 272},
      {"HEAD /h HTTP/1.2\r\n", RequestHeader::HEAD, "/h", 256},
      {"DELETE /d HTTP/1.1", RequestHeader::DELETE, "/d", 272},
      {"CONNECT host:443 HTTP/1.1\r\n", RequestHeader::CONNECT, "host:443", 272},
      // Methods match by their leading letters.
      {"GETX /g HTTP/1.1\r\n", RequestHeader::GET, "X", 272},
   };
   for (const Case& c : cases) {
      RequestHeader header;
      header.FromString(c.line);
      EXPECT_EQ(header.GetMethod(), c.method) << c.line;
      EXPECT_EQ(header.GetPath(), c.path) << c.line;
      EXPECT_EQ(header.GetHttpVersion(), c.version) << c.line;
      // No fields: no length, and the connection is kept.
      EXPECT_TRUE(header.GetFields().empty()) << c.line;
      EXPECT_TRUE(header.GetKeepAlive()) << c.line;
      long long length = 7;
      EXPECT_FALSE(header.GetContentLength(length)) << c.line;
      EXPECT_EQ(header.GetContentLength(), -1) << c.line;
   }
   for (const char* bad : {"get / HTTP/1.1\r\n", "OPTIONS * HTTP/1.1\r\n", "", "\r\n"}) {
      RequestHeader header;
      EXPECT_THROW(header.FromString(bad), NotSupportedException) << bad;
   }
}

TEST(HeaderTest, FieldsIgnoreCaseContinueAndJoin) {
   RequestHeader header;
   header.FromString(
      "GET / HTTP/1.1\r\nHost:  example  \r\nX-Long: one\r\n\ttwo\r\n  three\r\nnocolon\r\n"
      "accept: a\r\nAccept: b\r\n: empty name\r\nContent-Length: 12\r\n\r\n");
   std::string value;
   ASSERT_TRUE(header.GetField("HOST", value));
   EXPECT_EQ(value, "example");
   ASSERT_TRUE(header.GetField("x-long", value));
   EXPECT_EQ(value, "one\ttwo  three");
   ASSERT_TRUE(header.GetField("Accept", value));
   EXPECT_EQ(value, "a, b");
   EXPECT_FALSE(header.GetField("nocolon", value));
   EXPECT_EQ(header.GetFields().size(), 4u);
   EXPECT_EQ(header.GetContentLength(), 12);
   header.RemoveField("content-length");
   EXPECT_EQ(header.GetContentLength(), -1);
   header.SetField("content-length", "5");
   EXPECT_EQ(header.GetContentLength(), 5);
}

TEST(HeaderTest, ContentLengthMustBeOneNonNegativeNumber) {
   const char* bad[] = {"Content-Length: -1\r\n", "Content-Length: 1x\r\n", "Content-Length:\r\n",
                        "Content-Length: 5\r\nContent-Length: 6\r\n",
                        "Content-Length: 99999999999999999999\r\n"};
   for (const char* fields : bad) {
      RequestHeader header;
      EXPECT_ANY_THROW(header.FromString(std::string("POST / HTTP/1.1\r\n") + fields)) << fields;
   }
   RequestHeader header;
   try {
      header.FromString("POST / HTTP/1.1\r\nContent-Length: -1\r\n\r\n");
      FAIL();
   } catch (const MalformedHeaderException& e) {
      EXPECT_EQ(e.GetMessage(), "Content-Length is a negative value");
   }
   header.FromString("POST / HTTP/1.1\r\ncontent-length: 9223372036854775807\r\n");
   EXPECT_EQ(header.GetContentLength(), 9223372036854775807LL);
}

TEST(HeaderTest, KeepAliveAndChunkedQueries) {
   Header header;
   header.SetField("Connection", "Close");
   EXPECT_TRUE(header.GetKeepAlive());
   header.SetField("connection", "close");
   EXPECT_FALSE(header.GetKeepAlive());
   EXPECT_FALSE(header.IsChunkedTransferEncoding());
   header.SetField("Transfer-Encoding", "IDENTITY");
   EXPECT_FALSE(header.IsChunkedTransferEncoding());
   header.SetField("Transfer-Encoding", "Chunked");
   EXPECT_TRUE(header.IsChunkedTransferEncoding());
}

TEST(HeaderTest, RequestCookiesComeFromCookieFieldsOnly) {
   RequestHeader header;
   header.FromString("GET / HTTP/1.1\r\nCookie: a=1; b=2\r\nSet-Cookie: c=3\r\ncookie: d=4\r\n\r\n");
   RefList<Cookie> cookies;
   header.GetCookieList(cookies);
   ASSERT_EQ(cookies.size(), 3u);
   Ref<Cookie> cookie;
   ASSERT_TRUE(header.GetCookie("d", cookie));
   EXPECT_EQ(cookie->GetValue(), "4");
   EXPECT_FALSE(header.GetCookie("c", cookie));
   header.ClearHeader();
   EXPECT_EQ(header.GetMethod(), RequestHeader::UNKNOWN);
   EXPECT_FALSE(header.GetCookie("a", cookie));
}

TEST(HeaderTest, ResponseTextHasStatusDateFieldsCookiesAndBlankLine) {
   ResponseHeader header;
   header.SetResponseCode(ResponseCode::UnsupportedMediaType);
   header.SetContentType("text/xml", "utf-8");
   header.SetKeepAlive(false);
   header.SetCacheResponse(false);
   header.SetField("Content-Length", "7");
   header.SetContentLength(42);
   EXPECT_EQ(header.GetContentLength(), 42);
   Ref<Cookie> cookie;
   CreateCookie("s", "1", cookie);
   cookie->SetHttpOnly(true);
   header.AddCookie(cookie.Get());
   // 24 Nov 2026 21:05:09 UTC.
   EXPECT_EQ(header.ToString(1795554309LL * 1000000 + 999999),
             "HTTP/1.1 415 Unsuppored Media Type\r\n"
             "Date: Tue, 24 Nov 2026 21:05:09 GMT\r\n"
             "Cache-Control: no-cache\r\n"
             "Connection: close\r\n"
             "Content-Length: 42\r\n"
             "Content-Type: text/xml; charset=utf-8\r\n"
             "Set-Cookie: s=1; HttpOnly\r\n"
             "\r\n");
   header.SetCacheResponse(true);
   header.SetKeepAlive(true);
   header.SetContentLength(-1);
   EXPECT_EQ(header.GetContentLength(), -1);
   header.SetContentType("text/plain");
   EXPECT_EQ(header.ToString(0),
             "HTTP/1.1 415 Unsuppored Media Type\r\nDate: Thu, 1 Jan 1970 00:00:00 GMT\r\n"
             "Connection: Keep-Alive\r\nContent-Type: text/plain\r\nSet-Cookie: s=1; HttpOnly\r\n\r\n");
   EXPECT_EQ(HttpDateFormatter(951782400LL * 1000000).ToString(), "Tue, 29 Feb 2000 00:00:00 GMT");
}

// Response texts reuse the date of the last second formatted: a new second, an earlier
// one and the edges of a second must each get their own date.
TEST(HeaderTest, ResponseDateFollowsEachSecond) {
   ResponseHeader header;
   auto date = [&header](long long microseconds) {
      std::string text = header.ToString(microseconds);
      size_t at = text.find("Date: ");
      return text.substr(at + 6, text.find("\r\n", at) - at - 6);
   };
   const long long second = 1795554309LL * 1000000;
   EXPECT_EQ(date(second), "Tue, 24 Nov 2026 21:05:09 GMT");
   EXPECT_EQ(date(second + 999999), "Tue, 24 Nov 2026 21:05:09 GMT");
   EXPECT_EQ(date(second + 1000000), "Tue, 24 Nov 2026 21:05:10 GMT");
   EXPECT_EQ(date(second - 1), "Tue, 24 Nov 2026 21:05:08 GMT");
   EXPECT_EQ(date(second + 86400LL * 1000000), "Wed, 25 Nov 2026 21:05:09 GMT");
   EXPECT_EQ(date(-1), "Wed, 31 Dec 1969 23:59:59 GMT");
   EXPECT_EQ(date(0), "Thu, 1 Jan 1970 00:00:00 GMT");
   EXPECT_EQ(date(second), "Tue, 24 Nov 2026 21:05:09 GMT");
}

TEST(HeaderTest, ClientStatusLine) {
   ClientResponseHeader header;
   header.FromString("HTTP/1.1 302 Found\r\nLocation: /x\r\nSet-Cookie: a=1; Path=/\r\nSet-Cookie: b=2\r\n\r\n");
   EXPECT_EQ(header.GetResponseCode(), 302);
   RefDeque<Cookie> cookies;
   header.GetCookies(cookies);
   ASSERT_EQ(cookies.size(), 2u);
   EXPECT_EQ(cookies[0]->GetPath(), "/");
   header.FromString("HTTP/1.0 204");
   EXPECT_EQ(header.GetResponseCode(), 204);
   try {
      header.FromString("ICY 200 OK\r\n");
      FAIL();
   } catch (const MalformedHeaderException& e) {
      EXPECT_EQ(e.GetMessage(), "invalid protocol version in status line: ICY 200 OK");
   }
   for (const char* bad : {"HTTP/1.1\r\n", "HTTP/1.1  OK\r\n"}) {
      try {
         header.FromString(bad);
         FAIL() << bad;
      } catch (const MalformedHeaderException& e) {
         EXPECT_EQ(e.GetMessage(), "status not found");
      }
   }
   EXPECT_THROW(header.FromString("HTTP/1.1 abc OK\r\n"), NumberFormatException);
}

}  // namespace
}  // namespace Pelmora::Http
