#pragma once
// Short ways to build, parse and write test trees.

#include <string>

#include "pelmora/io.h"
#include "pelmora/xml.h"

namespace Pelmora::Xml::Testing {

inline Ref<ElementNode> Element(const std::string& name) {
   Ref<ElementNode> node;
   CreateElementNode(name, node);
   return node;
}
inline Ref<TextNode> Text(const std::string& text) {
   Ref<TextNode> node;
   CreateTextNode(text, node);
   return node;
}
inline Ref<CommentNode> Comment(const std::string& text) {
   Ref<CommentNode> node;
   CreateCommentNode(text, node);
   return node;
}
inline std::string Write(const Node* node, bool pretty = false) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   pretty ? node->PrettyWriteNode(writer.Get()) : node->WriteNode(writer.Get());
   return writer->GetString();
}

// A parser over a standard document handler with `limits`, or the process's defaults.
inline Ref<XMLParser> NewParser(const DocLimits& limits) {
   Ref<XMLHandler> handler;
   CreateXMLDocumentHandler(limits, handler);
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   return parser;
}
inline Ref<XMLParser> NewParser() { return NewParser(GetDefaultDocLimits()); }

inline Ref<Document> Parse(const std::string& text) {
   Ref<XMLParser> parser = NewParser();
   Ref<Object> result;
   parser->Parse(text, false, result);
   return result.Cast<Document>();
}

}  // namespace Pelmora::Xml::Testing
