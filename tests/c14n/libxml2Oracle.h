#pragma once
// libxml2's canonicalisation of the same text, as an oracle for ours, and the parse and
// subtree selection both sides share. Subtrees are picked by a path of local names from
// the root ("Envelope/Body"); an empty path means the whole document.

#include <libxml/c14n.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "pelmora/io.h"
#include "pelmora/xml.h"

namespace Pelmora::Xml::Testing {

inline std::vector<std::string> SplitPath(const std::string& path) {
   std::vector<std::string> steps;
   std::stringstream in(path);
   for (std::string step; std::getline(in, step, '/');) {
      if (!step.empty()) steps.push_back(step);
   }
   return steps;
}

// Our parse with the standard handler; null when the text does not parse.
inline Ref<Document> ParseOurs(const std::string& text) {
   Ref<XMLHandler> handler;
   CreateXMLDocumentHandler(handler);
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   Ref<Object> result;
   try {
      parser->Parse(text, result);
   } catch (const XMLParseException&) {
      return nullptr;
   }
   return dynamic_cast<Document*>(result.Get());
}

// Our side: parse with the standard handler and canonicalise the subtree at `path`.
inline std::optional<std::string> OursCanonical(const std::string& text, const std::string& path, bool exclusive,
                                                const std::vector<std::string>& prefixes) {
   Ref<Document> parsed = ParseOurs(text);
   if (!parsed) return std::nullopt;
   Document* document = parsed.Get();
   Node* apex = document;
   std::vector<std::string> steps = SplitPath(path);
   for (size_t i = 0; i < steps.size(); ++i) {
      ElementNode* next = i == 0 ? document->GetRoot() : apex->GetChildElementByTag(steps[i]);
      if (next == nullptr || next->GetTag() != steps[i]) return std::nullopt;
      apex = next;
   }
   Ref<Security::Canonicalizer> canonicalizer;
   Security::CreateCanonicalizer(exclusive ? Security::kExclusiveC14N : Security::kInclusiveC14N, prefixes,
                                 canonicalizer);
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   canonicalizer->Canonicalize(apex, *writer);
   return writer->GetString();
}

struct OracleSubtree {
   xmlNodePtr apex;
   bool hideDroppedKinds;
};

// Visible: the apex and everything below it. Our output never holds CDATA sections,
// comments or processing instructions; hiding them from libxml2 too compares the rest.
inline int OracleVisible(void* data, xmlNodePtr node, xmlNodePtr parent) {
   auto* subtree = static_cast<OracleSubtree*>(data);
   if (subtree->hideDroppedKinds &&
       (node->type == XML_CDATA_SECTION_NODE || node->type == XML_PI_NODE || node->type == XML_COMMENT_NODE)) {
      return 0;
   }
   xmlNodePtr n = node->type == XML_NAMESPACE_DECL ? parent : node;
   for (; n != nullptr; n = n->parent) {
      if (n == subtree->apex) return 1;
   }
   return 0;
}

inline void CountOracleError(void* count, xmlErrorPtr) {
   ++*static_cast<int*>(count);
}

// With `strict`, a document libxml2 reports anything about (a namespace error or warning
// it would otherwise recover from) counts as refused.
inline std::optional<std::string> OracleCanonical(const std::string& text, const std::string& path, bool exclusive,
                                                  const std::vector<std::string>& prefixes,
                                                  bool hideDroppedKinds = true, bool strict = false) {
   int errors = 0;
   xmlSetStructuredErrorFunc(&errors, CountOracleError);
   xmlDocPtr doc = xmlReadMemory(text.data(), static_cast<int>(text.size()), "oracle.xml", nullptr,
                                 XML_PARSE_NOENT | XML_PARSE_DTDATTR | XML_PARSE_NONET | XML_PARSE_HUGE);
   xmlSetStructuredErrorFunc(nullptr, nullptr);
   if (doc == nullptr) return std::nullopt;
   if (strict && errors > 0) {
      xmlFreeDoc(doc);
      return std::nullopt;
   }
   xmlNodePtr apex = reinterpret_cast<xmlNodePtr>(doc);
   std::vector<std::string> steps = SplitPath(path);
   for (size_t i = 0; i < steps.size() && apex != nullptr; ++i) {
      xmlNodePtr next = i == 0 ? xmlDocGetRootElement(doc) : apex->children;
      while (next != nullptr && !(next->type == XML_ELEMENT_NODE &&
                                  steps[i] == reinterpret_cast<const char*>(next->name))) {
         next = i == 0 ? nullptr : next->next;
      }
      apex = next;
   }
   std::optional<std::string> out;
   if (apex != nullptr) {
      std::vector<xmlChar*> list;
      for (const std::string& p : prefixes) list.push_back(reinterpret_cast<xmlChar*>(const_cast<char*>(p.c_str())));
      list.push_back(nullptr);
      OracleSubtree subtree{apex, hideDroppedKinds};
      xmlOutputBufferPtr buffer = xmlAllocOutputBuffer(nullptr);
      int rc = xmlC14NExecute(doc, OracleVisible, &subtree, exclusive ? XML_C14N_EXCLUSIVE_1_0 : XML_C14N_1_0,
                              exclusive ? list.data() : nullptr, 0, buffer);
      if (rc >= 0) {
         out = std::string(reinterpret_cast<const char*>(xmlOutputBufferGetContent(buffer)),
                           xmlOutputBufferGetSize(buffer));
      }
      xmlOutputBufferClose(buffer);
   }
   xmlFreeDoc(doc);
   return out;
}

}  // namespace Pelmora::Xml::Testing
