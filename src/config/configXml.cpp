// The XML syntax: one element per node, the id in the attribute "id", a value as the
// element's text. Values that trimming would change are written in double quotes.

#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/xml/node.h"
#include "pelmora/xml/parser.h"
#include "src/config/configBase.h"
#include "src/config/configText.h"

namespace Pelmora::Service {

using Node = ConfigBase::Node;

namespace {

constexpr size_t kWriteChunk = 65536;

void AppendEscaped(std::string& out, std::string_view text, bool attribute) {
   for (char c : text) {
      switch (c) {
         case '&': out += "&amp;"; break;
         case '<': out += "&lt;"; break;
         case '>': out += "&gt;"; break;
         // Character references survive the parser's line-end and attribute normalisation.
         case '\r': out += "&#13;"; break;
         case '"':
            if (attribute) out += "&quot;";
            else out += c;
            break;
         case '\t':
            if (attribute) out += "&#9;";
            else out += c;
            break;
         case '\n':
            if (attribute) out += "&#10;";
            else out += c;
            break;
         default: out += c;
      }
   }
}

bool NeedsQuotes(const std::string& value) {
   if (value.empty()) return false;
   return IsTrimmed(value.front()) || IsTrimmed(value.back()) ||
          (value.front() == '"' && value.back() == '"');
}

class XmlConfigImpl : public ConfigBase {
public:
   explicit XmlConfigImpl(ConfigBackend* backend) : ConfigBase(backend) {}

   void Parse(const std::string& text, Ref<Node>& root) override {
      if (Trim(text).empty()) {
         // An empty source is an empty configuration, ready to be filled and flushed.
         root = new Node(kRootTag, nullptr);
         return;
      }
      Ref<Object> result;
      {
         Ref<Xml::XMLParserPool::ParserLease> lease;
         Xml::GetXmlParserPool()->GetParserLease(lease);
         try {
            lease->GetParser()->Parse(text, true, result);
         } catch (const Xml::XMLParseException& e) {
            throw FileFormatException(
                MessageFormatter::ASPrint("%1 at line %2", e.what(), e.GetLineNumber()));
         }
      }
      Ref<Xml::Document> document = result.Cast<Xml::Document>();
      Xml::ElementNode* element = document->GetRoot();
      if (!element) throw FileFormatException("No root element");
      root = Build(element, nullptr, 0);
   }

   void Write(const Node* root, Writer* writer) override {
      std::string out = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n";
      WriteElement(root, 0, out, writer);
      writer->Write(out.data(), static_cast<int>(out.size()));
   }

private:
   // Builds the node of `element` and appends it to `parent` (when given).
   Ref<Node> Build(Xml::ElementNode* element, Node* parent, int depth) {
      if (depth > kConfigMaxDepth) {
         throw FileFormatException(
             MessageFormatter::ASPrint("Configuration nested deeper than %1 levels", kConfigMaxDepth));
      }
      std::string idText;
      bool hasId = element->GetAttribute("id", idText);
      std::string_view id = idText;
      std::string tag = element->GetName();
      Ref<Node> node = new Node(tag, hasId ? &id : nullptr);
      if (parent) {
         if (parent->FindChild(tag, hasId ? &id : nullptr)) {
            throw FileFormatException("Duplicate child: " + node->GetName());
         }
         parent->AppendChild(node.Get());
      }

      std::string text;
      bool hasChildren = false;
      for (Xml::Node* child = element->GetFirstChild(); child; child = child->GetNextSibling()) {
         switch (child->GetNodeType()) {
            case Xml::kElementNode:
               hasChildren = true;
               Build(dynamic_cast<Xml::ElementNode*>(child), node.Get(), depth + 1);
               break;
            case Xml::kTextNode:
               text += dynamic_cast<Xml::TextNode*>(child)->GetText();
               break;
            case Xml::kCDataNode:
               for (Xml::Node* t = child->GetFirstChild(); t; t = t->GetNextSibling()) {
                  if (auto* textNode = dynamic_cast<Xml::TextNode*>(t)) text += textNode->GetText();
               }
               break;
            default: break;  // comments and processing instructions
         }
      }
      std::string_view value = Trim(text);
      if (hasChildren) {
         if (!value.empty()) throw FileFormatException("Node has both value and children");
      } else {
         if (value.size() > 1 && value.front() == '"' && value.back() == '"') {
            value = value.substr(1, value.size() - 2);
         }
         node->SetValue(std::string(value));
      }
      return node;
   }

   void WriteElement(const Node* node, int depth, std::string& out, Writer* writer) {
      const std::string& tag = node->GetTag();
      if (!IsXmlName(tag)) throw InvalidArgumentException("Not an XML element name: " + tag);
      out.append(static_cast<size_t>(depth) * 2, ' ');
      out += '<';
      out += tag;
      if (node->HasId()) {
         if (!IsXmlText(node->GetId())) throw InvalidArgumentException("Not XML text: id of " + tag);
         out += " id=\"";
         AppendEscaped(out, node->GetId(), true);
         out += '"';
      }
      const auto& children = node->GetChildren();
      if (!children.empty()) {
         out += ">\n";
         for (const Ref<Node>& child : children) {
            // A node with neither value nor children would read back as an empty value.
            if (!child->HasValue() && child->GetChildren().empty()) continue;
            WriteElement(child.Get(), depth + 1, out, writer);
         }
         out.append(static_cast<size_t>(depth) * 2, ' ');
      } else if (node->HasValue() && !node->GetValue().empty()) {
         const std::string& value = node->GetValue();
         if (!IsXmlText(value)) throw InvalidArgumentException("Not XML text: value of " + node->GetName());
         out += '>';
         bool quote = NeedsQuotes(value);
         if (quote) out += '"';
         AppendEscaped(out, value, false);
         if (quote) out += '"';
      } else {
         // An empty value and no value at all read back alike, so they are written alike.
         out += "/>\n";
         return;
      }
      out += "</";
      out += tag;
      out += ">\n";
      if (out.size() >= kWriteChunk) {
         writer->Write(out.data(), static_cast<int>(out.size()));
         out.clear();
      }
   }
};

}  // namespace

void CreateXmlConfig(ConfigBackend* backend, Ref<ConfigBase>& out) {
   out = new XmlConfigImpl(backend);
}

void CreateXmlFileConfig(const std::string& path, int sizeLimit, unsigned flags, Ref<Config>& out) {
   Ref<FileConfigBackend> backend;
   CreateFileConfigBackend(path, sizeLimit, flags, backend);
   Ref<ConfigBase> config = new XmlConfigImpl(backend.Get());
   config->Load();
   out = config;
}

void CreateXmlStringConfig(std::string& text, Ref<Config>& out) {
   Ref<ConfigBackend> backend;
   CreateStringConfigBackend(text, backend);
   Ref<ConfigBase> config = new XmlConfigImpl(backend.Get());
   config->Load();
   out = config;
}

}  // namespace Pelmora::Service
