#include "pelmora/xml/security/canonicalizer.h"

#include <typeinfo>

namespace Pelmora::Xml::Security {

bool AcceptAllNodesFilter::Accept(Node*) const {
   return true;
}

bool ExcludeNodeFilter::Accept(Node* node) const {
   return node != _excluded;
}

bool SkipWsAndCommentsFilter::Accept(Node* node) const {
   switch (node->GetNodeType()) {
   case kCommentNode:
      return false;
   case kTextNode: {
      auto* text = dynamic_cast<TextNode*>(node);
      if (text == nullptr) throw TypeMismatchException("TextNode", typeid(*node).name());
      for (char c : text->GetText()) {
         if (c != '\t' && c != '\n' && c != '\r' && c != ' ') return true;
      }
      return false;
   }
   default:
      return true;
   }
}

bool NodeFilterIterator::MoveToChild() {
   for (Node* child = _node->GetFirstChild(); child != nullptr; child = child->GetNextSibling()) {
      if (_filter->Accept(child)) {
         _node = child;
         return true;
      }
   }
   return false;
}

bool NodeFilterIterator::MoveToSibling() {
   for (Node* next = _node->GetNextSibling(); next != nullptr; next = next->GetNextSibling()) {
      if (_filter->Accept(next)) {
         _node = next;
         return true;
      }
   }
   return false;
}

}  // namespace Pelmora::Xml::Security
