// Fuzzes the parser and the serialisers. The first byte picks restricted or unrestricted
// parsing and default or tight limits, the second the size of the pieces the reader hands
// out; the rest is the document. Whatever parses is written compactly and pretty, and the
// root in both forms is parsed again, which must succeed. Only XMLParseException may leave
// a parse of fuzzed input; anything else escapes and ends the run as a crash.

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "pelmora/io.h"
#include "pelmora/xml.h"
#include "support/silentSink.h"

using namespace Pelmora;
using namespace Pelmora::Xml;

namespace {

// Hands out the input in pieces of a fuzzed size, to move expat's block boundaries around.
class PieceReader : public Reader, public ObjectImpl {
public:
   PieceReader(const uint8_t* data, size_t size, int piece)
       : _data(data), _size(size), _piece(piece) {}
   int Read(char* buffer, int length) override {
      if (_position == _size) return -1;
      size_t count =
          std::min({_size - _position, static_cast<size_t>(length), static_cast<size_t>(_piece)});
      std::memcpy(buffer, _data + _position, count);
      _position += count;
      return static_cast<int>(count);
   }
   void Close() override {}

private:
   const uint8_t* _data;
   size_t _size;
   int _piece;
   size_t _position = 0;
};

void Check(bool condition, const char* what) {
   if (!condition) {
      std::fprintf(stderr, "check failed: %s\n", what);
      std::abort();
   }
}

Ref<XMLParser> NewParser(const DocLimits& limits) {
   Ref<XMLHandler> handler;
   CreateXMLDocumentHandler(limits, handler);
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   return parser;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
   PelmoraFuzz::InstallSilentSink();
   return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   if (size < 2) return 0;
   static Ref<XMLParser> standard = NewParser(DocLimits());
   static Ref<XMLParser> tight =
       NewParser(DocLimits{.maxChars = 2000, .maxNodes = 60, .maxDepth = 12});
   bool restricted = data[0] & 1;
   XMLParser* parser = (data[0] & 2) ? tight.Get() : standard.Get();
   int piece = data[1] + 1;

   Ref<Object> result;
   try {
      Ref<PieceReader> reader = new PieceReader(data + 2, size - 2, piece);
      parser->Parse(reader.Get(), restricted, result);
   } catch (const XMLParseException&) {
      return 0;
   }
   Ref<Document> document = result.Cast<Document>();
   Check(document->GetRoot() != nullptr, "a parsed document has a root");

   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   document->WriteNode(writer.Get());
   writer->Reset();
   document->PrettyWriteNode(writer.Get());
   // The root alone, both ways: a declared encoding other than UTF-8 would not match the
   // bytes written, and both forms of the root must read back.
   ElementNode* root = document->GetRoot();
   for (bool pretty : {false, true}) {
      writer->Reset();
      if (pretty) {
         root->PrettyWriteNode(writer.Get());
      } else {
         root->WriteNode(writer.Get());
      }
      std::string output = writer->GetString();
      try {
         standard->Parse(output, result);
      } catch (const XMLParseException& e) {
         std::fprintf(stderr, "output does not parse (%s): %s\n", e.what(), output.c_str());
         std::abort();
      }
   }
   return 0;
}
