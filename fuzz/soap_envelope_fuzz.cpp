// Fuzzes the SOAP request path: a whole POST body through envelope parsing and dispatch
// by the body handler map to a handler that echoes its "in" element. Whatever comes in,
// the answer must be a reply or a fault, written once, and its envelope must parse back
// with a Body holding the echo response or a Fault.

#include <cstdint>
#include <cstdlib>
#include <string>

#include "fuzz/support/silentSink.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"
#include "pelmora/soap.h"
#include "src/soap/soapImpl.h"

using namespace Pelmora;
using namespace Pelmora::Soap;

namespace {

class EchoHandler : public virtual BodyHandler, public ObjectImpl {
public:
   EchoHandler(const char* uri, const char* name) : _info{uri, name} {}
   void GetBodyHandlerInfo(BodyHandlerInfo& out) const override { out = _info; }
   void HandleBody(SoapRequest*, Xml::ElementNode*, Xml::ElementNode* body, Reply* reply) override {
      Xml::ElementNode* in = body->GetChildElementByTag("in");
      if (in == nullptr) throw InvalidRequestException("Missing element in");
      std::string text;
      for (Xml::Node* child = in->GetFirstChild(); child != nullptr; child = child->GetNextSibling())
         if (auto* piece = dynamic_cast<Xml::TextNode*>(child)) text += piece->GetText();
      Ref<Xml::ElementNode> response, out;
      Xml::CreateElementNode("ns:echoStringResponse", response);
      response->DefineAttribute("xmlns:ns", "urn:anchor:echo");
      Xml::CreateElementNode("out", out);
      Ref<Xml::TextNode> value;
      Xml::CreateTextNode(text, value);
      out->AppendChild(value.Get());
      response->AppendChild(out.Get());
      reply->WriteReply(response.Get());
   }

private:
   BodyHandlerInfo _info;
};

// Keeps the envelope text; a second answer is a fault of the dispatcher.
class TextReply : public virtual Reply, public ObjectImpl {
public:
   void WriteReply(const Xml::Node* body) override {
      if (complete) abort();
      complete = true;
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      WriteSoapEnvelope(body, writer.Get());
      text = writer->GetString();
   }
   void WriteFault(FaultCode code, const std::string& message, const std::string& actor, Xml::Node* detail) override {
      Ref<Xml::ElementNode> fault;
      BuildFault(code, message, actor, detail, fault);
      WriteReply(fault.Get());
      faulted = true;
   }
   void Reset() override {}
   bool IsComplete() const override { return complete; }

   bool complete = false, faulted = false;
   std::string text;
};

BodyHandlerMap* Map() {
   static BodyHandlerMap* map = [] {
      Ref<Service::Logger> quiet;
      Service::GetDefaultLogger()->CreateLogger("soapFuzz", 0, quiet);
      Ref<BodyHandlerMap> made;
      CreateBodyHandlerMap(quiet.Get(), "urn:anchor:echo", made);
      made->AddBodyHandler(new EchoHandler("urn:anchor:echo", "echoString"));
      made->AddBodyHandler(new EchoHandler("", "echo"));
      return made.Release();
   }();
   return map;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
   PelmoraFuzz::InstallSilentSink();
   return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   Ref<StringReader> source;
   CreateStringReader(reinterpret_cast<const char*>(data), static_cast<int>(size), source);
   // A small cap, so that the oversized path is reached too.
   Ref<SoapRequestImpl> request(new SoapRequestImpl(nullptr, source.Get(), {}, 16384));
   Ref<TextReply> reply(new TextReply());
   Map()->HandleRequest(request.Get(), reply.Get());
   if (!reply->complete) abort();
   Ref<StringReader> again;
   CreateStringReader(reply->text.data(), static_cast<int>(reply->text.size()), again);
   Ref<Xml::ElementNode> header, body;
   ParseSoapBody(nullptr, again.Get(), header, body);
   if (body->GetTag() != (reply->faulted ? "Fault" : "echoStringResponse")) abort();
   return 0;
}
