#include <algorithm>
#include <map>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/xml/security/canonicalizer.h"
#include "src/c14n/escape.h"

namespace Pelmora::Xml::Security {

namespace {

constexpr std::string_view kXmlNamespace = "http://www.w3.org/XML/1998/namespace";

// The walk of one subtree, as the adapter hands it on.
class CanonicalizerInt : public virtual Object {
public:
   virtual void Canonicalize(NodeFilterIterator position, Writer& writer) const = 0;
};

// Output collects in a string and goes to the writer in large pieces: canonical output is
// made of many short pieces, and a virtual call for each would cost more than the copying.
class Output {
public:
   explicit Output(Writer& writer) : _writer(writer) { _buffer.reserve(kFlushAt + 4096); }
   std::string& Buffer() { return _buffer; }
   void MaybeFlush() {
      if (_buffer.size() >= kFlushAt) Flush();
   }
   void Flush() {
      if (!_buffer.empty()) _writer.Write(_buffer.data(), static_cast<int>(_buffer.size()));
      _buffer.clear();
   }

private:
   static constexpr size_t kFlushAt = 64 * 1024;
   Writer& _writer;
   std::string _buffer;
};

struct Binding {
   std::string prefix;
   std::string uri;
};

// A stack of prefix bindings; the newest binding of a prefix wins. The empty prefix is the
// default namespace, and an unbound prefix reads as the empty URI.
class BindingStack {
public:
   const std::string* Find(std::string_view prefix) const {
      for (auto it = _bindings.rbegin(); it != _bindings.rend(); ++it) {
         if (it->prefix == prefix) return &it->uri;
      }
      return nullptr;
   }
   std::string_view Lookup(std::string_view prefix) const {
      const std::string* uri = Find(prefix);
      return uri == nullptr ? std::string_view() : std::string_view(*uri);
   }
   void Push(std::string prefix, std::string uri) { _bindings.push_back({std::move(prefix), std::move(uri)}); }
   size_t Mark() const { return _bindings.size(); }
   void Release(size_t mark) { _bindings.resize(mark); }
   const std::vector<Binding>& All() const { return _bindings; }

private:
   std::vector<Binding> _bindings;
};

// Whether `name` declares a namespace, and for which prefix ("" for the default).
bool IsNamespaceDeclaration(const std::string& name, std::string_view& prefix) {
   if (name.compare(0, 5, "xmlns") != 0) return false;
   if (name.size() == 5) {
      prefix = std::string_view();
      return true;
   }
   if (name[5] != ':') return false;
   prefix = std::string_view(name).substr(6);
   return true;
}

// The xml prefix is bound by definition; declaring it is never written out.
bool IsXmlPrefix(std::string_view prefix) {
   return prefix == "xml";
}

struct SortedAttribute {
   std::string_view uri;
   std::string_view localName;
   const std::string* name;
   const std::string* value;
};

// Attributes in the order of the W3C algorithms: by namespace URI, then local name; an
// attribute without namespace has the empty URI and so comes first.
bool AttributeLess(const SortedAttribute& a, const SortedAttribute& b) {
   if (a.uri != b.uri) return a.uri < b.uri;
   return a.localName < b.localName;
}

struct ElementState {
   std::map<std::string, std::string> attributes;
   std::vector<std::pair<std::string, std::string>> inherited;
   std::vector<Binding> rendered;
   std::vector<SortedAttribute> sorted;
};

class C14NCanonicalizer : public CanonicalizerInt, public ObjectImpl {
public:
   void Canonicalize(NodeFilterIterator position, Writer& writer) const override;

protected:
   // The namespace declarations to write on the apex element and on every other element:
   // added to `rendered` (not yet sorted) for the bindings in `scope` as they stand at
   // `element`, given what output ancestors have written (`written`).
   virtual void RootNodeAttributes(ElementNode* element, const std::map<std::string, std::string>& attributes,
                                   const BindingStack& scope, const BindingStack& written,
                                   std::vector<Binding>& rendered) const = 0;
   virtual void NodeAttributes(ElementNode* element, const std::map<std::string, std::string>& attributes,
                               const BindingStack& scope, const BindingStack& written,
                               std::vector<Binding>& rendered) const = 0;
   // Whether xml:* attributes of ancestors left out of the output move onto the apex.
   virtual bool InheritsXmlAttributes() const = 0;

private:
   struct Frame {
      NodeFilterIterator position;
      // Null for a document; kept to spare a cast at the end tag.
      ElementNode* element;
      size_t scopeMark;
      size_t writtenMark;
   };

