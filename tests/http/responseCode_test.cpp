#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/http/responseCode.h"

namespace Pelmora::Http {
namespace {

TEST(ResponseCodeTest, TableHoldsFortyRowsWithTheirExactPhrases) {
   EXPECT_EQ(ResponseCode::sCodeMap.size(), 40u);
   EXPECT_STREQ(GetResponseCodeInfo(415).reasonPhrase, "Unsuppored Media Type");
   EXPECT_STREQ(GetResponseCodeInfo(407).reasonPhrase, "Proxy Authorization Required");
   EXPECT_STREQ(GetResponseCodeInfo(414).reasonPhrase, "Request URI Too Long");
   EXPECT_STREQ(GetResponseCodeInfo(200).reasonPhrase, "OK");
   EXPECT_STREQ(GetResponseCodeInfo(505).reasonPhrase, "HTTP Version Not Supported");
   EXPECT_EQ(&GetResponseCodeInfo(404), &ResponseCode::NotFound);
   for (const auto& [code, info] : ResponseCode::sCodeMap) EXPECT_EQ(code, info->code);
}

TEST(ResponseCodeTest, UnknownCodeThrowsNotFoundNamingTheCode) {
   for (int code : {306, 0, -1, 418, 600}) {
      try {
         GetResponseCodeInfo(code);
         FAIL() << code;
      } catch (const NotFoundException& e) {
         EXPECT_NE(e.GetMessage().find("GetResponseCodeInfo"), std::string::npos);
         EXPECT_NE(e.GetMessage().find(": code = " + std::to_string(code)), std::string::npos);
      }
   }
}

TEST(ResponseCodeTest, FormatterPrintsCodeAndPhrase) {
   const PrintFormatter args[] = {ResponseCode::Formatter(ResponseCode::UnsupportedMediaType)};
   EXPECT_EQ(MessageFormatter::ASPrintArgs("status %1.", args, 1), "status 415 Unsuppored Media Type.");
}

}  // namespace
}  // namespace Pelmora::Http
