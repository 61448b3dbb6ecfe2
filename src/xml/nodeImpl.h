#pragma once
// The implementations of the six node kinds. NodeImpl keeps the tree links and enforces
// the insertion invariants; each kind says which children it accepts and how it writes
// itself. Only the kinds that take children (ParentNodeImpl) carry a child list: texts,
// comments and instructions are most of a parsed document's nodes. The parser and the
// serialiser use the unchecked link accessors. Not locked.

#include <cstddef>
#include <map>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "pelmora/xml/node.h"

namespace Pelmora::Xml {

class NodeArena;
void* AllocateNodePart(NodeArena* arena, size_t size);
void FreeNodePart(void* part);

// Hands a container of a node the memory of AllocateNodePart. Any instance frees what any
// other allocated, so all compare equal.
template <class T>
class NodePartAllocator {
public:
   using value_type = T;
   using is_always_equal = std::true_type;

   explicit NodePartAllocator(NodeArena* arena = nullptr) : _arena(arena) {}
   template <class U>
   NodePartAllocator(const NodePartAllocator<U>& other) : _arena(other.Arena()) {}

   T* allocate(size_t count) {
      return static_cast<T*>(AllocateNodePart(_arena, count * sizeof(T)));
   }
   void deallocate(T* part, size_t) { FreeNodePart(part); }
   NodeArena* Arena() const { return _arena; }
   template <class U>
   bool operator==(const NodePartAllocator<U>&) const { return true; }

private:
   NodeArena* _arena;
};

// An element's prefix and tag. Parsed elements of one document share one per distinct
// name (the document's arena keeps them); other elements own theirs.
struct ElementName {
   std::string prefix;
   std::string tag;
   // Splits a qualified name at the first ":"; no ":", or only a leading one, means no
   // prefix.
   static ElementName FromQualified(std::string_view qualifiedName);
};

// Throws InvalidArgumentException, naming `what`, `name` and the fault, unless `name` can be
// written as an XML name.
void VerifyName(const char* what, std::string_view name);

class ParentNodeImpl;

class NodeImpl : public virtual Node, public ObjectImpl {
public:
   // Nodes come from the general heap, or from a parsed document's arena.
   static void* operator new(size_t size);
   static void* operator new(size_t size, NodeArena* arena);
   static void operator delete(void* node);
   static void operator delete(void* node, NodeArena* arena);

   ~NodeImpl() override = default;

   Node* GetParent() const override;
   Node* GetFirstChild() const override;
   Node* GetLastChild() const override;
   Node* GetNextSibling() const override;
   Node* GetPrevSibling() const override;
   void AppendChild(Node* node) override;
   void InsertAfterChild(Node* node, Node* pos) override;
   void InsertBeforeChild(Node* node, Node* pos) override;
   void RemoveChild(Node* node) override;
   void WriteNode(Writer* writer) const override { WriteNode(writer, -1); }
   void PrettyWriteNode(Writer* writer) const override { WriteNode(writer, 0); }
   void PrintTo(Writer* writer) const override { WriteNode(writer, -1); }
   ElementNode* GetChildElementByTag(const std::string& tag) const override;
   ElementNode* GetSiblingElementByTag(const std::string& tag) const override;
   ElementNode* GetChildElementByQName(const QName& name) const override;
   ElementNode* GetSiblingElementByQName(const QName& name) const override;

   // -1 writes compactly; 0 or more pretty-prints at that indentation level.
   virtual void WriteNode(Writer* writer, int indent) const = 0;
   // Throws InvalidArgumentException when this node may not hold `child`.
   virtual void VerifyInsertAllowed(Node* child) const = 0;
   virtual void PostInsertProcessing(NodeImpl*) {}
   virtual void PostRemoveProcessing(NodeImpl*) {}

   NodeImpl* ParentImpl() const { return _parent; }
   NodeImpl* FirstChildImpl() const;
   NodeImpl* LastChildImpl() const;
   NodeImpl* NextSiblingImpl() const { return _nextSibling; }
   // AppendChild for callers that hold the implementation of a new node (no cycle check).
   void AppendChildImpl(NodeImpl* child) {
      VerifyInsertAllowed(child);
      Insert(child, nullptr);
   }

   // For the parser: appends a node it has just made, which nobody else references. With
   // `counted` false the node is not reported to the scoreboard; the caller reports it
   // (with the others of its document, at once) under ScoreboardName.
   void AppendParsedChild(NodeImpl* child, bool counted);
   // As AppendParsedChild, on an element, for a child of a kind elements take: nothing to
   // check, and an element does nothing after an insertion.
   void AppendParsedChildOfElement(NodeImpl* child, bool counted) { LinkParsed(child, counted); }
   // The name under which the scoreboard counts the nodes of a kind (a NodeType).
   static const char* ScoreboardName(int nodeType);