   void GatherAllVisibleNamespaces(Node* apex, BindingStack& scope,
                                   std::vector<std::pair<std::string, std::string>>* xmlAttributes) const;
   void ElementCanonicalize(ElementNode* element, bool apex, BindingStack& scope, BindingStack& written,
                            ElementState& state, std::string& out) const;
   static void AttributesCanonicalize(ElementNode* element, ElementState& state, const BindingStack& scope,
                                      std::string& out);
   static void ProcessAttributes(const ElementNode* element, ElementState& state, const BindingStack& scope);
};

void C14NCanonicalizer::GatherAllVisibleNamespaces(
    Node* apex, BindingStack& scope, std::vector<std::pair<std::string, std::string>>* xmlAttributes) const {
   std::vector<ElementNode*> ancestors;
   for (Node* node = apex->GetParent(); node != nullptr; node = node->GetParent()) {
      if (node->GetNodeType() == kElementNode) ancestors.push_back(dynamic_cast<ElementNode*>(node));
   }
   std::map<std::string, std::string> attributes;
   // Outermost first, so that a nearer declaration is pushed later and wins.
   for (auto it = ancestors.rbegin(); it != ancestors.rend(); ++it) {
      (*it)->GetAttributes(attributes);
      for (const auto& [name, value] : attributes) {
         std::string_view prefix;
         if (IsNamespaceDeclaration(name, prefix) && !IsXmlPrefix(prefix)) scope.Push(std::string(prefix), value);
      }
   }
   if (xmlAttributes == nullptr) return;
   // Nearest first: the nearest ancestor's xml:lang or xml:space is the one in force.
   for (ElementNode* ancestor : ancestors) {
      ancestor->GetAttributes(attributes);
      for (const auto& attribute : attributes) {
         if (attribute.first.compare(0, 4, "xml:") != 0) continue;
         auto known = std::find_if(xmlAttributes->begin(), xmlAttributes->end(),
                                   [&](const auto& a) { return a.first == attribute.first; });
         if (known == xmlAttributes->end()) xmlAttributes->push_back(attribute);
      }
   }
}

void C14NCanonicalizer::ProcessAttributes(const ElementNode* element, ElementState& state,
                                          const BindingStack& scope) {
   state.sorted.clear();
   auto add = [&](const std::string& name, const std::string& value) {
      std::string_view prefix;
      if (IsNamespaceDeclaration(name, prefix)) return;
      SortedAttribute a{std::string_view(), name, &name, &value};
      size_t colon = name.find(':');
      if (colon != std::string::npos && colon > 0) {
         std::string_view attributePrefix = std::string_view(name).substr(0, colon);
         const std::string* uri = IsXmlPrefix(attributePrefix) ? nullptr : scope.Find(attributePrefix);
         if (IsXmlPrefix(attributePrefix)) {
            a.uri = kXmlNamespace;
            a.localName = std::string_view(name).substr(colon + 1);
         } else if (uri != nullptr && !uri->empty()) {
            a.uri = *uri;
            a.localName = std::string_view(name).substr(colon + 1);
         }
      }
      state.sorted.push_back(a);
   };
   for (const auto& [name, value] : state.attributes) add(name, value);
   for (const auto& [name, value] : state.inherited) {
      if (state.attributes.find(name) == state.attributes.end()) add(name, value);
   }
   (void)element;
   std::sort(state.sorted.begin(), state.sorted.end(), AttributeLess);
}

void C14NCanonicalizer::AttributesCanonicalize(ElementNode* element, ElementState& state,
                                               const BindingStack& scope, std::string& out) {
   std::sort(state.rendered.begin(), state.rendered.end(),
             [](const Binding& a, const Binding& b) { return a.prefix < b.prefix; });
   for (const Binding& binding : state.rendered) {
      if (binding.prefix.empty()) {
         out.append(" xmlns=\"");
      } else {
         out.append(" xmlns:");
         out.append(binding.prefix);
         out.append("=\"");
      }
      CanonicalizeStringValue(binding.uri.data(), binding.uri.size(), attributeCharReplacements,
                              kAttributeCharReplacementRows, out);
      out.push_back('"');
   }
   ProcessAttributes(element, state, scope);
   for (const SortedAttribute& a : state.sorted) {
      out.push_back(' ');
      out.append(*a.name);
      out.append("=\"");
      CanonicalizeStringValue(a.value->data(), a.value->size(), attributeCharReplacements,
                              kAttributeCharReplacementRows, out);
      out.push_back('"');
   }
}

void C14NCanonicalizer::ElementCanonicalize(ElementNode* element, bool apex, BindingStack& scope,
                                            BindingStack& written, ElementState& state,
                                            std::string& out) const {
   element->GetAttributes(state.attributes);
   for (const auto& [name, value] : state.attributes) {
      std::string_view prefix;
      if (IsNamespaceDeclaration(name, prefix) && !IsXmlPrefix(prefix)) scope.Push(std::string(prefix), value);
   }
   state.rendered.clear();
   if (apex) {
      RootNodeAttributes(element, state.attributes, scope, written, state.rendered);
   } else {
      NodeAttributes(element, state.attributes, scope, written, state.rendered);
   }
   for (const Binding& binding : state.rendered) written.Push(binding.prefix, binding.uri);

   out.push_back('<');
   const std::string& prefix = element->GetPrefix();
   if (!prefix.empty()) {
      out.append(prefix);
      out.push_back(':');
   }
   out.append(element->GetTag());
   AttributesCanonicalize(element, state, scope, out);
   out.push_back('>');
}

void WriteEndTag(ElementNode* element, std::string& out) {
   out.append("</");
   const std::string& prefix = element->GetPrefix();
   if (!prefix.empty()) {
      out.append(prefix);
      out.push_back(':');
   }
   out.append(element->GetTag());
   out.push_back('>');
}

void WriteText(Node* node, std::string& out) {
   auto* text = dynamic_cast<TextNode*>(node);
   if (text == nullptr) throw TypeMismatchException("TextNode", "another node kind");
   const std::string& value = text->GetText();
   CanonicalizeStringValue(value.data(), value.size(), textCharReplacements, kTextCharReplacementRows, out);
}

void C14NCanonicalizer::Canonicalize(NodeFilterIterator position, Writer& writer) const {
   Node* start = position.GetChild();
   if (start == nullptr) throw InvalidArgumentException("no node to canonicalize");
   Output output(writer);
   std::string& out = output.Buffer();
   BindingStack scope;
   BindingStack written;
   ElementState state;

   int type = start->GetNodeType();
   if (type == kTextNode) {
      WriteText(start, out);
      output.Flush();
      return;
   }
   if (type != kElementNode && type != kDocumentNode) return;

   if (type == kElementNode) {
      GatherAllVisibleNamespaces(start, scope, InheritsXmlAttributes() ? &state.inherited : nullptr);
   }
   std::vector<Frame> stack;
   // The document's elements are apexes too: nothing above them is written.
   auto enter = [&](const NodeFilterIterator& at) {
      auto* element = dynamic_cast<ElementNode*>(at.GetChild());
      bool apex = stack.empty() || stack.back().element == nullptr;
      Frame frame{at, element, scope.Mark(), written.Mark()};
      ElementCanonicalize(element, apex, scope, written, state, out);
      state.inherited.clear();
      stack.push_back(frame);
   };
   if (type == kElementNode) {
      enter(position);
   } else {
      stack.push_back({position, nullptr, scope.Mark(), written.Mark()});
   }
   NodeFilterIterator cursor = position;
   bool haveNext = cursor.MoveToChild();
   while (!stack.empty()) {
      if (haveNext) {
         Node* node = cursor.GetChild();
         switch (node->GetNodeType()) {
         case kElementNode:
            enter(cursor);
            haveNext = cursor.MoveToChild();
            continue;
         case kTextNode:
            WriteText(node, out);
            output.MaybeFlush();
            break;
         default:
            // Comments, processing instructions and CDATA sections write nothing, CDATA
            // content included.
            break;
         }
         haveNext = cursor.MoveToSibling();
         continue;
      }
      Frame frame = std::move(stack.back());
      stack.pop_back();
      if (frame.element != nullptr) WriteEndTag(frame.element, out);
      scope.Release(frame.scopeMark);
      written.Release(frame.writtenMark);
      output.MaybeFlush();
      if (stack.empty()) break;
      cursor = std::move(frame.position);
      haveNext = cursor.MoveToSibling();
   }
   output.Flush();
}

class C14NCanonicalizerInclusive : public C14NCanonicalizer {
protected:
   // Every namespace in scope: nothing above the apex is written.
   void RootNodeAttributes(ElementNode*, const std::map<std::string, std::string>&, const BindingStack& scope,
                           const BindingStack& written, std::vector<Binding>& rendered) const override {
      for (const Binding& binding : scope.All()) {
         if (std::any_of(rendered.begin(), rendered.end(),
                         [&](const Binding& b) { return b.prefix == binding.prefix; })) {
            continue;
         }
         std::string_view uri = scope.Lookup(binding.prefix);
         if (uri != written.Lookup(binding.prefix)) rendered.push_back({binding.prefix, std::string(uri)});
      }
   }
   // Below the apex only the element's own declarations can differ from what its output
   // ancestors wrote; a redundant one is left out, and xmlns="" is written only when it
   // undoes a default namespace written above.
   void NodeAttributes(ElementNode*, const std::map<std::string, std::string>& attributes, const BindingStack& scope,
                       const BindingStack& written, std::vector<Binding>& rendered) const override {
      for (const auto& [name, value] : attributes) {
         std::string_view prefix;
         if (!IsNamespaceDeclaration(name, prefix) || IsXmlPrefix(prefix)) continue;
         std::string_view uri = scope.Lookup(prefix);
         if (uri != written.Lookup(prefix)) rendered.push_back({std::string(prefix), std::string(uri)});
      }
   }
   bool InheritsXmlAttributes() const override { return true; }
};

class C14NCanonicalizerExclusive : public C14NCanonicalizer {
public:
   explicit C14NCanonicalizerExclusive(std::vector<std::string> inclusivePrefixes) {
      for (std::string& prefix : inclusivePrefixes) {
         _inclusivePrefixes.push_back(prefix == "#default" ? std::string() : std::move(prefix));
      }
   }

protected:
   void RootNodeAttributes(ElementNode* element, const std::map<std::string, std::string>& attributes,
                           const BindingStack& scope, const BindingStack& written,
                           std::vector<Binding>& rendered) const override {
      NodeAttributes(element, attributes, scope, written, rendered);
   }
   // The prefixes the element visibly uses (its own, the default one when it has none, and
   // those of its attributes), plus the inclusive prefixes that are in scope; each written
   // unless the nearest output ancestor that wrote it wrote the same URI.
   void NodeAttributes(ElementNode* element, const std::map<std::string, std::string>& attributes,
                       const BindingStack& scope, const BindingStack& written,
                       std::vector<Binding>& rendered) const override {
      auto consider = [&](std::string_view prefix) {
         if (IsXmlPrefix(prefix)) return;
         if (std::any_of(rendered.begin(), rendered.end(), [&](const Binding& b) { return b.prefix == prefix; })) {
            return;
         }
         if (!IsNamespaceVisible(prefix, scope, written)) return;
         std::string_view uri = scope.Lookup(prefix);
         if (uri != written.Lookup(prefix)) rendered.push_back({std::string(prefix), std::string(uri)});
      };
      consider(element->GetPrefix());
      for (const auto& [name, value] : attributes) {
         std::string_view prefix;
         if (IsNamespaceDeclaration(name, prefix)) continue;
         size_t colon = name.find(':');
         if (colon != std::string::npos && colon > 0) consider(std::string_view(name).substr(0, colon));
      }
      for (const std::string& prefix : _inclusivePrefixes) consider(prefix);
   }
   bool InheritsXmlAttributes() const override { return false; }

private:
   // A prefix without a binding in scope is not rendered; the default namespace always has
   // one (possibly empty), which undoes a default written above.
   static bool IsNamespaceVisible(std::string_view prefix, const BindingStack& scope, const BindingStack&) {
      return prefix.empty() || !scope.Lookup(prefix).empty();
   }

