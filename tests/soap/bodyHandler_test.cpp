#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"
#include "pelmora/soap/soapSvc.h"
#include "src/soap/soapImpl.h"

namespace Pelmora::Soap {
namespace {

// Remembers what was answered.
class RecordingReply : public virtual Reply, public ObjectImpl {
public:
   void WriteReply(const Xml::Node* body) override {
      complete = true;
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      if (body != nullptr) body->WriteNode(writer.Get());
      text = writer->GetString();
   }
   void WriteFault(FaultCode code, const std::string& message, const std::string&, Xml::Node*) override {
      complete = true;
      faulted = true;
      faultCode = code;
      text = message;
   }
   void Reset() override {}
   bool IsComplete() const override { return complete; }

   bool complete = false, faulted = false;
   FaultCode faultCode = kClientFault;
   std::string text;
};

// Answers with the body element's tag and the request's SOAPAction, or fails as told.
class TagHandler : public virtual BodyHandler, public ObjectImpl {
public:
   TagHandler(std::string uri, std::string name, int mode = 0) : _info{std::move(uri), std::move(name)}, _mode(mode) {}
   void GetBodyHandlerInfo(BodyHandlerInfo& out) const override { out = _info; }
   void HandleBody(SoapRequest* request, Xml::ElementNode* header, Xml::ElementNode* body, Reply* reply) override {
      if (_mode == 1) throw InvalidRequestException("argument missing");
      if (_mode == 2) throw InvalidStateException("backend down");
      if (_mode == 3) return;
      std::string action = "-";
      request->GetSoapAction(action);
      Ref<Xml::ElementNode> answer;
      Xml::CreateElementNode("got", answer);
      answer->DefineAttribute("tag", body->GetTag());
      answer->DefineAttribute("action", action);
      answer->DefineAttribute("header", header != nullptr ? "yes" : "no");
      reply->WriteReply(answer.Get());
   }

private:
   BodyHandlerInfo _info;
   int _mode;
};

class BodyHandlerMapTest : public ::testing::Test {
protected:
   void SetUp() override { CreateBodyHandlerMap(nullptr, "urn:svc/2.0", _map); }

   Ref<RecordingReply> Call(const std::string& bodyContent, const std::string& header = "") {
      _text = "<s:Envelope xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\" xmlns:a=\"urn:a\" "
              "xmlns:v=\"urn:svc/2.0\">" +
              header + "<s:Body>" + bodyContent + "</s:Body></s:Envelope>";
      Ref<StringReader> source;
      CreateStringReader(_text.data(), static_cast<int>(_text.size()), source);
      SoapRequestImpl::Fields fields;
      fields.hasSoapAction = true;
      fields.soapAction = "urn:a#op";
      Ref<SoapRequestImpl> request(new SoapRequestImpl(nullptr, source.Get(), fields, -1));
      Ref<RecordingReply> reply(new RecordingReply());
      _map->HandleRequest(request.Get(), reply.Get());
      return reply;
   }

   Ref<BodyHandlerMap> _map;
   std::string _text;
};

TEST_F(BodyHandlerMapTest, DispatchesByNamespaceAndLocalName) {
   _map->AddBodyHandler(new TagHandler("urn:a", "op"));
   _map->AddBodyHandler(new TagHandler("", "plain"));
   Ref<RecordingReply> reply = Call("<a:op/>", "<s:Header/>");
   EXPECT_FALSE(reply->faulted);
   EXPECT_EQ(reply->text, "<got action=\"urn:a#op\" header=\"yes\" tag=\"op\"/>");
   EXPECT_EQ(Call("<plain/>")->text, "<got action=\"urn:a#op\" header=\"no\" tag=\"plain\"/>");
   // Same local name in another namespace: nobody serves it.
   reply = Call("<v:op/>");
   EXPECT_TRUE(reply->faulted);
   EXPECT_EQ(reply->faultCode, kClientFault);
   EXPECT_EQ(reply->text, "No handler for SOAP body element {urn:svc/2.0}op");
}

TEST_F(BodyHandlerMapTest, DefaultVersionHandlersServeTheDefaultNamespace) {
   _map->AddDefaultVersionUriBodyHandler(new TagHandler("urn:elsewhere", "op"));
   EXPECT_FALSE(Call("<v:op/>")->faulted);
   EXPECT_TRUE(Call("<a:op/>")->faulted);
   Ref<BodyHandler> found;
   EXPECT_TRUE(_map->LookupBodyHandler({"urn:svc/2.0", "op"}, found));
   _map->RemoveBodyHandler({"urn:svc/2.0", "op"});
   EXPECT_FALSE(_map->LookupBodyHandler({"urn:svc/2.0", "op"}, found));
}

TEST_F(BodyHandlerMapTest, ARegisteredNameCannotBeAddedAgain) {
   _map->AddBodyHandler(new TagHandler("urn:svc/2.0", "op"));
   EXPECT_THROW(_map->AddBodyHandler(new TagHandler("urn:svc/2.0", "op")), AlreadyExistsException);
   EXPECT_THROW(_map->AddDefaultVersionUriBodyHandler(new TagHandler("urn:other", "op")), AlreadyExistsException);
   EXPECT_NO_THROW(_map->AddBodyHandler(new TagHandler("urn:other", "op")));
}

TEST_F(BodyHandlerMapTest, FailuresBecomeFaultsOfTheRightKind) {
   _map->AddBodyHandler(new TagHandler("urn:a", "client", 1));
   _map->AddBodyHandler(new TagHandler("urn:a", "server", 2));
   _map->AddBodyHandler(new TagHandler("urn:a", "silent", 3));
   Ref<RecordingReply> reply = Call("<a:client/>");
   EXPECT_EQ(reply->faultCode, kClientFault);
   EXPECT_EQ(reply->text, "argument missing");
   reply = Call("<a:server/>");
   EXPECT_TRUE(reply->faulted);
   EXPECT_EQ(reply->faultCode, kServerFault);
   EXPECT_EQ(reply->text, "backend down");
   reply = Call("<a:silent/>");
   EXPECT_EQ(reply->faultCode, kServerFault);
   reply = Call("");
   EXPECT_EQ(reply->faultCode, kClientFault);
   EXPECT_EQ(reply->text, "SOAP Body is empty");
}

}  // namespace
}  // namespace Pelmora::Soap
