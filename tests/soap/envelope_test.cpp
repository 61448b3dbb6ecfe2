#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"
#include "pelmora/soap/envelope.h"
#include "pelmora/xml/parser.h"

namespace Pelmora::Soap {
namespace {

constexpr char kSoapNs[] = "http://schemas.xmlsoap.org/soap/envelope/";

Ref<Reader> ReaderOf(const std::string& text) {
   Ref<StringReader> reader;
   CreateStringReader(text.data(), static_cast<int>(text.size()), reader);
   return reader;
}

std::string Envelope(const std::string& inside, const std::string& ns = kSoapNs) {
   return "<?xml version=\"1.0\"?>\n<e:Envelope xmlns:e=\"" + ns + "\" xmlns:ns=\"urn:anchor:echo\">" + inside +
          "</e:Envelope>";
}

std::string ParseFailure(const std::string& text) {
   Ref<Xml::ElementNode> header, body;
   try {
      ParseSoapBody(nullptr, ReaderOf(text).Get(), header, body);
   } catch (const InvalidRequestException& e) {
      return e.GetMessage();
   }
   return "(parsed)";
}

TEST(EnvelopeTest, BodyAndHeaderComeDetachedWithTheirNamespaces) {
   Ref<Xml::ElementNode> header, body;
   ParseSoapBody(nullptr,
                 ReaderOf(Envelope("<e:Header><ns:token>t</ns:token></e:Header>\n <e:Body>\n  <!-- first -->"
                                   "<ns:echoString><in>a &amp; b</in></ns:echoString><ns:second/></e:Body>"))
                     .Get(),
                 header, body);
   ASSERT_TRUE(header);
   ASSERT_TRUE(body);
   // Nothing links them to the envelope any more, yet the prefix declared there resolves.
   EXPECT_EQ(body->GetParent(), nullptr);
   EXPECT_EQ(header->GetParent(), nullptr);
   Xml::QName name;
   body->GetQName(name);
   EXPECT_EQ(name, Xml::QName("urn:anchor:echo", "echoString"));
   std::string text;
   ASSERT_TRUE(Xml::EvaluateSimplePath(body.Get(), "*/in", text));
   EXPECT_EQ(text, "a & b");
   EXPECT_NE(header->GetChildElementByTag("token"), nullptr);
   // Without a Header there is none.
   ParseSoapBody(nullptr, ReaderOf(Envelope("<e:Body><x/></e:Body>")).Get(), header, body);
   EXPECT_FALSE(header);
   EXPECT_EQ(body->GetTag(), "x");
}

TEST(EnvelopeTest, InvalidEnvelopesAreRefusedWithTheirTexts) {
   EXPECT_EQ(ParseFailure(Envelope("<e:Body><x/></e:Body>", "http://www.w3.org/2003/05/soap-envelope")),
             "Missing SOAP Envelope element");
   EXPECT_EQ(ParseFailure("<Envelope><Body><x/></Body></Envelope>"), "Missing SOAP Envelope element");
   EXPECT_EQ(ParseFailure("<e:Body xmlns:e=\"" + std::string(kSoapNs) + "\"><x/></e:Body>"),
             "Missing SOAP Envelope element");
   EXPECT_EQ(ParseFailure(Envelope("<e:Header/>")), "SOAP envelope missing Body element");
   // A Body in another namespace is not the Body.
   EXPECT_EQ(ParseFailure(Envelope("<Body><x/></Body>")), "SOAP envelope missing Body element");
   EXPECT_EQ(ParseFailure(Envelope("<e:Body> text <!-- c --> </e:Body>")), "SOAP Body is empty");
   EXPECT_EQ(ParseFailure("<?xml version=\"1.0\"?>\n<a><b></a>"),
             "Invalid SOAP request at line number 2, mismatched tag");
   EXPECT_EQ(ParseFailure("").rfind("Invalid SOAP request at line number 1, ", 0), 0u);
}

TEST(EnvelopeTest, EntityDefinitionsAreRefused) {
   std::string text = "<?xml version=\"1.0\"?>\n<!DOCTYPE e:Envelope [<!ENTITY a \"aaaaaaaaaa\">"
                      "<!ENTITY b \"&a;&a;&a;&a;&a;&a;&a;&a;\">]>\n" +
                      Envelope("<e:Body><x>&b;</x></e:Body>").substr(22);
   std::string failure = ParseFailure(text);
   EXPECT_EQ(failure.rfind("Invalid SOAP request at line number 2, ", 0), 0u) << failure;
}

// In a child process: the limits are process-wide and pooled parsers keep theirs.
TEST(EnvelopeDeathTest, DocumentLimitsApplyToEnvelopes) {
   auto parseDeep = [] {
      Xml::DocLimits limits = Xml::GetDefaultDocLimits();
      limits.maxDepth = 8;
      Xml::SetDefaultDocLimits(limits);
      std::string deep;
      for (int i = 0; i < 20; ++i) deep += "<d>";
      for (int i = 0; i < 20; ++i) deep += "</d>";
      std::string shallow = ParseFailure(Envelope("<e:Body><d><d/></d></e:Body>"));
      std::string failure = ParseFailure(Envelope("<e:Body>" + deep + "</e:Body>"));
      bool refused = failure.rfind("Invalid SOAP request at line number ", 0) == 0;
      std::_Exit(shallow == "(parsed)" && refused ? 0 : 1);
   };
   EXPECT_EXIT(parseDeep(), ::testing::ExitedWithCode(0), "");
}

TEST(EnvelopeTest, ReplyEnvelopeTextIsExact) {
   Ref<Xml::ElementNode> body;
   Xml::CreateElementNode("ns:r", body);
   body->DefineAttribute("xmlns:ns", "urn:x");
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   WriteSoapEnvelope(body.Get(), writer.Get());
   EXPECT_EQ(writer->GetString(),
             "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
             "<soapenv:Envelope\n"
             " xmlns:soapenc=\"http://schemas.xmlsoap.org/soap/encoding/\"\n"
             " xmlns:soapenv=\"http://schemas.xmlsoap.org/soap/envelope/\"\n"
             " xmlns:xsd=\"http://www.w3.org/2001/XMLSchema\"\n"
             " xmlns:xsi=\"http://www.w3.org/2001/XMLSchema-instance\">\n"
             "<soapenv:Body>\n"
             "<ns:r xmlns:ns=\"urn:x\"/>\n"
             "</soapenv:Body>\n"
             "</soapenv:Envelope>");
}

}  // namespace
}  // namespace Pelmora::Soap
