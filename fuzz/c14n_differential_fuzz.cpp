// Canonicalises generated documents with ours and with libxml2 and compares the bytes
// whenever both accept the document. The input drives a generator of namespace-heavy
// documents (prefixes rebound and undeclared, default namespace changes, xml:* and
// prefixed attributes, references, CDATA, comments, processing instructions beside the
// root) and picks the algorithm, the subtree and the inclusive prefixes. Where our bytes
// deliberately differ from the W3C algorithms, the document is not compared: two escaped
// characters in a row, or ">" in an attribute value or namespace URI; nor where libxml2
// departs from them: a namespace URI holding a character that needs escaping.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>
#include <vector>

#include "pelmora/xml.h"
#include "support/silentSink.h"
#include "tests/c14n/libxml2Oracle.h"

using namespace Pelmora;
using namespace Pelmora::Xml;

namespace {

class Input {
public:
   Input(const uint8_t* data, size_t size) : _data(data), _size(size) {}
   bool Empty() const { return _at >= _size; }
   unsigned Next() { return _at < _size ? _data[_at++] : 0; }
   // One of `n` choices.
   unsigned Pick(unsigned n) { return Next() % n; }

private:
   const uint8_t* _data;
   size_t _size;
   size_t _at = 0;
};

const char* const kPrefixes[] = {"", "a", "b", "soap", "ds"};
const char* const kUris[] = {"urn:a", "urn:b", "http://example.com/x", "urn:a?q=1&amp;r=2", "urn:%C3%A9"};
const char* const kTags[] = {"e", "Body", "Signature", "x"};
const char* const kTextPieces[] = {"t", " ", "\n", "\t", "&amp;", "&lt;", "&gt;", "&#13;", "&#xD;\n", "&quot;", "'",
                                   "\xc3\xa9", "&#x10000;", "<![CDATA[c<d]]>", "<!--k-->", "\r\n", "z"};
const char* const kValuePieces[] = {"v", " ", "&#9;", "&#10;", "&#13;", "&amp;", "&lt;", "&quot;", "'", "\t", "\n",
                                    "\xe2\x82\xac", "w"};

std::string Pieces(Input& in, const char* const* pieces, unsigned count, unsigned max) {
   std::string out;
   for (unsigned n = in.Pick(max); n > 0; --n) out += pieces[in.Pick(count)];
   return out;
}

void GenerateElement(Input& in, int depth, std::string& out, std::vector<std::string>& paths, const std::string& path) {
   std::string prefix = kPrefixes[in.Pick(5)];
   std::string tag = kTags[in.Pick(4)];
   std::string name = prefix.empty() ? tag : prefix + ":" + tag;
   std::string here = path.empty() ? tag : path + "/" + tag;
   paths.push_back(here);
   out += "<" + name;
   std::vector<std::string> used;
   auto attribute = [&](const std::string& attributeName, const std::string& value) {
      for (const std::string& u : used) {
         if (u == attributeName) return;
      }
      used.push_back(attributeName);
      out += " " + attributeName + "=\"" + value + "\"";
   };
   for (unsigned n = in.Pick(4); n > 0; --n) {
      switch (in.Pick(6)) {
      case 0:
         attribute("xmlns", in.Pick(4) == 0 ? "" : kUris[in.Pick(5)]);
         break;
      case 1:
      case 2:
         attribute(std::string("xmlns:") + kPrefixes[1 + in.Pick(4)], kUris[in.Pick(5)]);
         break;
      case 3:
         attribute(std::string("xml:") + (in.Pick(2) ? "lang" : "space"), in.Pick(2) ? "en" : "preserve");
         break;
      case 4:
         attribute(std::string(kPrefixes[1 + in.Pick(4)]) + ":" + kTags[in.Pick(4)],
                   Pieces(in, kValuePieces, 13, 5));
         break;
      default:
         attribute(kTags[in.Pick(4)], Pieces(in, kValuePieces, 13, 5));
         break;
      }
   }
   out += ">";
   for (unsigned n = depth < 6 ? in.Pick(5) : 0; n > 0 && !in.Empty(); --n) {
      if (in.Pick(2)) {
         GenerateElement(in, depth + 1, out, paths, here);
      } else {
         out += Pieces(in, kTextPieces, 17, 4);
      }
   }
   out += "</" + name + ">";
}

// Whether our bytes for `node` and below depart from the standards on purpose.
bool Departs(const std::string& value, bool attribute) {
   auto special = [attribute](char c) {
      return c == '&' || c == '<' || c == '>' || c == '\r' ||
             (attribute && (c == '"' || c == '\t' || c == '\n'));
   };
   for (size_t i = 0; i < value.size(); ++i) {
      if (attribute && value[i] == '>') return true;
      if (special(value[i]) && i + 1 < value.size() && special(value[i + 1])) return true;
   }
   return false;
}

bool Departs(Node* node) {
   if (auto* text = dynamic_cast<TextNode*>(node)) {
      if (node->GetParent() == nullptr || node->GetParent()->GetNodeType() != kCDataNode) {
         if (Departs(text->GetText(), false)) return true;
      }
   }
   if (auto* element = dynamic_cast<ElementNode*>(node)) {
      std::map<std::string, std::string> attributes;
      element->GetAttributes(attributes);
      for (const auto& [name, value] : attributes) {
         if (Departs(value, true)) return true;
         // libxml2 writes namespace URIs unescaped, against the standards; we escape them
         // as attribute values.
         if (name.compare(0, 5, "xmlns") == 0 && value.find_first_of("&<>\"\t\n\r") != std::string::npos) {
            return true;
         }
      }
   }
   for (Node* child = node->GetFirstChild(); child != nullptr; child = child->GetNextSibling()) {
      if (Departs(child)) return true;
   }
   return false;
}

long compared = 0;
long refused = 0;
long departed = 0;

struct Totals {
   ~Totals() {
      std::fprintf(stderr, "c14n differential: %ld compared, %ld departing, %ld refused by either\n", compared,
                   departed, refused);
   }
} totals;

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
   PelmoraFuzz::InstallSilentSink();
   return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   Input in(data, size);
   bool exclusive = in.Pick(2) == 1;
   std::vector<std::string> prefixes;
   if (exclusive) {
      for (unsigned n = in.Pick(3); n > 0; --n) {
         unsigned p = in.Pick(5);
         prefixes.push_back(p == 0 ? "#default" : kPrefixes[p]);
      }
   }
   unsigned pathChoice = in.Next();
   std::string text;
   if (in.Pick(3) == 0) text += "<?before data?>";
   std::vector<std::string> paths{""};
   GenerateElement(in, 0, text, paths, "");
   if (in.Pick(3) == 0) text += "<!--after--><?after x?>";
   const std::string& path = paths[pathChoice % paths.size()];

   std::optional<std::string> oracle = Testing::OracleCanonical(text, path, exclusive, prefixes, true, true);
   if (!oracle) {
      ++refused;
      return 0;
   }
   // Our parse again for the departure check; the canonical bytes come from the same path.
   Ref<Document> parsed = Testing::ParseOurs(text);
   if (!parsed) {
      ++refused;
      return 0;
   }
   if (Departs(parsed.Get())) {
      ++departed;
      return 0;
   }
   std::optional<std::string> ours = Testing::OursCanonical(text, path, exclusive, prefixes);
   if (!ours) {
      // The paths come from the generated text, so both find the same element.
      std::fprintf(stderr, "ours found no element at %s in\n%s\n", path.c_str(), text.c_str());
      std::abort();
   }
   ++compared;
   if (*ours != *oracle) {
      std::fprintf(stderr, "canonical bytes differ (%s, path \"%s\")\ninput:\n%s\nours:\n%s\nlibxml2:\n%s\n",
                   exclusive ? "exclusive" : "inclusive", path.c_str(), text.c_str(), ours->c_str(),
                   oracle->c_str());
      std::abort();
   }
   return 0;
}