   // The implementation behind a node of this model; any other Node is a panic.
   static NodeImpl* FromNode(Node* node);
   static const NodeImpl* FromNode(const Node* node);

protected:
   explicit NodeImpl(bool takesChildren) : _takesChildren(takesChildren) {}

private:
   friend class ParentNodeImpl;

   // Only for a node that takes children.
   ParentNodeImpl* AsParent();
   // For ~ParentNodeImpl: releases the children, without recursing once per level.
   void DropChildren();

   // Links `child` before `before` (at the end when null) and takes one reference.
   void Insert(NodeImpl* child, NodeImpl* before);
   // The checks shared by the three insertion forms.
   void VerifyInsert(Node* node, Node* pos, bool hasPos);
   // The invariants of a node about to be linked: no parent and no next sibling.
   void VerifyFree() const;
   // Links a new child last and gives it the parent's reference.
   inline void LinkParsed(NodeImpl* child, bool counted);

   // First, so that it takes the room the object's count leaves free.
   const bool _takesChildren;

protected:
   // An element's: whether it owns its name. Kept here for the same free room.
   bool _ownsName = false;

private:
   NodeImpl* _nextSibling = nullptr;
   NodeImpl* _prevSibling = nullptr;
   NodeImpl* _parent = nullptr;
};

// A node that takes children: the document, elements and CDATA sections.
class ParentNodeImpl : public NodeImpl {
public:
   ~ParentNodeImpl() override {
      if (_firstChild) DropChildren();
   }

protected:
   ParentNodeImpl() : NodeImpl(true) {}

private:
   friend class NodeImpl;

   NodeImpl* _firstChild = nullptr;
   NodeImpl* _lastChild = nullptr;
};

inline ParentNodeImpl* NodeImpl::AsParent() {
   return static_cast<ParentNodeImpl*>(this);
}

inline NodeImpl* NodeImpl::FirstChildImpl() const {
   return _takesChildren ? static_cast<const ParentNodeImpl*>(this)->_firstChild : nullptr;
}

inline NodeImpl* NodeImpl::LastChildImpl() const {
   return _takesChildren ? static_cast<const ParentNodeImpl*>(this)->_lastChild : nullptr;
}

inline void NodeImpl::LinkParsed(NodeImpl* child, bool counted) {
   if (counted) {
      child->ObjectImpl::IncRef();
   } else {
      child->_refCount.Write(1);
   }
   ParentNodeImpl* self = AsParent();
   child->_parent = this;
   child->_prevSibling = self->_lastChild;
   if (self->_lastChild) {
      self->_lastChild->_nextSibling = child;
   } else {
      self->_firstChild = child;
   }
   self->_lastChild = child;
}

// A node that never holds children.
class LeafNodeImpl : public NodeImpl {
protected:
   LeafNodeImpl() : NodeImpl(false) {}
};

class ElementNodeImpl;

class DocumentImpl final : public virtual Document, public ParentNodeImpl {
public:
   using NodeImpl::WriteNode;

   int GetNodeType() const override { return kDocumentNode; }
   ElementNode* GetRoot() const override;
   void SetRoot(ElementNode* root) override;
   const std::string& GetXMLVersion() const override { return _version; }
   void SetXMLVersion(const std::string& version) override { _version = version; }
   const std::string& GetEncoding() const override { return _encoding; }
   void SetEncoding(const std::string& encoding) override { _encoding = encoding; }

   void WriteNode(Writer* writer, int indent) const override;
   void VerifyInsertAllowed(Node* child) const override;
   void PostInsertProcessing(NodeImpl* child) override;
   void PostRemoveProcessing(NodeImpl* child) override;

   ElementNodeImpl* RootImpl() const { return _root.Get(); }

private:
   Ref<ElementNodeImpl> _root;
   std::string _version;
   std::string _encoding;
};

class ElementNodeImpl final : public virtual ElementNode, public ParentNodeImpl {
public:
   using AttributeMap = std::map<std::string, std::string>;
   // Sorted by name: the order of a map, at one allocation per element, which for a parsed
   // element comes from its document's arena.
   using Attribute = std::pair<std::string, std::string>;
   using AttributeList = std::vector<Attribute, NodePartAllocator<Attribute>>;
   using NodeImpl::WriteNode;

   // The constructors take names as given (the parser's are known good); the factories
   // and setters check them. The qualified name is split as ElementName::FromQualified.
   ElementNodeImpl(const std::string& qualifiedName, int line, int column);
   ElementNodeImpl(const std::string& prefix, const std::string& tag, int line, int column);
   // With a name shared by the elements of a parsed document; `name` outlives the node,
   // which is made in `arena`.
   ElementNodeImpl(const ElementName* name, int line, int column, NodeArena* arena);
   ~ElementNodeImpl() override;

