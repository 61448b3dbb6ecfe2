// The tree links, the insertion rules of each node kind, element names and attributes,
// and the factories.

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstring>
#include <string_view>
#include <tuple>
#include <typeinfo>
#include <utility>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/object/scoreboard.h"
#include "src/xml/nodeArena.h"
#include "src/xml/nodeImpl.h"

namespace Pelmora::Xml {

namespace {

// Why `name` could not be written back as an XML name, or null when it can. ASCII follows
// XML's rule; bytes of 128 and above pass, so UTF-8 names need no decoding.
const char* NameProblem(std::string_view name) {
   static constexpr auto kKind = [] {
      std::array<unsigned char, 256> kind{};  // 0: refused, 1: inside a name, 2: anywhere
      for (int c = 'a'; c <= 'z'; ++c) kind[c] = kind[c - 'a' + 'A'] = 2;
      for (int c = 0x80; c < 0x100; ++c) kind[c] = 2;
      kind['_'] = kind[':'] = 2;
      for (int c = '0'; c <= '9'; ++c) kind[c] = 1;
      kind['-'] = kind['.'] = 1;
      return kind;
   }();
   if (name.empty()) return "is empty";
   for (unsigned char c : name) {
      if (kKind[c] != 0) continue;
      if (c == ' ' || c == '\t' || c == '\n' || c == '\r') return "holds a blank";
      if (c == '"' || c == '\'') return "holds a quote";
      if (c == '=') return "holds \"=\"";
      return "holds a character that names may not hold";
   }
   unsigned char first = static_cast<unsigned char>(name[0]);
   if (kKind[first] != 2) return first >= '0' && first <= '9' ? "starts with a digit"
                                                              : "starts with \"-\" or \".\"";
   return nullptr;
}

void VerifyElementName(const std::string& prefix, const std::string& tag) {
   if (prefix.empty()) {
      VerifyName("element name", tag);
   } else {
      VerifyName("element name", prefix + ":" + tag);
   }
}

}  // namespace

void VerifyName(const char* what, std::string_view name) {
   if (const char* problem = NameProblem(name)) {
      throw InvalidArgumentException(std::string(what) + " \"" + std::string(name) + "\" " +
                                     problem);
   }
}

// ---- NodeImpl ----

namespace {
// How far ahead of a node the tear-down asks for memory: in a parsed tree the nodes that
// follow in document order lie there. The walk streams through the node memory, so the
// request must run far enough ahead to cover a memory access; nearer than a few KB, it
// arrived too late.
constexpr size_t kReadAhead = 4096;
}  // namespace

void NodeImpl::DropChildren() {
   ParentNodeImpl* self = AsParent();
   // A descendant that only the tree references dies here without a DecRef of its own:
   // its count is cleared, its destructor run, and the memory, the arena references and
   // the scoreboard counts are given back in bulk. Atomic steps per node were most of the
   // cost of dropping a large document. One still referenced elsewhere keeps its subtree
   // and merely loses its parent. The reference tracker wants every last release itself,
   // so with one the nodes go through DecRef one by one.
   // The walk takes each node once, in document order, which for a parsed tree is the
   // order of its memory: the reads stream forwards through the arena. It remembers one
   // next sibling per level it is inside, not the children of a node all at once (for a
   // wide node that was a chase through the whole document ahead of the walk).
   bool bulk = GetRefTracker() == nullptr;
   int dropped[kProcessingInstructionNode + 1] = {};
   NodeDisposal disposal;
   std::vector<NodeImpl*> resume;
   NodeImpl* node = self->_firstChild;
   self->_firstChild = self->_lastChild = nullptr;
   while (node) {
      __builtin_prefetch(reinterpret_cast<char*>(node) + kReadAhead);
      NodeImpl* next = node->_nextSibling;
      if (node->ObjectImpl::GetRefCount() != 1) {
         node->_parent = node->_nextSibling = node->_prevSibling = nullptr;
         node->ObjectImpl::DecRef();
      } else {
         if (NodeImpl* child = node->FirstChildImpl()) {
            if (next) resume.push_back(next);
            next = child;
            node->AsParent()->_firstChild = node->AsParent()->_lastChild = nullptr;
         }
         if (bulk) {
            ++dropped[node->GetNodeType()];
            void* memory = dynamic_cast<void*>(node);
            node->_refCount.Write(0);
            node->~NodeImpl();
            disposal.Free(memory);
         } else {
            node->ObjectImpl::DecRef();
         }
      }
      if (!next && !resume.empty()) {
         next = resume.back();
         resume.pop_back();
      }
      node = next;
   }
   disposal.Flush();
   if (Scoreboard* scoreboard = bulk ? GetScoreboard() : nullptr) {
      for (int type = 0; type <= kProcessingInstructionNode; ++type)
         if (dropped[type]) scoreboard->Add(ScoreboardName(type), -dropped[type]);
   }
}

const char* NodeImpl::ScoreboardName(int nodeType) {
   static const char* const kNames[] = {
       TypeName(typeid(DocumentImpl)),     TypeName(typeid(TextNodeImpl)),
       TypeName(typeid(CDataNodeImpl)),    TypeName(typeid(CommentNodeImpl)),
       TypeName(typeid(ElementNodeImpl)),  TypeName(typeid(ProcessingInstructionNodeImpl)),
   };
   return kNames[nodeType];
}

Node* NodeImpl::GetParent() const {
   return _parent;
}
Node* NodeImpl::GetFirstChild() const {
   return FirstChildImpl();
}
Node* NodeImpl::GetLastChild() const {
   return LastChildImpl();
}
Node* NodeImpl::GetNextSibling() const {
   return _nextSibling;
}
Node* NodeImpl::GetPrevSibling() const {
   return _prevSibling;
}

NodeImpl* NodeImpl::FromNode(Node* node) {
   NodeImpl* impl = dynamic_cast<NodeImpl*>(node);
   PELMORA_VERIFY(impl != NULL);
   return impl;
}

const NodeImpl* NodeImpl::FromNode(const Node* node) {
   const NodeImpl* impl = dynamic_cast<const NodeImpl*>(node);
   PELMORA_VERIFY(impl != NULL);
   return impl;
}

void NodeImpl::VerifyFree() const {
   PELMORA_VERIFY(GetParent() == NULL);
   PELMORA_VERIFY(GetNextSibling() == NULL);
}

void NodeImpl::VerifyInsert(Node* node, Node* pos, bool hasPos) {
   PELMORA_VERIFY(node != NULL);
   VerifyInsertAllowed(node);
   if (hasPos) {
      PELMORA_VERIFY(pos != NULL);
      PELMORA_VERIFY(pos->GetParent() == this);
   }
   // A free node that is the top of this node's own tree would close a cycle.
   const NodeImpl* top = this;
   while (top->_parent) top = top->_parent;
   PELMORA_VERIFY(top != FromNode(node));
}

void NodeImpl::Insert(NodeImpl* child, NodeImpl* before) {
   // Only kinds that take children accept any: the others refused it already.
   ParentNodeImpl* self = AsParent();
   child->VerifyFree();
   child->ObjectImpl::IncRef();
   child->_parent = this;
   child->_nextSibling = before;
   child->_prevSibling = before ? before->_prevSibling : self->_lastChild;
   if (child->_prevSibling) {
      child->_prevSibling->_nextSibling = child;
   } else {
      self->_firstChild = child;
   }
   if (before) {
      before->_prevSibling = child;
   } else {
      self->_lastChild = child;
   }
   PostInsertProcessing(child);
}

void NodeImpl::AppendParsedChild(NodeImpl* child, bool counted) {
   VerifyInsertAllowed(child);
   LinkParsed(child, counted);
   PostInsertProcessing(child);
}

void NodeImpl::AppendChild(Node* node) {
   VerifyInsert(node, nullptr, false);
   Insert(FromNode(node), nullptr);
}

void NodeImpl::InsertAfterChild(Node* node, Node* pos) {
   VerifyInsert(node, pos, true);
   Insert(FromNode(node), FromNode(pos)->_nextSibling);
}

void NodeImpl::InsertBeforeChild(Node* node, Node* pos) {
   VerifyInsert(node, pos, true);
   Insert(FromNode(node), FromNode(pos));
}

void NodeImpl::RemoveChild(Node* node) {
   PELMORA_VERIFY(node != NULL);
   PELMORA_VERIFY(node->GetParent() == this);
   NodeImpl* child = FromNode(node);
   ParentNodeImpl* self = AsParent();  // it has a child
   if (child->_prevSibling) {
      child->_prevSibling->_nextSibling = child->_nextSibling;
   } else {
      self->_firstChild = child->_nextSibling;
   }
   if (child->_nextSibling) {
      child->_nextSibling->_prevSibling = child->_prevSibling;
   } else {
      self->_lastChild = child->_prevSibling;
   }
   child->_parent = child->_nextSibling = child->_prevSibling = nullptr;
   PostRemoveProcessing(child);
   child->DecRef();
}

// ---- DocumentImpl ----

ElementNode* DocumentImpl::GetRoot() const {
   return _root.Get();
}

void DocumentImpl::SetRoot(ElementNode* root) {
   Ref<ElementNodeImpl> old = _root;
   if (old.Get() == root) return;
   NodeImpl* next = nullptr;
   if (old) {
      next = old->NextSiblingImpl();
      RemoveChild(old.Get());
   }
   if (!root) return;
   if (next) {
      InsertBeforeChild(root, next);
   } else {
      AppendChild(root);
   }
}

void DocumentImpl::VerifyInsertAllowed(Node* child) const {
   switch (child->GetNodeType()) {
      case kElementNode:
         if (_root) throw InvalidArgumentException("Document's Root Element Node already set");
         break;
      case kCDataNode:
         throw InvalidArgumentException("DocumentNode cannot have CData node children");
      case kTextNode:
         throw InvalidArgumentException("DocumentNode cannot have text node children");
      case kDocumentNode:
         throw InvalidArgumentException("DocumentNode cannot have document node as child");
      default:
         break;
   }
}

void DocumentImpl::PostInsertProcessing(NodeImpl* child) {
   if (child->GetNodeType() != kElementNode) return;
   PELMORA_VERIFY(_root == NULL);
   _root = static_cast<ElementNodeImpl*>(child);
}

void DocumentImpl::PostRemoveProcessing(NodeImpl* child) {
   if (child->GetNodeType() != kElementNode) return;
   PELMORA_VERIFY(_root.Get() == child);
   _root.Reset();
}

// ---- ElementNodeImpl ----

ElementName ElementName::FromQualified(std::string_view qualifiedName) {
   // A leading colon separates nothing: ":" or ":x" kept whole still writes back as read.
   size_t colon = qualifiedName.find(':');
   if (colon == std::string_view::npos || colon == 0) return {{}, std::string(qualifiedName)};
   return {std::string(qualifiedName.substr(0, colon)),
           std::string(qualifiedName.substr(colon + 1))};
}

ElementNodeImpl::ElementNodeImpl(const std::string& qualifiedName, int line, int column)
    : _name(new ElementName(ElementName::FromQualified(qualifiedName))),
      _line(line),
      _column(column) {
   _ownsName = true;
}

ElementNodeImpl::ElementNodeImpl(const std::string& prefix, const std::string& tag, int line,
                                 int column)
    : _name(new ElementName{prefix, tag}), _line(line), _column(column) {
   _ownsName = true;
}

ElementNodeImpl::ElementNodeImpl(const ElementName* name, int line, int column,
                                 NodeArena* arena)
    : _attributes(NodePartAllocator<Attribute>(arena)),
      _name(name),
      _line(line),
      _column(column) {}

ElementNodeImpl::~ElementNodeImpl() {
   if (_ownsName) delete _name;
}

ElementName& ElementNodeImpl::OwnName() {
   if (!_ownsName) {
      _name = new ElementName(*_name);
      _ownsName = true;
   }
   return *const_cast<ElementName*>(_name);
}

void ElementNodeImpl::SetPrefix(const std::string& prefix) {
   VerifyElementName(prefix, _name->tag);
   OwnName().prefix = prefix;
}

void ElementNodeImpl::SetTag(const std::string& tag) {
   VerifyElementName(_name->prefix, tag);
   OwnName().tag = tag;
}

std::string ElementNodeImpl::GetName() const {
   if (_name->prefix.empty()) return _name->tag;
   std::string name;
   name.reserve(_name->prefix.size() + 1 + _name->tag.size());
   name.append(_name->prefix).append(1, ':').append(_name->tag);
   return name;
}

void ElementNodeImpl::GetQName(QName& name) const {
   if (!ResolvePrefix(_name->prefix, name.uri)) name.uri.clear();
   name.localName = _name->tag;
}

namespace {

bool NameBefore(const std::pair<std::string, std::string>& attribute, const std::string& name) {
   return attribute.first < name;
}

}  // namespace

const std::string* ElementNodeImpl::FindAttribute(const std::string& name) const {
   auto found = std::lower_bound(_attributes.begin(), _attributes.end(), name, NameBefore);
   return found != _attributes.end() && found->first == name ? &found->second : nullptr;
}

bool ElementNodeImpl::GetAttribute(const std::string& name, std::string& value) const {
   const std::string* found = FindAttribute(name);
   if (!found) return false;
   value = *found;
   return true;
}

bool ElementNodeImpl::GetAttributeByQName(const QName& name, std::string& value) const {
   // Unprefixed attributes are in no namespace; the default namespace does not apply.
   if (name.uri.empty()) return GetAttribute(name.localName, value);
   std::string uri;
   for (const auto& [key, attributeValue] : _attributes) {
      size_t colon = key.find(':');
      if (colon == std::string::npos || key.compare(colon + 1, std::string::npos, name.localName))
         continue;
      if (ResolvePrefix(key.substr(0, colon), uri) && uri == name.uri) {
         value = attributeValue;
         return true;
      }
   }
   return false;
}

void ElementNodeImpl::GetAttributes(AttributeMap& attributes) const {
   attributes.clear();
   for (const auto& [name, value] : _attributes)
      attributes.emplace_hint(attributes.end(), name, value);
}

void ElementNodeImpl::DefineAttribute(const std::string& name, const std::string& value) {
   auto found = std::lower_bound(_attributes.begin(), _attributes.end(), name, NameBefore);
   if (found != _attributes.end() && found->first == name) {
      found->second = value;
   } else {
      // Checked once here: a name in the list was either checked or came from the parser.
      VerifyName("attribute name", name);
      _attributes.emplace(found, name, value);
   }
}

void ElementNodeImpl::DefineAttribute(const std::string& name, const char* value) {
   PELMORA_VERIFY(value != NULL);
   DefineAttribute(name, std::string(value));
}

void ElementNodeImpl::DefineParsedAttributes(ParsedAttribute* attributes, size_t count) {
   if (count == 0) return;
   // Ordered while they are still C strings: moving pairs of strings about costs more.
   // strcmp orders bytes as the strings' comparison does, and names are unique.
   auto byName = [](const ParsedAttribute& a, const ParsedAttribute& b) {
      return std::strcmp(a.name, b.name) < 0;
   };
   if (!std::is_sorted(attributes, attributes + count, byName))
      std::sort(attributes, attributes + count, byName);
   _attributes.reserve(count);
   for (const ParsedAttribute* attribute = attributes; attribute != attributes + count; ++attribute)
      _attributes.emplace_back(std::piecewise_construct,
                               std::forward_as_tuple(attribute->name, attribute->nameLength),
                               std::forward_as_tuple(attribute->value, attribute->valueLength));
}

void ElementNodeImpl::RemoveAttribute(const std::string& name) {
   auto found = std::lower_bound(_attributes.begin(), _attributes.end(), name, NameBefore);
   if (found != _attributes.end() && found->first == name) _attributes.erase(found);
}

bool ElementNodeImpl::ResolvePrefix(const std::string& prefix, std::string& uri) const {
   std::string key = prefix.empty() ? std::string("xmlns") : "xmlns:" + prefix;
   for (const NodeImpl* node = this; node && node->GetNodeType() == kElementNode;
        node = node->ParentImpl()) {
      if (const std::string* found =
              static_cast<const ElementNodeImpl*>(node)->FindAttribute(key)) {
         uri = *found;
         return true;
      }
   }
   return false;
}

void ElementNodeImpl::VerifyInsertAllowed(Node* child) const {
   int type = child->GetNodeType();
   if (type == kDocumentNode || type == kProcessingInstructionNode)
      throw InvalidArgumentException("Elements cannot have document or PI children.");
}

// ---- The leaf kinds ----

void TextNodeImpl::AppendText(const char* data, int length) {
   PELMORA_VERIFY(length >= 0);
   _text.append(data, static_cast<size_t>(length));
}

void TextNodeImpl::VerifyInsertAllowed(Node*) const {
   throw InvalidArgumentException("Cannot add child to text node.");
}

void CDataNodeImpl::VerifyInsertAllowed(Node* child) const {
   if (child->GetNodeType() != kTextNode)
      throw InvalidArgumentException("Cannot add non-text child to CData node.");
}

void CommentNodeImpl::VerifyInsertAllowed(Node*) const {
   throw InvalidArgumentException("Cannot add child to Comment node.");
}

void ProcessingInstructionNodeImpl::VerifyInsertAllowed(Node*) const {
   throw InvalidArgumentException("Cannot add child to PI node.");
}

// ---- Factories ----

void CreateDocument(Ref<Document>& out) {
   out = new DocumentImpl();
}

void CreateElementNode(const std::string& qualifiedName, Ref<ElementNode>& out) {
   CreateElementNode(qualifiedName, 0, 0, out);
}

void CreateElementNode(const std::string& qualifiedName, int line, int column,
                       Ref<ElementNode>& out) {
   VerifyName("element name", qualifiedName);
   out = new ElementNodeImpl(qualifiedName, line, column);
}

void CreateElementNode(const std::string& prefix, const std::string& tag, Ref<ElementNode>& out) {
   CreateElementNode(prefix, tag, 0, 0, out);
}

void CreateElementNode(const std::string& prefix, const std::string& tag, int line, int column,
                       Ref<ElementNode>& out) {
   VerifyElementName(prefix, tag);
   out = new ElementNodeImpl(prefix, tag, line, column);
}

void CreateTextNode(Ref<TextNode>& out) {
   out = new TextNodeImpl();
}

void CreateTextNode(const std::string& text, Ref<TextNode>& out) {
   out = new TextNodeImpl(text);
}

void CreateCDataNode(Ref<CDataNode>& out) {
   out = new CDataNodeImpl();
}

void CreateCommentNode(Ref<CommentNode>& out) {
   out = new CommentNodeImpl();
}

void CreateCommentNode(const std::string& comment, Ref<CommentNode>& out) {
   out = new CommentNodeImpl(comment);
}

void CreateProcessingInstructionNode(Ref<ProcessingInstructionNode>& out) {
   out = new ProcessingInstructionNodeImpl();
}

void CreateProcessingInstructionNode(const std::string& target, const std::string& data,
                                     Ref<ProcessingInstructionNode>& out) {
   out = new ProcessingInstructionNodeImpl(target, data);
}

}  // namespace Pelmora::Xml
