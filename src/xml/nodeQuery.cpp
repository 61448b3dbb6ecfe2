// Reading a tree: element lookups by tag and by qualified name, nil elements, namespaces,
// simple paths and the namespace-URI check.

#include <cstddef>
#include <cstring>
#include <string_view>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "src/xml/nodeImpl.h"

namespace Pelmora::Xml {
namespace {

const ElementNodeImpl* AsElement(const NodeImpl* node) {
   return node->GetNodeType() == kElementNode ? static_cast<const ElementNodeImpl*>(node) : nullptr;
}

// From `node` along next-sibling links: the first element with this local name.
ElementNode* FindByTag(const NodeImpl* node, const std::string& tag) {
   for (; node; node = node->NextSiblingImpl()) {
      const ElementNodeImpl* element = AsElement(node);
      if (element && element->GetTag() == tag) return const_cast<ElementNodeImpl*>(element);
   }
   return nullptr;
}

ElementNode* FindByQName(const NodeImpl* node, const QName& name) {
   std::string uri;
   for (; node; node = node->NextSiblingImpl()) {
      const ElementNodeImpl* element = AsElement(node);
      if (!element || element->GetTag() != name.localName) continue;
      if (!element->ResolvePrefix(element->GetPrefix(), uri)) uri.clear();
      if (uri == name.uri) return const_cast<ElementNodeImpl*>(element);
   }
   return nullptr;
}

bool IsTrueValue(const std::string* value) {
   return value && (*value == "true" || *value == "1");
}

}  // namespace

ElementNode* NodeImpl::GetChildElementByTag(const std::string& tag) const {
   return FindByTag(FirstChildImpl(), tag);
}

ElementNode* NodeImpl::GetSiblingElementByTag(const std::string& tag) const {
   return FindByTag(_nextSibling, tag);
}

ElementNode* NodeImpl::GetChildElementByQName(const QName& name) const {
   return FindByQName(FirstChildImpl(), name);
}

ElementNode* NodeImpl::GetSiblingElementByQName(const QName& name) const {
   return FindByQName(_nextSibling, name);
}

bool IsNil(const ElementNode* element) {
   PELMORA_VERIFY(element != NULL);
   const auto* impl = static_cast<const ElementNodeImpl*>(NodeImpl::FromNode(element));
   return IsTrueValue(impl->FindAttribute("xsi:nil")) ||
          IsTrueValue(impl->FindAttribute("xsi:null"));
}

ElementNode* GetFirstSiblingElement(Node* node) {
   for (NodeImpl* impl = node ? NodeImpl::FromNode(node) : nullptr; impl;
        impl = impl->NextSiblingImpl()) {
      const ElementNodeImpl* element = AsElement(impl);
      if (element && !IsNil(element)) return const_cast<ElementNodeImpl*>(element);
   }
   return nullptr;
}

ElementNode* GetNextSiblingElement(Node* node) {
   PELMORA_VERIFY(node != NULL);
   return GetFirstSiblingElement(node->GetNextSibling());
}

ElementNode* GetFirstChildElement(Node* node) {
   PELMORA_VERIFY(node != NULL);
   return GetFirstSiblingElement(node->GetFirstChild());
}

bool GetNamespace(const ElementNode* element, std::string& uri) {
   PELMORA_VERIFY(element != NULL);
   if (element->ResolvePrefix(element->GetPrefix(), uri)) return true;
   uri.clear();
   return false;
}

bool EvaluateSimplePath(const ElementNode* element, const std::string& path, std::string& result) {
   PELMORA_VERIFY(element != NULL);
   const NodeImpl* current = NodeImpl::FromNode(element);
   std::string_view rest(path);
   bool first = true;
   while (!rest.empty()) {
      size_t slash = rest.find('/');
      std::string_view token = rest.substr(0, slash);
      rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash + 1);
      if (token.empty()) continue;

      const auto* element = static_cast<const ElementNodeImpl*>(current);
      if (first) {
         first = false;
         if (token != "*" && token != element->GetTag()) return false;
         continue;
      }
      if (token[0] == '@') {
         // An attribute ends the walk at once; a missing one falls through to the child
         // search below, where a name starting with "@" finds nothing.
         if (const std::string* value = element->FindAttribute(std::string(token.substr(1)))) {
            result = *value;
            return true;
         }
      }
      const NodeImpl* child = current->FirstChildImpl();
      for (; child; child = child->NextSiblingImpl()) {
         const ElementNodeImpl* candidate = AsElement(child);
         if (candidate && (token == "*" || token == candidate->GetTag())) break;
      }
      if (!child) return false;
      current = child;
   }
   if (first) return false;  // no step names the start element

   // Only the first child counts: text after a comment is not the element's value.
   const NodeImpl* child = current->FirstChildImpl();
   if (!child || child->GetNodeType() != kTextNode) return false;
   result = static_cast<const TextNodeImpl*>(child)->GetText();
   return true;
}

bool EvaluateSimplePath(const Document* document, const std::string& path, std::string& result) {
   PELMORA_VERIFY(document != NULL);
   const ElementNode* root = document->GetRoot();
   if (!root) throw InvalidArgumentException("Document has no root.");
   return EvaluateSimplePath(root, path, result);
}

bool ValidateAnyURI(const char* uri) {
   if (!uri || !*uri) return false;
   size_t length = std::strlen(uri);
   size_t schemeEnd = std::strcspn(uri, ":/?#");
   if (uri[schemeEnd] == ':') {
      auto isAlpha = [](unsigned char c) { return (c | 0x20) >= 'a' && (c | 0x20) <= 'z'; };
      if (schemeEnd == 0 || !isAlpha(uri[0])) return false;
      for (size_t i = 1; i < schemeEnd; ++i) {
         unsigned char c = uri[i];
         if (!isAlpha(c) && !(c >= '0' && c <= '9') && c != '+' && c != '-' && c != '.')
            return false;
      }
   }
   auto isHex = [](unsigned char c) {
      return (c >= '0' && c <= '9') || ((c | 0x20) >= 'a' && (c | 0x20) <= 'f');
   };
   for (size_t i = 0; i < length; ++i) {
      unsigned char c = uri[i];
      if (c <= ' ' || c == 0x7f || std::strchr("<>\"{}|\\^`", c)) return false;
      if (c == '%' && (i + 2 >= length || !isHex(uri[i + 1]) || !isHex(uri[i + 2]))) return false;
   }
   return true;
}

std::string GetTextContent(const Node* node) {
   std::string text;
   for (Node* child = node->GetFirstChild(); child != nullptr; child = child->GetNextSibling()) {
      if (auto* piece = dynamic_cast<TextNode*>(child)) {
         text += piece->GetText();
      } else if (child->GetNodeType() == kCDataNode) {
         text += GetTextContent(child);
      }
   }
   return text;
}

}  // namespace Pelmora::Xml
