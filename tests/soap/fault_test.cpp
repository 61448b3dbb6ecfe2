#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"
#include "pelmora/soap/fault.h"

namespace Pelmora::Soap {
namespace {

std::string Compact(const Xml::Node* node) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   node->WriteNode(writer.Get());
   return writer->GetString();
}

TEST(FaultTest, FaultLayoutCarriesTheCodeNameAndOptionalActor) {
   Ref<Xml::ElementNode> fault;
   CreateFaultNode(kServerFault, "disk <full> & gone", "urn:actor", fault);
   EXPECT_EQ(Compact(fault.Get()),
             "<soapenv:Fault><faultcode>ServerFaultCode</faultcode><faultstring>disk &lt;full&gt; &amp; gone"
             "</faultstring><faultactor>urn:actor</faultactor><detail/></soapenv:Fault>");
   CreateFaultNode(kClientFault, "bad", fault);
   EXPECT_EQ(Compact(fault.Get()),
             "<soapenv:Fault><faultcode>ClientFaultCode</faultcode><faultstring>bad</faultstring><detail/>"
             "</soapenv:Fault>");
   EXPECT_STREQ(GetFaultCodeName(kMustUnderstandFault), "MustUnderstandFaultCode");
   EXPECT_STREQ(GetFaultCodeName(kVersionMismatchFault), "VersionMismatchFaultCode");
   EXPECT_THROW(GetFaultCodeName(static_cast<FaultCode>(4)), InvalidArgumentException);
}

TEST(FaultTest, ParseReadsBackEveryCodeAndQualifiedCodes) {
   for (FaultCode code : {kClientFault, kServerFault, kMustUnderstandFault, kVersionMismatchFault}) {
      Ref<Xml::ElementNode> fault;
      CreateFaultNode(code, "m" + std::to_string(code), code == kServerFault ? "actor" : "", fault);
      FaultCode read = kClientFault;
      std::string message, actor = "stale";
      ParseFaultNode(fault.Get(), read, message, actor);
      EXPECT_EQ(read, code);
      EXPECT_EQ(message, "m" + std::to_string(code));
      EXPECT_EQ(actor, code == kServerFault ? "actor" : "");
   }
   // What other servers send: a qualified code, with a dotted subcode.
   Ref<Xml::ElementNode> fault;
   CreateFaultNode(kClientFault, "x", fault);
   Ref<Xml::TextNode> code;
   Xml::CreateTextNode(" soap:Server.Busy ", code);
   Xml::ElementNode* codeElement = fault->GetChildElementByTag("faultcode");
   codeElement->RemoveChild(codeElement->GetFirstChild());
   codeElement->AppendChild(code.Get());
   FaultCode read = kClientFault;
   std::string message;
   ParseFaultNode(fault.Get(), read, message);
   EXPECT_EQ(read, kServerFault);
}

TEST(FaultTest, BrokenFaultsAreInvalidResponses) {
   Ref<Xml::ElementNode> fault;
   CreateFaultNode(kClientFault, "x", fault);
   Xml::ElementNode* codeElement = fault->GetChildElementByTag("faultcode");
   codeElement->RemoveChild(codeElement->GetFirstChild());
   Ref<Xml::TextNode> unknown;
   Xml::CreateTextNode("Teapot", unknown);
   codeElement->AppendChild(unknown.Get());
   FaultCode read;
   std::string message;
   EXPECT_THROW(ParseFaultNode(fault.Get(), read, message), InvalidResponseException);
   fault->RemoveChild(codeElement);
   EXPECT_THROW(ParseFaultNode(fault.Get(), read, message), InvalidResponseException);
}

TEST(FaultDeathTest, ParsingAnotherElementPanics) {
   Ref<Xml::ElementNode> other;
   Xml::CreateElementNode("soapenv:Body", other);
   FaultCode read;
   std::string message;
   EXPECT_DEATH(ParseFaultNode(other.Get(), read, message), "faultNd->GetTag\\(\\) == FAULT_TAG");
}

}  // namespace
}  // namespace Pelmora::Soap
