// Faults: the Fault element of a reply, and reading one back.

#include "pelmora/soap/fault.h"

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/soap/envelope.h"

namespace Pelmora::Soap {

namespace {

constexpr const char* FAULT_TAG = "Fault";
constexpr const char* kCodeNames[] = {"ClientFaultCode", "ServerFaultCode", "MustUnderstandFaultCode",
                                      "VersionMismatchFaultCode"};
// The qualified codes other servers send, by the same index.
constexpr const char* kSoapCodes[] = {"Client", "Server", "MustUnderstand", "VersionMismatch"};

void AppendTextElement(Xml::ElementNode* parent, const char* name, const std::string& text) {
   Ref<Xml::ElementNode> element;
   Xml::CreateElementNode(name, element);
   if (!text.empty()) {
      Ref<Xml::TextNode> textNode;
      Xml::CreateTextNode(text, textNode);
      element->AppendChild(textNode.Get());
   }
   parent->AppendChild(element.Get());
}

// The text of the child element `name`; false when there is none.
bool ChildText(Xml::ElementNode* parent, const char* name, std::string& out) {
   Xml::ElementNode* child = parent->GetChildElementByTag(name);
   if (child == nullptr) return false;
   out.clear();
   for (Xml::Node* node = child->GetFirstChild(); node != nullptr; node = node->GetNextSibling()) {
      if (auto* text = dynamic_cast<Xml::TextNode*>(node)) {
         out += text->GetText();
      } else if (node->GetNodeType() == Xml::kCDataNode) {
         for (Xml::Node* inner = node->GetFirstChild(); inner != nullptr; inner = inner->GetNextSibling())
            if (auto* piece = dynamic_cast<Xml::TextNode*>(inner)) out += piece->GetText();
      }
   }
   return true;
}

std::string Trim(const std::string& text) {
   size_t begin = text.find_first_not_of(" \t\r\n");
   if (begin == std::string::npos) return std::string();
   size_t end = text.find_last_not_of(" \t\r\n");
   return text.substr(begin, end - begin + 1);
}

}  // namespace

const char* GetFaultCodeName(FaultCode code) {
   if (code < kClientFault || code > kVersionMismatchFault)
      throw InvalidArgumentException("fault code " + std::to_string(static_cast<int>(code)));
   return kCodeNames[code];
}

void CreateDetailNode(Ref<Xml::ElementNode>& out) { Xml::CreateElementNode("detail", out); }

void CreateFaultNode(FaultCode code, const std::string& message, const std::string& actor,
                     Ref<Xml::ElementNode>& out) {
   const char* name = GetFaultCodeName(code);
   Ref<Xml::ElementNode> fault;
   Xml::CreateElementNode("soapenv", FAULT_TAG, fault);
   AppendTextElement(fault.Get(), "faultcode", name);
   AppendTextElement(fault.Get(), "faultstring", message);
   if (!actor.empty()) AppendTextElement(fault.Get(), "faultactor", actor);
   Ref<Xml::ElementNode> detail;
   CreateDetailNode(detail);
   fault->AppendChild(detail.Get());
   out = fault;
}

void CreateFaultNode(FaultCode code, const std::string& message, Ref<Xml::ElementNode>& out) {
   CreateFaultNode(code, message, std::string(), out);
}

Xml::ElementNode* GetDetailNode(Xml::ElementNode* fault) { return fault->GetChildElementByTag("detail"); }

void ParseFaultNode(Xml::ElementNode* faultNd, FaultCode& code, std::string& message, std::string& actor) {
   PELMORA_VERIFY(faultNd->GetTag() == FAULT_TAG);
   std::string text;
   if (!ChildText(faultNd, "faultcode", text)) throw InvalidResponseException("Invalid SOAP fault: no faultcode");
   text = Trim(text);
   // A qualified code is read by its local part.
   std::string local = text.substr(text.find(':') == std::string::npos ? 0 : text.find(':') + 1);
   bool found = false;
   for (int i = 0; i < 4 && !found; ++i) {
      if (text == kCodeNames[i] || local == kSoapCodes[i] || local.rfind(std::string(kSoapCodes[i]) + ".", 0) == 0) {
         code = static_cast<FaultCode>(i);
         found = true;
      }
   }
   if (!found) throw InvalidResponseException("Invalid SOAP fault: unknown faultcode " + text);
   if (!ChildText(faultNd, "faultstring", message))
      throw InvalidResponseException("Invalid SOAP fault: no faultstring");
   if (!ChildText(faultNd, "faultactor", actor)) actor.clear();
}

void ParseFaultNode(Xml::ElementNode* fault, FaultCode& code, std::string& message) {
   std::string actor;
   ParseFaultNode(fault, code, message, actor);
}

}  // namespace Pelmora::Soap
