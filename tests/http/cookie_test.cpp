#include <gtest/gtest.h>

#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/cookie.h"
#include "src/http/cookieImpl.h"

namespace Pelmora::Http {
namespace {

std::vector<Ref<Cookie>> Parse(const std::string& text, bool setCookie) {
   std::vector<Ref<Cookie>> cookies;
   ParseCookieHeaderString(text, setCookie, [&](Cookie* cookie) { cookies.emplace_back(cookie); });
   return cookies;
}

TEST(CookieTest, RequestFieldGivesEveryValidPairInOrder) {
   auto cookies = Parse(" a=1; b=\"two\";bad; =x; c=; d e=3; f=4 ", false);
   ASSERT_EQ(cookies.size(), 4u);
   EXPECT_EQ(cookies[0]->GetName(), "a");
   EXPECT_EQ(cookies[0]->GetValue(), "1");
   EXPECT_EQ(cookies[1]->GetValue(), "two");
   EXPECT_EQ(cookies[2]->GetName(), "c");
   EXPECT_EQ(cookies[2]->GetValue(), "");
   EXPECT_EQ(cookies[3]->GetName(), "f");
   EXPECT_TRUE(Parse("", false).empty());
   EXPECT_TRUE(Parse(";;;", false).empty());
   EXPECT_TRUE(Parse(std::string("a=\x01", 3), false).empty());
}

TEST(CookieTest, SetCookieReadsEveryAttribute) {
   auto cookies = Parse("sid=abc; Path=/app; Domain=.Example.COM; Expires=Wed, 09 Jun 2021 10:18:14 GMT; "
                        "Max-Age=3600; Secure; HttpOnly; SameSite=lax; Unknown=1",
                        true);
   ASSERT_EQ(cookies.size(), 1u);
   Cookie* c = cookies[0].Get();
   EXPECT_EQ(c->GetName(), "sid");
   EXPECT_EQ(c->GetValue(), "abc");
   EXPECT_EQ(c->GetPath(), "/app");
   EXPECT_EQ(c->GetDomain(), "example.com");
   EXPECT_EQ(c->GetExpires(), 1623233894LL * 1000000);
   EXPECT_EQ(c->GetMaxAge(), 3600);
   EXPECT_TRUE(c->IsSecure());
   EXPECT_TRUE(c->IsHttpOnly());
   EXPECT_EQ(c->GetSameSite(), "Lax");
   EXPECT_EQ(c->ToString(),
             "sid=abc; Path=/app; Domain=example.com; Expires=Wed, 9 Jun 2021 10:18:14 GMT; Max-Age=3600; "
             "Secure; HttpOnly; SameSite=Lax");
}

TEST(CookieTest, SetCookieIgnoresBadAttributesAndSkipsBadCookies) {
   auto cookies = Parse("a=b; Path=relative; Max-Age=12x; Expires=not a date; SameSite=odd; Max-Age=-5", true);
   ASSERT_EQ(cookies.size(), 1u);
   EXPECT_EQ(cookies[0]->GetPath(), "");
   EXPECT_EQ(cookies[0]->GetExpires(), -1);
   EXPECT_EQ(cookies[0]->GetMaxAge(), -5);
   EXPECT_EQ(cookies[0]->GetSameSite(), "");
   EXPECT_EQ(cookies[0]->ToString(), "a=b; Max-Age=-5");
   EXPECT_TRUE(Parse("novalue; Path=/", true).empty());
   EXPECT_TRUE(Parse("=v", true).empty());
   EXPECT_TRUE(Parse("", true).empty());
   EXPECT_EQ(Parse("x=1; Max-Age=99999999999999999999999", true)[0]->GetMaxAge() > 0, true);
}

TEST(CookieTest, AttributesThatCouldNotBeWrittenBackAreDropped) {
   auto cookies = Parse("a=\" x \"; Path=/p", true);
   EXPECT_TRUE(cookies.empty());
   // A quoted value that is itself quoted would lose its quotes when read again.
   EXPECT_TRUE(Parse("b=\"\"b=\"\"", true).empty());
   EXPECT_TRUE(Parse("b=\"\"b=\"\"", false).empty());
   cookies = Parse("a=b; Domain=. evil.com; Path=/\x01x", true);
   ASSERT_EQ(cookies.size(), 1u);
   EXPECT_EQ(cookies[0]->GetDomain(), "");
   EXPECT_EQ(cookies[0]->GetPath(), "");
   EXPECT_EQ(Parse("a=b; Domain=.Good.example", true)[0]->GetDomain(), "good.example");
   // One leading dot is dropped; a domain still starting with one would lose it when
   // written and read again.
   EXPECT_EQ(Parse("a=b; Domain=...e...", true)[0]->GetDomain(), "");
   EXPECT_EQ(Parse("a=b; Domain=.", true)[0]->GetDomain(), "");
   EXPECT_EQ(Parse("a=b; Expires=Thu, 01 Jan 1900 00:00:00 GMT", true)[0]->GetExpires(), 0);
   // Creation and setters refuse what would end the header field on the wire.
   Ref<Cookie> cookie;
   EXPECT_THROW(CreateCookie("", "v", cookie), InvalidArgumentException);
   EXPECT_THROW(CreateCookie("a b", "v", cookie), InvalidArgumentException);
   EXPECT_THROW(CreateCookie("a", "v;w", cookie), InvalidArgumentException);
   EXPECT_THROW(CreateCookie("a", "v\r\nX: y", cookie), InvalidArgumentException);
   CreateCookie("n", "v", cookie);
   EXPECT_EQ(cookie->ToString(), "n=v");
   EXPECT_THROW(cookie->SetPath("/a\r\nX: y"), InvalidArgumentException);
   EXPECT_THROW(cookie->SetPath("/a; Secure"), InvalidArgumentException);
   EXPECT_THROW(cookie->SetDomain("a b"), InvalidArgumentException);
   EXPECT_THROW(cookie->SetDomain("..e"), InvalidArgumentException);
   EXPECT_THROW(cookie->SetValue("v\n"), InvalidArgumentException);
   EXPECT_THROW(cookie->SetSameSite("lax"), InvalidArgumentException);
   cookie->SetSameSite("Strict");
   cookie->SetDomain(".Example.org");
   EXPECT_EQ(cookie->ToString(), "n=v; Domain=example.org; SameSite=Strict");
}

TEST(CookieTest, ExpiresDatesInTheFormsBrowsersAccept) {
   const long long expected = 784111777LL * 1000000;  // Sun, 06 Nov 1994 08:49:37 GMT
   EXPECT_EQ(ParseCookieDate("Sun, 06 Nov 1994 08:49:37 GMT"), expected);
   EXPECT_EQ(ParseCookieDate("Sunday, 06-Nov-94 08:49:37 GMT"), expected);
   EXPECT_EQ(ParseCookieDate("Sun Nov  6 08:49:37 1994"), expected);
   EXPECT_EQ(ParseCookieDate("6 november 1994 8:49:37"), expected);
   EXPECT_EQ(ParseCookieDate("31 Feb 2020 00:00:00"), -1);
   EXPECT_EQ(ParseCookieDate("06 Nov 1994"), -1);
   EXPECT_EQ(ParseCookieDate("06 Nov 1994 25:00:00"), -1);
   EXPECT_EQ(ParseCookieDate("06 Nov 1500 01:00:00"), -1);
   EXPECT_EQ(ParseCookieDate(""), -1);
}

}  // namespace
}  // namespace Pelmora::Http
