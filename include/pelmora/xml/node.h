#pragma once
// The XML document model: a small reference-counted tree of six node kinds that the parser
// builds and that configuration, SOAP and the XML security code read and write. A parent
// owns one reference to each child; sibling and parent links are plain pointers, so a node
// reached through a tree lives as long as the tree holds it. Attributes are a name-to-value
// map in byte order of the names; namespace declarations are ordinary "xmlns" attributes.
// No locking: a tree belongs to one thread at a time; a finished tree may be read by many.

#include <map>
#include <string>
#include <utility>

#include "pelmora/object/export.h"
#include "pelmora/formatter/printable.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Xml {

// The values of Node::GetNodeType; they are part of the interface.
enum NodeType : int {
   kDocumentNode = 0,
   kTextNode = 1,
   kCDataNode = 2,
   kCommentNode = 3,
   kElementNode = 4,
   kProcessingInstructionNode = 5,
};

// A namespace URI and a local name.
struct PELMORA_EXPORT QName {
   QName() = default;
   QName(std::string namespaceUri, std::string localPart)
       : uri(std::move(namespaceUri)), localName(std::move(localPart)) {}
   bool operator==(const QName&) const = default;

   std::string uri;
   std::string localName;
};

class ElementNode;

// Insertion takes one reference to the new node, which must be free (no parent, no next
// sibling); a null node, a `pos` that is not a child of this node, or a node still linked
// elsewhere is a panic. Kinds of children a parent refuses raise InvalidArgumentException.
// As a message argument a node prints its compact form.
class PELMORA_EXPORT Node : public virtual Object, public Printable {
public:
   virtual Node* GetParent() const = 0;
   virtual Node* GetFirstChild() const = 0;
   virtual Node* GetLastChild() const = 0;
   virtual Node* GetNextSibling() const = 0;
   virtual Node* GetPrevSibling() const = 0;
   virtual void AppendChild(Node* node) = 0;
   virtual void InsertAfterChild(Node* node, Node* pos) = 0;
   virtual void InsertBeforeChild(Node* node, Node* pos) = 0;
   // Unlinks a child and drops the reference held for it (panics unless it is a child).
   virtual void RemoveChild(Node* node) = 0;
   // One of NodeType.
   virtual int GetNodeType() const = 0;
   // Compact form: no indentation and no added line feeds (comments end in one). A node
   // that XML cannot represent raises InvalidArgumentException before any of it is written
   // (what came before it in the tree may be): a comment holding "--" or ending in "-",
   // CDATA holding "]]>", a processing-instruction target that is not a name or is "xml" in
   // any case, processing-instruction data holding "?>".
   virtual void WriteNode(Writer* writer) const = 0;
   // Two spaces per level; elements whose first child is an element or comment are laid
   // out one child per line.
   virtual void PrettyWriteNode(Writer* writer) const = 0;
   // The first child (or, for the Sibling forms, the first later sibling) that is an
   // element with this local name, prefix ignored; null if none.
   virtual ElementNode* GetChildElementByTag(const std::string& tag) const = 0;
   virtual ElementNode* GetSiblingElementByTag(const std::string& tag) const = 0;
   // As above, matching the local name and the namespace in scope for the element's prefix.
   virtual ElementNode* GetChildElementByQName(const QName& name) const = 0;
   virtual ElementNode* GetSiblingElementByQName(const QName& name) const = 0;
};

// An element: an optional prefix, a local name (tag), attributes and the position in the
// source text (0 when built by code). Children: elements, text, CDATA and comments.
// Names are checked when set: an element or attribute name that is not an XML name (empty,
// first a digit, "-" or ".", or holding a blank, quote, "=" or other markup; bytes of 128
// and above pass) raises InvalidArgumentException and changes nothing.
class PELMORA_EXPORT ElementNode : public virtual Node {
public:
   virtual const std::string& GetPrefix() const = 0;
   virtual void SetPrefix(const std::string& prefix) = 0;
   virtual const std::string& GetTag() const = 0;
   virtual void SetTag(const std::string& tag) = 0;
   // prefix ":" tag, or the tag alone when there is no prefix.
   virtual std::string GetName() const = 0;
   // The namespace in scope for the prefix (empty if none) and the tag.
   virtual void GetQName(QName& name) const = 0;
   virtual int GetLineNumber() const = 0;
   virtual int GetColumnNumber() const = 0;
   // Exact lookup by the name as stored ("xsi:nil" is one name).
   virtual bool GetAttribute(const std::string& name, std::string& value) const = 0;
   // An unprefixed attribute when `name` has no namespace URI; otherwise a prefixed one
   // whose prefix resolves (ResolvePrefix) to that URI.
   virtual bool GetAttributeByQName(const QName& name, std::string& value) const = 0;
   // Replaces `attributes` with a copy of the whole map.
   virtual void GetAttributes(std::map<std::string, std::string>& attributes) const = 0;
   // Inserts or replaces.
   virtual void DefineAttribute(const std::string& name, const std::string& value) = 0;
   virtual void DefineAttribute(const std::string& name, const char* value) = 0;
   virtual void RemoveAttribute(const std::string& name) = 0;
   // Reads "xmlns:" + prefix ("xmlns" for the empty prefix) on this element, then on each
   // ancestor element, nearest first; the first hit wins.
   virtual bool ResolvePrefix(const std::string& prefix, std::string& uri) const = 0;
};

