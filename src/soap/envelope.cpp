// Envelopes: parsing a request's envelope from untrusted input, and the reply's envelope
// text shared by every transport.

#include "pelmora/soap/envelope.h"

#include <map>
#include <string>

#include "pelmora/service/logMacros.h"
#include "pelmora/xml/parser.h"
#include "src/soap/soapLog.h"

namespace Pelmora::Soap {

namespace {

constexpr char kEnvelopeHead[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<soapenv:Envelope\n"
    " xmlns:soapenc=\"http://schemas.xmlsoap.org/soap/encoding/\"\n"
    " xmlns:soapenv=\"http://schemas.xmlsoap.org/soap/envelope/\"\n"
    " xmlns:xsd=\"http://www.w3.org/2001/XMLSchema\"\n"
    " xmlns:xsi=\"http://www.w3.org/2001/XMLSchema-instance\">\n"
    "<soapenv:Body>\n";
constexpr char kEnvelopeTail[] = "\n</soapenv:Body>\n</soapenv:Envelope>";

bool IsSoapElement(const Xml::ElementNode* element, const char* localName) {
   if (element->GetTag() != localName) return false;
   std::string uri;
   return Xml::GetNamespace(element, uri) && uri == kEnvelopeNamespace;
}

// Unlinks `element` from its parent after copying onto it every namespace declaration in
// scope there that it does not make itself. The caller holds a reference to it.
void Detach(Xml::ElementNode* element) {
   std::map<std::string, std::string> attributes;
   std::string ignored;
   for (Xml::Node* up = element->GetParent(); up != nullptr; up = up->GetParent()) {
      if (up->GetNodeType() != Xml::kElementNode) break;
      auto* ancestor = dynamic_cast<Xml::ElementNode*>(up);
      ancestor->GetAttributes(attributes);
      for (const auto& [name, value] : attributes) {
         bool declaration = name.compare(0, 5, "xmlns") == 0 && (name.size() == 5 || name[5] == ':');
         // Nearer declarations were copied first and win.
         if (declaration && !element->GetAttribute(name, ignored)) element->DefineAttribute(name, value);
      }
   }
   element->GetParent()->RemoveChild(element);
}

}  // namespace

void ParseSoapEnvelope(Service::Logger* logger, Reader* reader, Ref<Xml::ElementNode>& out) {
   Ref<Object> result;
   {
      Ref<Xml::XMLParserPool::ParserLease> lease;
      Xml::GetXmlParserPool()->GetParserLease(lease);
      try {
         // Restricted: the document limits apply and entity definitions are refused.
         lease->GetParser()->Parse(reader, true, result);
      } catch (const Xml::XMLParseException& e) {
         std::string text = "Invalid SOAP request at line number " + std::to_string(e.GetLineNumber()) + ", " +
                            e.GetMessage();
         PELMORA_LOG_VERBOSE(OrSoapLogger(logger), "%1", text);
         throw InvalidRequestException(text);
      }
   }
   auto* document = dynamic_cast<Xml::Document*>(result.Get());
   Xml::ElementNode* root = document != nullptr ? document->GetRoot() : nullptr;
   if (root == nullptr || !IsSoapElement(root, "Envelope")) throw InvalidRequestException("Missing SOAP Envelope element");
   // Detached, so that the caller holds a tree that does not point into the document.
   out = root;
   document->SetRoot(nullptr);
}

void ParseSoapBody(Service::Logger* logger, Reader* reader, Ref<Xml::ElementNode>& header,
                   Ref<Xml::ElementNode>& body) {
   Ref<Xml::ElementNode> envelope;
   ParseSoapEnvelope(logger, reader, envelope);
   Xml::ElementNode* headerElement = nullptr;
   Xml::ElementNode* bodyElement = nullptr;
   for (Xml::Node* child = envelope->GetFirstChild(); child != nullptr; child = child->GetNextSibling()) {
      if (child->GetNodeType() != Xml::kElementNode) continue;
      auto* element = dynamic_cast<Xml::ElementNode*>(child);
      if (headerElement == nullptr && bodyElement == nullptr && IsSoapElement(element, "Header")) {
         headerElement = element;
      } else if (bodyElement == nullptr && IsSoapElement(element, "Body")) {
         bodyElement = element;
      }
   }
   if (bodyElement == nullptr) throw InvalidRequestException("SOAP envelope missing Body element");
   Xml::ElementNode* first = nullptr;
   for (Xml::Node* child = bodyElement->GetFirstChild(); child != nullptr; child = child->GetNextSibling()) {
      if (child->GetNodeType() == Xml::kElementNode) {
         first = dynamic_cast<Xml::ElementNode*>(child);
         break;
      }
   }
   if (first == nullptr) throw InvalidRequestException("SOAP Body is empty");
   // Handed over detached, so that holding them never points into a dropped envelope;
   // the declarations they inherited go with them.
   Ref<Xml::ElementNode> firstRef(first);
   Detach(firstRef.Get());
   if (headerElement != nullptr) {
      Ref<Xml::ElementNode> headerRef(headerElement);
      Detach(headerRef.Get());
      header = headerRef;
   } else {
      header = nullptr;
   }
   body = firstRef;
}

void WriteSoapEnvelope(const Xml::Node* body, Writer* writer) {
   writer->Write(kEnvelopeHead, sizeof kEnvelopeHead - 1);
   if (body != nullptr) body->WriteNode(writer);
   writer->Write(kEnvelopeTail, sizeof kEnvelopeTail - 1);
}

}  // namespace Pelmora::Soap
