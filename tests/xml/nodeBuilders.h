#pragma once
// Short ways to make the nodes a test tree is built from.

#include <string>

#include "pelmora/xml.h"

namespace Pelmora::Xml::Testing {

inline Ref<ElementNode> Element(const std::string& name) {
   Ref<ElementNode> element;
   CreateElementNode(name, element);
   return element;
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

}  // namespace Pelmora::Xml::Testing
