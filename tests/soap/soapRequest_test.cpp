#include <gtest/gtest.h>

#include <deque>
#include <functional>
#include <memory>

#include "pelmora/io/readers.h"
#include "src/soap/soapImpl.h"

namespace Pelmora::Soap {
namespace {

Ref<SoapRequestImpl> Over(const std::string& text, long long cap) {
   // A string reader reads the caller's bytes in place: they must outlive it.
   static std::deque<std::string> kept;
   kept.push_back(text);
   Ref<StringReader> source;
   CreateStringReader(kept.back().data(), static_cast<int>(kept.back().size()), source);
   SoapRequestImpl::Fields fields;
   fields.hasUserAgent = true;
   fields.userAgent = "agent";
   return new SoapRequestImpl(nullptr, source.Get(), fields, cap);
}

TEST(SoapRequestTest, ReadsUpToTheCapAndFailsPastIt) {
   std::string text(100, 'x');
   Ref<SoapRequestImpl> exact = Over(text, 100);
   char buffer[64];
   long long total = 0;
   for (int n; (n = exact->Read(buffer, sizeof buffer)) > 0;) total += n;
   EXPECT_EQ(total, 100);
   EXPECT_EQ(exact->Read(buffer, sizeof buffer), -1);

   Ref<SoapRequestImpl> over = Over(text + "y", 100);
   try {
      while (over->Read(buffer, sizeof buffer) > 0) {
      }
      ADD_FAILURE() << "no failure past the cap";
   } catch (const InvalidRequestException& e) {
      EXPECT_EQ(e.GetMessage(), "SOAP request exceeds 100 bytes");
   }
   // Never more than one byte past the cap was taken from the source.
   EXPECT_EQ(over->GetBytesRead(), 101);
}

TEST(SoapRequestTest, AsyncReadsCompleteInTurnAndReportTheEnd) {
   Ref<SoapRequestImpl> request = Over("abcdef", -1);
   char buffer[4];
   std::string got;
   int ends = 0;
   std::function<void()> next;
   SoapRequest::ReadCallback callback = [&](SoapRequest*, Exception* error, int n) {
      ASSERT_EQ(error, nullptr);
      if (n < 0) {
         ++ends;
         return;
      }
      got.append(buffer, static_cast<size_t>(n));
      // The slot is free again inside the callback.
      next();
   };
   next = [&] { request->AsyncRead(buffer, sizeof buffer, callback); };
   next();
   EXPECT_EQ(got, "abcdef");
   EXPECT_EQ(ends, 1);
   std::string field;
   EXPECT_TRUE(request->GetUserAgent(field));
   EXPECT_EQ(field, "agent");
   EXPECT_FALSE(request->GetSoapAction(field));
   EXPECT_FALSE(request->GetNorvexClient(field));
}

TEST(SoapRequestTest, AsyncReadPastTheCapFailsThroughTheCallback) {
   Ref<SoapRequestImpl> request = Over("abcdef", 3);
   char buffer[16];
   std::string failure;
   request->AsyncRead(buffer, sizeof buffer, [&](SoapRequest*, Exception* error, int) {
      failure = error != nullptr ? error->GetMessage() : "none";
   });
   EXPECT_EQ(failure, "SOAP request exceeds 3 bytes");
}

}  // namespace
}  // namespace Pelmora::Soap
