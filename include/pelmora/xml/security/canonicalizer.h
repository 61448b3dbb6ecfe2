#pragma once
// Canonical XML 1.0 and Exclusive XML Canonicalization 1.0, both without comments: the
// byte form of a subtree that XML signatures digest. Comments, processing instructions and
// CDATA sections are never written; values are escaped by fixed tables that also escape ">"
// in attributes and leave the byte after an escaped byte as it is (signatures made by our
// peers depend on these exact bytes). Canonicalisers and filters are immutable once made
// and may be shared between threads; a tree is read only while it is canonicalised.

#include <string>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/xml/node.h"

namespace Pelmora::Xml::Security {

// The algorithm identifiers accepted by CreateCanonicalizer.
inline constexpr const char* kInclusiveC14N = "http://www.w3.org/TR/2001/REC-xml-c14n-20010315";
inline constexpr const char* kExclusiveC14N = "http://www.w3.org/2001/10/xml-exc-c14n#";

class PELMORA_EXPORT UnsupportedCanonicalizationException : public Exception {
public:
   explicit UnsupportedCanonicalizationException(const std::string& algorithm)
       : Exception("The following canonicalization method is unsupported: " + algorithm) {}
   PELMORA_EXCEPTION_CLONE(UnsupportedCanonicalizationException)
};

// Decides which nodes a walk visits; a rejected node is skipped with its whole subtree.
class PELMORA_EXPORT NodeFilter : public virtual Object {
public:
   virtual bool Accept(Node* node) const = 0;
};

class PELMORA_EXPORT AcceptAllNodesFilter : public NodeFilter, public ObjectImpl {
public:
   bool Accept(Node* node) const override;
};

// Rejects one node, so that the subtree below it is not visited (an enveloped signature).
// Holds no reference to it: the node is only compared by address.
class PELMORA_EXPORT ExcludeNodeFilter : public NodeFilter, public ObjectImpl {
public:
   explicit ExcludeNodeFilter(const Node* excluded) : _excluded(excluded) {}
   bool Accept(Node* node) const override;

private:
   const Node* _excluded;
};

// Rejects comments and text nodes made only of tab, line feed, carriage return and space.
class PELMORA_EXPORT SkipWsAndCommentsFilter : public NodeFilter, public ObjectImpl {
public:
   bool Accept(Node* node) const override;
};

// A position in a tree with a shared filter; copies cheaply. The moves answer false and
// stay where they are when no accepted node is there.
class PELMORA_EXPORT NodeFilterIterator {
public:
   // `node` itself is the position, whether or not the filter accepts it.
   NodeFilterIterator(Node* node, NodeFilter* filter) : _node(node), _filter(filter) {}
   // To the first accepted child.
   bool MoveToChild();
   // To the next accepted sibling.
   bool MoveToSibling();
   Node* GetChild() const { return _node; }
   NodeFilter* GetFilter() const { return _filter.Get(); }

private:
   Node* _node;
   Ref<NodeFilter> _filter;
};

class PELMORA_EXPORT Canonicalizer : public virtual Object {
public:
   // Writes the canonical form of `node` (an element, a document or a text) and everything
   // below it.
   virtual void Canonicalize(Node* node, Writer& writer) const = 0;
   // The same from the iterator's position, visiting only what its filter accepts.
   virtual void Canonicalize(const NodeFilterIterator& position, Writer& writer) const = 0;
};

// kInclusiveC14N or kExclusiveC14N, compared as whole strings; anything else (the
// with-comments forms included) throws UnsupportedCanonicalizationException.
PELMORA_EXPORT void CreateCanonicalizer(const std::string& algorithm, Ref<Canonicalizer>& out);
// An exclusive canonicaliser that also renders the namespaces of `inclusivePrefixes` as
// inclusive canonicalisation would ("#default" names the default namespace). For the
// inclusive algorithm the list must be empty (InvalidArgumentException).
PELMORA_EXPORT void CreateCanonicalizer(const std::string& algorithm,
                                        const std::vector<std::string>& inclusivePrefixes,
                                        Ref<Canonicalizer>& out);

}  // namespace Pelmora::Xml::Security
