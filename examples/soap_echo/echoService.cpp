#include "echoService.h"

#include <cstdlib>
#include <string>

namespace SoapEcho {

using namespace Pelmora;

namespace {

constexpr char kNamespace[] = "urn:anchor:echo";

Xml::ElementNode* Required(Xml::ElementNode* parent, const char* name) {
   Xml::ElementNode* child = parent->GetChildElementByTag(name);
   if (child == nullptr) throw Soap::InvalidRequestException(std::string("Missing element ") + name);
   return child;
}

// "<ns:{name}Response xmlns:ns=...><{field}>text</{field}></ns:{name}Response>"
void Answer(Soap::Reply* reply, const std::string& name, const char* field, const std::string& text) {
   Ref<Xml::ElementNode> response, value;
   Xml::CreateElementNode("ns", name + "Response", response);
   response->DefineAttribute("xmlns:ns", kNamespace);
   Xml::CreateElementNode(field, value);
   Ref<Xml::TextNode> content;
   Xml::CreateTextNode(text, content);
   value->AppendChild(content.Get());
   response->AppendChild(value.Get());
   reply->WriteReply(response.Get());
}

class EchoString : public virtual Soap::BodyHandler, public ObjectImpl {
public:
   void GetBodyHandlerInfo(Soap::BodyHandlerInfo& out) const override { out = {kNamespace, "echoString"}; }
   void HandleBody(Soap::SoapRequest*, Xml::ElementNode*, Xml::ElementNode* body, Soap::Reply* reply) override {
      Answer(reply, "echoString", "out", Xml::GetTextContent(Required(body, "in")));
   }
};

class DescribePerson : public virtual Soap::BodyHandler, public ObjectImpl {
public:
   void GetBodyHandlerInfo(Soap::BodyHandlerInfo& out) const override { out = {kNamespace, "describePerson"}; }
   void HandleBody(Soap::SoapRequest*, Xml::ElementNode*, Xml::ElementNode* body, Soap::Reply* reply) override {
      Xml::ElementNode* person = Required(body, "person");
      std::string name = Xml::GetTextContent(Required(person, "name"));
      std::string ageText = Xml::GetTextContent(Required(person, "age"));
      char* end = nullptr;
      long age = std::strtol(ageText.c_str(), &end, 10);
      if (ageText.empty() || *end != '\0') throw Soap::InvalidRequestException("age is not a number: " + ageText);
      if (age < 0) {
         reply->WriteFault(Soap::kClientFault, "age must not be negative", kNamespace);
         return;
      }
      std::string languages;
      for (Xml::ElementNode* language = person->GetChildElementByTag("languages"); language != nullptr;
           language = language->GetSiblingElementByTag("languages"))
         languages += (languages.empty() ? "" : ", ") + Xml::GetTextContent(language);
      std::string text = name + " (" + std::to_string(age) + ") speaks " + (languages.empty() ? "nothing" : languages);
      Answer(reply, "describePerson", "description", text);
   }
};

}  // namespace

void AddEchoHandlers(Soap::BodyHandlerMap* map) {
   map->AddBodyHandler(new EchoString());
   map->AddBodyHandler(new DescribePerson());
}

}  // namespace SoapEcho