   std::vector<std::string> _inclusivePrefixes;
};

class CanonicalizerAdapter : public Canonicalizer, public ObjectImpl {
public:
   explicit CanonicalizerAdapter(Ref<CanonicalizerInt> implementation)
       : _implementation(std::move(implementation)), _acceptAll(new AcceptAllNodesFilter) {}

   void Canonicalize(Node* node, Writer& writer) const override {
      if (node == nullptr) throw InvalidArgumentException("no node to canonicalize");
      _implementation->Canonicalize(NodeFilterIterator(node, _acceptAll.Get()), writer);
   }
   void Canonicalize(const NodeFilterIterator& position, Writer& writer) const override {
      _implementation->Canonicalize(position, writer);
   }

private:
   Ref<CanonicalizerInt> _implementation;
   Ref<NodeFilter> _acceptAll;
};

}  // namespace

void CreateCanonicalizer(const std::string& algorithm, Ref<Canonicalizer>& out) {
   CreateCanonicalizer(algorithm, {}, out);
}

void CreateCanonicalizer(const std::string& algorithm, const std::vector<std::string>& inclusivePrefixes,
                         Ref<Canonicalizer>& out) {
   // Without prefixes the kinds hold nothing per caller, so every caller shares one each.
   static const Ref<CanonicalizerInt> inclusive(new C14NCanonicalizerInclusive);
   static const Ref<CanonicalizerInt> exclusive(new C14NCanonicalizerExclusive({}));
   Ref<CanonicalizerInt> implementation;
   if (algorithm == kInclusiveC14N) {
      if (!inclusivePrefixes.empty()) {
         throw InvalidArgumentException("inclusive prefixes apply only to exclusive canonicalization");
      }
      implementation = inclusive;
   } else if (algorithm == kExclusiveC14N) {
      implementation = inclusivePrefixes.empty() ? exclusive
                                                 : Ref<CanonicalizerInt>(new C14NCanonicalizerExclusive(inclusivePrefixes));
   } else {
      throw UnsupportedCanonicalizationException(algorithm);
   }
   out = new CanonicalizerAdapter(implementation);
}

}  // namespace Pelmora::Xml::Security