// A document: at most one root element, plus comments and processing instructions, and
// the XML declaration's version and encoding (empty unless set or parsed).
class PELMORA_EXPORT Document : public virtual Node {
public:
   virtual ElementNode* GetRoot() const = 0;
   // Replaces the root in its place; null removes it.
   virtual void SetRoot(ElementNode* root) = 0;
   virtual const std::string& GetXMLVersion() const = 0;
   // An empty version means the document is written without a declaration.
   virtual void SetXMLVersion(const std::string& version) = 0;
   virtual const std::string& GetEncoding() const = 0;
   virtual void SetEncoding(const std::string& encoding) = 0;
};

class PELMORA_EXPORT TextNode : public virtual Node {
public:
   virtual const std::string& GetText() const = 0;
   virtual void SetText(const std::string& text) = 0;
   virtual void AppendText(const char* data, int length) = 0;
};

// A CDATA section; its content is its text-node children, written unescaped.
class PELMORA_EXPORT CDataNode : public virtual Node {};

class PELMORA_EXPORT CommentNode : public virtual Node {
public:
   virtual const std::string& GetComment() const = 0;
   virtual void SetComment(const std::string& comment) = 0;
};

class PELMORA_EXPORT ProcessingInstructionNode : public virtual Node {
public:
   virtual const std::string& GetTarget() const = 0;
   virtual void SetTarget(const std::string& target) = 0;
   virtual const std::string& GetData() const = 0;
   virtual void SetData(const std::string& data) = 0;
};

PELMORA_EXPORT void CreateDocument(Ref<Document>& out);
// By qualified name, split at the first ":" into prefix and tag. A name that starts with
// ":" (not namespace-well-formed, but legal XML) has no prefix and is kept whole as the tag.
PELMORA_EXPORT void CreateElementNode(const std::string& qualifiedName, Ref<ElementNode>& out);
PELMORA_EXPORT void CreateElementNode(const std::string& qualifiedName, int line, int column,
                       Ref<ElementNode>& out);
PELMORA_EXPORT void CreateElementNode(const std::string& prefix, const std::string& tag, Ref<ElementNode>& out);
PELMORA_EXPORT void CreateElementNode(const std::string& prefix, const std::string& tag, int line, int column,
                       Ref<ElementNode>& out);
PELMORA_EXPORT void CreateTextNode(Ref<TextNode>& out);
PELMORA_EXPORT void CreateTextNode(const std::string& text, Ref<TextNode>& out);
PELMORA_EXPORT void CreateCDataNode(Ref<CDataNode>& out);
PELMORA_EXPORT void CreateCommentNode(Ref<CommentNode>& out);
PELMORA_EXPORT void CreateCommentNode(const std::string& comment, Ref<CommentNode>& out);
PELMORA_EXPORT void CreateProcessingInstructionNode(Ref<ProcessingInstructionNode>& out);
PELMORA_EXPORT void CreateProcessingInstructionNode(const std::string& target, const std::string& data,
                                     Ref<ProcessingInstructionNode>& out);

// Whether attribute "xsi:nil", or failing that "xsi:null", is exactly "true" or "1". The
// names are taken literally (the prefix is not resolved).
PELMORA_EXPORT bool IsNil(const ElementNode* element);
// From `node` itself along next-sibling links: the first element that is not nil.
PELMORA_EXPORT ElementNode* GetFirstSiblingElement(Node* node);
PELMORA_EXPORT ElementNode* GetNextSiblingElement(Node* node);
PELMORA_EXPORT ElementNode* GetFirstChildElement(Node* node);
// The namespace in scope for the element's own prefix (ResolvePrefix); false and an empty
// `uri` when none is declared.
PELMORA_EXPORT bool GetNamespace(const ElementNode* element, std::string& uri);

// Reads a value by a slash-separated path: the first step names the start element ("*"
// for any), each later step the first child element with that tag ("*" for any), and a
// step "@name" an attribute of the element reached, which ends the walk at once. Without
// an attribute step the value is the text of the element's first child, which must be a
// text node. False when a step finds nothing; `result` is then untouched.
PELMORA_EXPORT bool EvaluateSimplePath(const ElementNode* element, const std::string& path, std::string& result);
// The same from the document's root; InvalidArgumentException when there is no root.
PELMORA_EXPORT bool EvaluateSimplePath(const Document* document, const std::string& path, std::string& result);
// The text directly inside `node`: its text children and CDATA sections joined, in order;
// child elements and their text are skipped.
PELMORA_EXPORT std::string GetTextContent(const Node* node);

// Escapes the five markup characters as entities and writes other bytes below 32, except
// tab, line feed and carriage return, as "%" and two lowercase hexadecimal digits.
PELMORA_EXPORT void WriteText(Writer* writer, const std::string& text);

// Whether `uri` may serve as a namespace URI: not null or empty; no blank, control byte
// or any of < > " { } | \ ^ `; every "%" followed by two hexadecimal digits; and when a
// ":" comes before any "/", "?" or "#", the scheme before it starts with a letter and holds
// only letters, digits, "+", "-" and ".". Bytes of 128 and above pass (IRIs).
PELMORA_EXPORT bool ValidateAnyURI(const char* uri);

}  // namespace Pelmora::Xml