   int GetNodeType() const override { return kElementNode; }
   const std::string& GetPrefix() const override { return _name->prefix; }
   void SetPrefix(const std::string& prefix) override;
   const std::string& GetTag() const override { return _name->tag; }
   void SetTag(const std::string& tag) override;
   std::string GetName() const override;
   void GetQName(QName& name) const override;
   int GetLineNumber() const override { return _line; }
   int GetColumnNumber() const override { return _column; }
   bool GetAttribute(const std::string& name, std::string& value) const override;
   bool GetAttributeByQName(const QName& name, std::string& value) const override;
   void GetAttributes(AttributeMap& attributes) const override;
   void DefineAttribute(const std::string& name, const std::string& value) override;
   void DefineAttribute(const std::string& name, const char* value) override;
   void RemoveAttribute(const std::string& name) override;
   bool ResolvePrefix(const std::string& prefix, std::string& uri) const override;

   void WriteNode(Writer* writer, int indent) const override;
   void VerifyInsertAllowed(Node* child) const override;

   // The attribute's value, or null; no copy.
   const std::string* FindAttribute(const std::string& name) const;
   // An attribute of a start tag, as the parser hands it over.
   struct ParsedAttribute {
      const char* name;
      size_t nameLength;
      const char* value;
      size_t valueLength;
   };
   // For the parser: defines the attributes of a start tag on an element that has none
   // yet. Expat has made the names unique; `attributes` is reordered by name.
   void DefineParsedAttributes(ParsedAttribute* attributes, size_t count);

   // The serialiser's halves of an element, so that nesting needs no recursion. The start
   // tag answers whether children follow (otherwise it was written as an empty tag).
   bool WriteStartTag(Writer* writer, int indent) const;
   void WriteEndTag(Writer* writer, int indent) const;
   // Pretty mode with an element or comment first: one child per line.
   bool IsBlockLayout(int indent) const;

private:
   // The name to change, made this element's own first if it was shared.
   ElementName& OwnName();

   // Empty until the first attribute: most elements carry none. A parsed element's list
   // comes from its document's arena.
   AttributeList _attributes;
   const ElementName* _name;
   int _line;
   int _column;
};

class TextNodeImpl final : public virtual TextNode, public LeafNodeImpl {
public:
   using NodeImpl::WriteNode;

   TextNodeImpl() = default;
   explicit TextNodeImpl(const std::string& text) : _text(text) {}
   TextNodeImpl(const char* data, size_t length) : _text(data, length) {}

   int GetNodeType() const override { return kTextNode; }
   const std::string& GetText() const override { return _text; }
   void SetText(const std::string& text) override { _text = text; }
   void AppendText(const char* data, int length) override;

   void WriteNode(Writer* writer, int indent) const override;
   void VerifyInsertAllowed(Node* child) const override;

   // For the parser, which adds the later pieces of a text to the node it made.
   std::string& ParsedText() { return _text; }

private:
   std::string _text;
};

class CDataNodeImpl final : public virtual CDataNode, public ParentNodeImpl {
public:
   using NodeImpl::WriteNode;

   int GetNodeType() const override { return kCDataNode; }
   void WriteNode(Writer* writer, int indent) const override;
   void VerifyInsertAllowed(Node* child) const override;
};

class CommentNodeImpl final : public virtual CommentNode, public LeafNodeImpl {
public:
   using NodeImpl::WriteNode;

   CommentNodeImpl() = default;
   explicit CommentNodeImpl(const std::string& comment) : _comment(comment) {}
   CommentNodeImpl(const char* data, size_t length) : _comment(data, length) {}

   int GetNodeType() const override { return kCommentNode; }
   const std::string& GetComment() const override { return _comment; }
   void SetComment(const std::string& comment) override { _comment = comment; }

   void WriteNode(Writer* writer, int indent) const override;
   void VerifyInsertAllowed(Node* child) const override;

private:
   std::string _comment;
};

class ProcessingInstructionNodeImpl final : public virtual ProcessingInstructionNode,
                                            public LeafNodeImpl {
public:
   using NodeImpl::WriteNode;

   ProcessingInstructionNodeImpl() = default;
   ProcessingInstructionNodeImpl(const std::string& target, const std::string& data)
       : _target(target), _data(data) {}

   int GetNodeType() const override { return kProcessingInstructionNode; }
   const std::string& GetTarget() const override { return _target; }
   void SetTarget(const std::string& target) override { _target = target; }
   const std::string& GetData() const override { return _data; }
   void SetData(const std::string& data) override { _data = data; }

   void WriteNode(Writer* writer, int indent) const override;
   void VerifyInsertAllowed(Node* child) const override;

private:
   std::string _target;
   std::string _data;
};

}  // namespace Pelmora::Xml
