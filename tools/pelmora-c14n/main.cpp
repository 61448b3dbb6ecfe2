// pelmora-c14n: writes the canonical form of an XML document, or of one element of it, to
// standard output, as signatures over it would digest it.

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iostream>
#include <iterator>
#include <sstream>
#include <string>
#include <vector>

#include "pelmora/io.h"
#include "pelmora/xml.h"

using namespace Pelmora;
using namespace Pelmora::Xml;

namespace {

const char kUsage[] =
    "usage: pelmora-c14n [--exclusive] [--prefixes LIST] [--path PATH] [FILE]\n"
    "Writes the canonical form of FILE (standard input when FILE is absent or \"-\").\n"
    "  --exclusive      Exclusive XML Canonicalization 1.0 (default: Canonical XML 1.0)\n"
    "  --prefixes LIST  exclusive only: prefixes rendered inclusively, separated by blanks\n"
    "                   or commas (\"#default\" for the default namespace)\n"
    "  --path PATH      start at this element: local names from the root, separated by\n"
    "                   \"/\", \"*\" for any (for example Envelope/Body/*)\n";

class StdoutWriter : public Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override {
      if (std::fwrite(data, 1, static_cast<size_t>(length), stdout) != static_cast<size_t>(length)) {
         throw SystemException(errno);
      }
   }
   void Close() override {}
   void Flush() override { std::fflush(stdout); }
};

std::vector<std::string> Split(const std::string& text, const char* separators) {
   std::vector<std::string> parts;
   size_t at = 0;
   while (at < text.size()) {
      size_t end = text.find_first_of(separators, at);
      if (end == std::string::npos) end = text.size();
      if (end > at) parts.push_back(text.substr(at, end - at));
      at = end + 1;
   }
   return parts;
}

// The element at `path` below `document`, or null.
ElementNode* FindElement(Document* document, const std::string& path) {
   std::vector<std::string> steps = Split(path, "/");
   ElementNode* at = document->GetRoot();
   if (steps.empty() || at == nullptr) return at;
   if (steps[0] != "*" && steps[0] != at->GetTag()) return nullptr;
   for (size_t i = 1; i < steps.size() && at != nullptr; ++i) {
      Node* child = at->GetFirstChild();
      at = nullptr;
      for (; child != nullptr; child = child->GetNextSibling()) {
         auto* element = dynamic_cast<ElementNode*>(child);
         if (element != nullptr && (steps[i] == "*" || steps[i] == element->GetTag())) {
            at = element;
            break;
         }
      }
   }
   return at;
}

int Fail(const std::string& message) {
   std::cerr << "pelmora-c14n: " << message << "\n";
   return 1;
}

}  // namespace

int main(int argc, char** argv) {
   bool exclusive = false;
   bool prefixesGiven = false;
   std::string prefixes;
   std::string path;
   std::string file = "-";
   bool fileGiven = false;
   for (int i = 1; i < argc; ++i) {
      std::string arg = argv[i];
      if (arg == "--help" || arg == "-h") {
         std::cout << kUsage;
         return 0;
      }
      if (arg == "--exclusive") {
         exclusive = true;
      } else if ((arg == "--prefixes" || arg == "--path") && i + 1 < argc) {
         (arg == "--path" ? path : prefixes) = argv[++i];
         prefixesGiven |= arg == "--prefixes";
      } else if ((arg.size() > 1 && arg[0] == '-' && arg != "-") || fileGiven) {
         std::cerr << "pelmora-c14n: unexpected argument \"" << arg << "\"\n" << kUsage;
         return 2;
      } else {
         file = arg;
         fileGiven = true;
      }
   }
   if (prefixesGiven && !exclusive) {
      std::cerr << "pelmora-c14n: --prefixes needs --exclusive\n" << kUsage;
      return 2;
   }

   std::string text;
   if (file == "-") {
      text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
   } else {
      std::ifstream in(file, std::ios::binary);
      if (!in) return Fail("cannot open " + file + ": " + std::strerror(errno));
      text.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
      if (in.bad()) return Fail("cannot read " + file + ": " + std::strerror(errno));
   }
   try {
      Ref<XMLHandler> handler;
      CreateXMLDocumentHandler(handler);
      Ref<XMLParser> parser;
      CreateXMLParser(handler.Get(), parser);
      Ref<Object> result;
      parser->Parse(text, result);
      auto* document = dynamic_cast<Document*>(result.Get());
      Node* start = document;
      if (!path.empty()) {
         start = FindElement(document, path);
         if (start == nullptr) return Fail("no element at " + path);
      }
      Ref<Security::Canonicalizer> canonicalizer;
      Security::CreateCanonicalizer(exclusive ? Security::kExclusiveC14N : Security::kInclusiveC14N,
                                    Split(prefixes, " \t\n,"), canonicalizer);
      Ref<StdoutWriter> writer(new StdoutWriter);
      canonicalizer->Canonicalize(start, *writer);
      writer->Flush();
      if (std::ferror(stdout)) return Fail(std::string("cannot write: ") + std::strerror(errno));
   } catch (const XMLParseException& e) {
      return Fail((file == "-" ? std::string("standard input") : file) + ":" + std::to_string(e.GetLineNumber()) +
                  ": not well-formed XML: " + e.GetMessage());
   } catch (const Exception& e) {
      return Fail(e.GetMessage());
   }
   return 0;
}
