#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/url.h"

namespace Pelmora::Http {
namespace {

TEST(UrlTest, EncodeEscapesAllButLettersAndDigitsInLowerCase) {
   EXPECT_EQ(URLEncode("aZ9 -_.~/\xff"), "aZ9%20%2d%5f%2e%7e%2f%ff");
   EXPECT_EQ(URLEncode(std::string("\0", 1)), "%00");
   EXPECT_EQ(URLPathEncode("/a b/-._~?\xc3\xa9"), "/a%20b/-._~%3F%C3%A9");
}

TEST(UrlTest, DecodeHandlesPlusEscapesAndShortTails) {
   EXPECT_EQ(URLDecode("a+b%41%7a"), "a bAz");
   EXPECT_EQ(URLDecode("100%"), "100%");
   EXPECT_EQ(URLDecode("x%4"), "x%4");
   EXPECT_EQ(URLDecode("%zz"), "%zz");
   EXPECT_EQ(URLDecode("%00"), std::string("\0", 1));
   EXPECT_EQ(DecodeURLHexValues("a+b%2B"), "a+b+");
   // Every byte survives a round trip.
   std::string all;
   for (int c = 0; c < 256; ++c) all += static_cast<char>(c);
   EXPECT_EQ(URLDecode(URLEncode(all)), all);
   EXPECT_EQ(URLPathDecode(URLPathEncode(all)), all);
}

TEST(UrlTest, PathDecodeRefusesBrokenEscapes) {
   EXPECT_EQ(URLPathDecode("/a%20b+c"), "/a b+c");
   EXPECT_THROW(URLPathDecode("/a%2"), NumberFormatException);
   EXPECT_THROW(URLPathDecode("/a%g0"), NumberFormatException);
   EXPECT_THROW(URLPathDecode("%"), NumberFormatException);
}

TEST(UrlTest, HtmlEscaping) {
   EXPECT_EQ(HTMLEscape("<a href=\"x\">&'</a>"), "&lt;a href=&quot;x&quot;&gt;&amp;'&lt;/a&gt;");
   EXPECT_EQ(HTMLEscapePreserveWhitespace("a\r\nb\nc\rd\n\r<"), "a<br />b<br />c<br />d<br /><br />&lt;");
   std::string out = "x";
   HTMLEscapeCharacter('&', out);
   HTMLEscapeCharacter('y', out);
   EXPECT_EQ(out, "x&amp;y");
}

TEST(UrlTest, ParseUriSplitsTheFiveParts) {
   std::string scheme, authority, path, query, fragment;
   ASSERT_TRUE(ParseURI("https://user@host:8443/a/b?x=1&y#frag", scheme, authority, path, query, fragment));
   EXPECT_EQ(scheme, "https");
   EXPECT_EQ(authority, "user@host:8443");
   EXPECT_EQ(path, "/a/b");
   EXPECT_EQ(query, "x=1&y");
   EXPECT_EQ(fragment, "frag");
   ASSERT_TRUE(ParseURI("/only/path", scheme, authority, path, query, fragment));
   EXPECT_EQ(scheme, "");
   EXPECT_EQ(authority, "");
   EXPECT_EQ(path, "/only/path");
   ASSERT_TRUE(ParseURI("", scheme, authority, path, query, fragment));
   EXPECT_EQ(path, "");
}

TEST(UrlTest, ParseAuthority) {
   std::string user, host, port;
   ASSERT_TRUE(ParseURIAuthority("me:pw@example.com:8080", user, host, port));
   EXPECT_EQ(user, "me:pw");
   EXPECT_EQ(host, "example.com");
   EXPECT_EQ(port, "8080");
   ASSERT_TRUE(ParseURIAuthority("example.com", host, port));
   EXPECT_EQ(host, "example.com");
   EXPECT_EQ(port, "");
   EXPECT_FALSE(ParseURIAuthority("bad host", user, host, port));
   EXPECT_FALSE(ParseURIAuthority("host:port", user, host, port));
   EXPECT_TRUE(ParseURIAuthority("a%41!:x@h%2e_~-.com", user, host, port));
   EXPECT_EQ(user, "a%41!:x");
   EXPECT_EQ(host, "h%2e_~-.com");
   EXPECT_FALSE(ParseURIAuthority("a@b@c", user, host, port));
   EXPECT_FALSE(ParseURIAuthority("h%4", user, host, port));
   EXPECT_FALSE(ParseURIAuthority("h:", user, host, port));
   // Near misses that make the expression try every split of a long text.
   std::string run;
   for (int i = 0; i < 3000; ++i) run += "a.!";
   EXPECT_FALSE(ParseURIAuthority(run + "\x7f", user, host, port));
   EXPECT_FALSE(ParseURIAuthority(run + ":" + run + "@@", user, host, port));
   EXPECT_TRUE(ParseURIAuthority(run + ":1", user, host, port));
   EXPECT_EQ(port, "1");
}

TEST(UrlTest, ParseHttpUrl) {
   bool https = false;
   std::string host, path;
   int port = 0;
   ParseHttpURL("HTTPS://Example.com/x?y=1#f", https, host, port, path);
   EXPECT_TRUE(https);
   EXPECT_EQ(host, "Example.com");
   EXPECT_EQ(port, 443);
   EXPECT_EQ(path, "/x?y=1");
   ParseHttpURL("http://u:p@h:8080", https, host, port, path);
   EXPECT_FALSE(https);
   EXPECT_EQ(host, "h");
   EXPECT_EQ(port, 8080);
   EXPECT_EQ(path, "/");
   ParseHttpURL("http://[fe80::1]:81/p", https, host, port, path);
   EXPECT_EQ(host, "fe80::1");
   EXPECT_EQ(port, 81);
   EXPECT_THROW(ParseHttpURL("ftp://h/", https, host, port, path), InvalidArgumentException);
   EXPECT_THROW(ParseHttpURL("http:///p", https, host, port, path), InvalidArgumentException);
   EXPECT_THROW(ParseHttpURL("http://h:0/", https, host, port, path), InvalidArgumentException);
   EXPECT_THROW(ParseHttpURL("http://h:65536/", https, host, port, path), InvalidArgumentException);
   EXPECT_THROW(ParseHttpURL("http://h:8x/", https, host, port, path), InvalidArgumentException);
   EXPECT_EQ(FormatURIHostName("::1"), "[::1]");
   EXPECT_EQ(FormatURIHostName("host"), "host");
}

TEST(UrlTest, ParseQueryKeepsLastValueAndDecodesValues) {
   std::map<std::string, std::string> params;
   ParseURIQuery("a=1&b=x+y%21&a=2&flag&=v&c=", params);
   EXPECT_EQ(params["a"], "2");
   EXPECT_EQ(params["b"], "x y!");
   EXPECT_EQ(params.count("flag"), 1u);
   EXPECT_EQ(params[""], "v");
   EXPECT_EQ(params["c"], "");
   std::map<std::string, std::string> other;
   ParseParams("k=a=b", other);
   EXPECT_EQ(other["k"], "a=b");
}

}  // namespace
}  // namespace Pelmora::Http
