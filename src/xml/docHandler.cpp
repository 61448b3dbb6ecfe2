// The standard handler: builds the document from the parser's events, merging adjacent
// character data, and enforces the size, node and depth limits on restricted documents.

#include <cstdint>
#include <algorithm>
#include <cstring>
#include <initializer_list>
#include <memory>
#include <string>
#include <string_view>
#include <mutex>
#include <type_traits>
#include <utility>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/object/scoreboard.h"
#include "pelmora/xml/parser.h"
#include "src/xml/documentEvents.h"
#include "src/xml/nodeArena.h"
#include "src/xml/nodeImpl.h"
#include "src/xml/xmlLog.h"

namespace Pelmora::Xml {
namespace {

// The character data buffer a handler keeps between texts: larger ones are given back.
constexpr size_t kKeptTextBytes = 64 * 1024;
// The attributes of a start tag a handler keeps room for between documents.
constexpr size_t kKeptAttributes = 1024;

// The limits of handlers created without explicit ones; whoever owns the configuration
// sets them (SetDefaultDocLimits), the defaults stand until then.
std::mutex g_defaultLimitsMutex;
DocLimits g_defaultLimits;

// Limits given by the caller stand where configured values would.
void VerifyLimits(const DocLimits& limits) {
   for (long long out : {limits.maxChars, limits.maxNodes, limits.maxDepth})
      PELMORA_VERIFY(out >= 0);
}

// The names of the document being built, by qualified name: open addressing over a
// table the handler keeps from one document to the next, so that looking up a name costs
// a hash and a compare and a small document allocates nothing here.
class NameTable {
public:
   // `qualifiedName` is null-terminated, as expat hands it over: its length is found in
   // the same pass as its hash.
   const ElementName* Find(const char* qualifiedName, NodeArena* arena, size_t& length) {
      if (_slots.empty()) _slots.resize(kFirstSize);
      uint64_t hash = kHashBasis;  // FNV-1a
      const char* end = qualifiedName;
      for (; *end; ++end) hash = (hash ^ static_cast<unsigned char>(*end)) * kHashPrime;
      length = static_cast<size_t>(end - qualifiedName);
      std::string_view name(qualifiedName, length);
      size_t mask = _slots.size() - 1;
      for (size_t i = hash & mask;; i = (i + 1) & mask) {
         Slot& slot = _slots[i];
         if (!slot.name) {
            slot.name = arena->NewName(name, slot.key);
            slot.hash = hash;
            const ElementName* made = slot.name;
            if (++_count * 2 > _slots.size()) Grow();
            return made;
         }
         if (slot.hash == hash && slot.key == name) return slot.name;
      }
   }

   // Before the names' arena goes.
   void Clear() {
      if (_count == 0) return;
      std::fill(_slots.begin(), _slots.end(), Slot());
      _count = 0;
   }

private:
   static constexpr size_t kFirstSize = 64;

   struct Slot {
      uint64_t hash = 0;
      std::string_view key;  // in the arena of `name`
      const ElementName* name = nullptr;
   };

   static constexpr uint64_t kHashBasis = 14695981039346656037ull;
   static constexpr uint64_t kHashPrime = 1099511628211ull;

   void Grow() {
      std::vector<Slot> old(_slots.size() * 2);
      old.swap(_slots);
      size_t mask = _slots.size() - 1;
      for (const Slot& slot : old) {
         if (!slot.name) continue;
         size_t i = slot.hash & mask;
         while (_slots[i].name) i = (i + 1) & mask;
         _slots[i] = slot;
      }
   }

   std::vector<Slot> _slots;
   size_t _count = 0;
};

class XMLDocHandlerImpl final : public virtual XMLHandler, public ObjectImpl, public DocumentEvents {
public:
   explicit XMLDocHandlerImpl(const DocLimits& limits)
       : _maxChars(static_cast<uint64_t>(limits.maxChars)),
         _maxNodes(static_cast<uint64_t>(limits.maxNodes)),
         _maxDepth(static_cast<uint64_t>(limits.maxDepth)) {
      VerifyLimits(limits);
   }

   void StartNewDocument(Ref<Object>& result) override { StartNewDocument(false, result); }

   ~XMLDocHandlerImpl() override {
      ReportMadeNodes();
      ReleaseArena();
   }

   void StartNewDocument(bool restricted, Ref<Object>& result) override {
      ReportMadeNodes();
      _stack.clear();
      _openText = nullptr;
      _collecting = false;
      _bytes = 0;
      _nodes = 0;
      _restricted = restricted;
      _names.Clear();
      ReleaseArena();
      _arena = new NodeArena();
      _document = new (_arena) DocumentImpl();
      _stack.push_back({_document.Get(), kDocumentNode});
      // The reference tracker wants to see every first reference itself.
      _countInBulk = GetRefTracker() == nullptr;
      result = _document.Get();
   }

   void CleanUpDocument() override {
      // Before any node can go: the nodes' releases count down what this counted up.
      ReportMadeNodes();
      _stack.clear();
      _openText = nullptr;
      _collecting = false;
      // Also when a parse stopped while a large text was being collected.
      if (_text.capacity() > kKeptTextBytes) std::string().swap(_text);
      if (_attributes.capacity() > kKeptAttributes) {
         std::vector<ElementNodeImpl::ParsedAttribute>().swap(_attributes);
      }
      _names.Clear();
      _document.Reset();
      ReleaseArena();
   }

   void OnStartElement(const std::string& name, int line, int column,
                       const char** attributes) override {
      StartElement(name.c_str(), line, column, attributes);
   }
   void OnEndElement(const std::string&) override { EndElement(); }
   void OnCharacters(const char* data, int length) override { Characters(data, length); }
   void OnStartCData() override { StartCData(); }
   void OnEndCData() override { EndCData(); }
   void OnComment(const std::string& text) override { AddComment(text.data(), text.size()); }

   void StartElement(const char* name, int line, int column, const char** attributes) override {
      CloseText();
      size_t nameLength;
      const ElementName* elementName = _names.Find(name, _arena, nameLength);
      IncNodeCountAndValidate(nameLength);
      std::unique_ptr<ElementNodeImpl> element(
          new (_arena) ElementNodeImpl(elementName, line, column, _arena));
      // Each length is taken once, for the limit and for the copy.
      _attributes.clear();
      for (const char** attribute = attributes; *attribute; attribute += 2) {
         size_t nameLength = std::strlen(attribute[0]);
         size_t valueLength = std::strlen(attribute[1]);
         ValidateByteCount(nameLength + valueLength);
         _attributes.push_back({attribute[0], nameLength, attribute[1], valueLength});
      }
      element->DefineParsedAttributes(_attributes.data(), _attributes.size());
      Push(element.release());
   }

   void EndElement() override {
      CloseText();
      Pop();
   }

   // Expat splits character data at line ends and references: one text node takes all.
   // The node is made with the first piece, which for most texts is the only one, so its
   // text is copied once, straight from expat. Later pieces go into the node while they
   // fit its storage; past that they are collected here, so that the node's text is
   // allocated once more, at its full size. The limits count each piece as it comes, the
   // node with the first.
   void Characters(const char* data, int length) override {
      size_t size = static_cast<size_t>(length);
      if (!_openText) {
         IncNodeCountAndValidate(size);
         _openText = AddLeaf(new (_arena) TextNodeImpl(data, size));
         return;
      }
      ValidateByteCount(size);
      if (_collecting) {
         _text.append(data, size);
         return;
      }
      std::string& text = _openText->ParsedText();
      if (size <= text.capacity() - text.size()) {
         text.append(data, size);
         return;
      }
      _text.reserve(text.size() + size);
      _text.assign(text).append(data, size);
      _collecting = true;
   }

   void StartCData() override {
      CloseText();
      IncNodeCountAndValidate(0);
      Push(new (_arena) CDataNodeImpl());
   }

   void EndCData() override {
      CloseText();
      Pop();
   }

   void Comment(const char* text) override { AddComment(text, std::strlen(text)); }

   void OnProcessingInstruction(const std::string& target, const std::string& data) override {
      CloseText();
      IncNodeCountAndValidate(target.size() + data.size());
      AddLeaf(new (_arena) ProcessingInstructionNodeImpl(target, data));
   }

   void OnXMLDeclaration(const std::string& version, const std::string& encoding, int) override {
      _document->SetXMLVersion(version);
      _document->SetEncoding(encoding);
   }

private:
   // Appends `node` to the top node and makes it the top.
   template <class T>
   void Push(T* node) {
      Link(node);
      _stack.push_back({node, KindOf<T>()});
      VerifyDepth(_stack.size());
   }

   void Pop() {
      PELMORA_VERIFY(_stack.size() > 1);
      _stack.pop_back();
   }

   // Appends a node that takes no children (or none from the parser) to the top node. It
   // counts towards the depth as if it were opened and closed.
   template <class T>
   T* AddLeaf(T* node) {
      Link(node);
      VerifyDepth(_stack.size() + 1);
      return node;
   }

   // Links a node made for the top node as its last child. Until the tree holds it, the
   // node is owned here, so a refused insertion frees it. The kind of node is known here,
   // which spares the checks and calls that find it out.
   template <class T>
   void Link(T* node) {
      constexpr int kKind = KindOf<T>();
      const Open& parent = _stack.back();
      if (parent.kind == kElementNode && kKind != kProcessingInstructionNode) {
         parent.node->AppendParsedChildOfElement(node, !_countInBulk);
      } else {
         std::unique_ptr<T> owned(node);
         parent.node->AppendParsedChild(node, !_countInBulk);
         static_cast<void>(owned.release());  // the tree holds it now
      }
      if (_countInBulk) ++_made[kKind];
   }

   void VerifyDepth(size_t depth) {
      if (_restricted && depth > _maxDepth) {
         LogXml(kXmlLogWarning, "XML document too deep: %1 (max: %2)", depth, _maxDepth);
         throw ParsingAbortedException();
      }
   }

   // Comments and processing instructions hold text too, so their bytes count as well.
   void AddComment(const char* text, size_t length) {
      CloseText();
      IncNodeCountAndValidate(length);
      AddLeaf(new (_arena) CommentNodeImpl(text, length));
   }

   // Ends the text node that character data goes to, giving it what was collected.
   void CloseText() {
      if (!_openText) return;
      if (_collecting) FinishCollectedText();
      _openText = nullptr;
   }

   void FinishCollectedText() {
      _collecting = false;
      _openText->ParsedText() = std::string(_text.data(), _text.size());
      // A handler may live as long as the process (a pooled parser): it keeps the buffer
      // of the usual small texts, not of the largest it ever saw.
      if (_text.capacity() > kKeptTextBytes) std::string().swap(_text);
   }

   // Counts the nodes made since the last call on the scoreboard, one step per kind. The
   // scoreboard exists: it counted the document.
   void ReportMadeNodes() {
      Scoreboard* scoreboard = GetScoreboard();
      for (int type = 0; type <= kProcessingInstructionNode; ++type) {
         int made = std::exchange(_made[type], 0);
         if (made && scoreboard) scoreboard->Add(NodeImpl::ScoreboardName(type), made);
      }
   }

   void ValidateByteCount(uint64_t bytes) {
      _bytes += bytes;
      if (_restricted && _bytes > _maxChars) {
         LogXml(kXmlLogWarning, "XML document too long: %1 (max: %2)", _bytes, _maxChars);
         throw ParsingAbortedException();
      }
   }

   void IncNodeCountAndValidate(uint64_t bytes) {
      ValidateByteCount(bytes);
      ++_nodes;
      if (_restricted && _nodes > _maxNodes) {
         LogXml(kXmlLogWarning, "XML document has too many nodes: %1 (max: %2)", _nodes, _maxNodes);
         throw ParsingAbortedException();
      }
   }

   // The nodes that remain keep the arena alive; the handler only stops allocating from it.
   void ReleaseArena() {
      if (_arena) std::exchange(_arena, nullptr)->ReleaseCreator();
   }

   template <class T>
   static constexpr int KindOf() {
      if constexpr (std::is_same_v<T, ElementNodeImpl>) return kElementNode;
      if constexpr (std::is_same_v<T, TextNodeImpl>) return kTextNode;
      if constexpr (std::is_same_v<T, CDataNodeImpl>) return kCDataNode;
      if constexpr (std::is_same_v<T, CommentNodeImpl>) return kCommentNode;
      if constexpr (std::is_same_v<T, ProcessingInstructionNodeImpl>) {
         return kProcessingInstructionNode;
      }
   }

   struct Open {
      NodeImpl* node;
      int kind;
   };
   // Open nodes, the document at the bottom. A vector keeps its capacity between documents.
   std::vector<Open> _stack;
   uint64_t _maxChars;
   uint64_t _maxNodes;
   uint64_t _maxDepth;
   bool _restricted = false;
   uint64_t _bytes = 0;
   uint64_t _nodes = 0;
   Ref<DocumentImpl> _document;
   NodeArena* _arena = nullptr;
   NameTable _names;
   // The attributes of the start tag at hand; the vector keeps its capacity.
   std::vector<ElementNodeImpl::ParsedAttribute> _attributes;
   // The text node character data goes to, until another event ends it, and whether its
   // text is being collected in `_text`, which keeps up to kKeptTextBytes between texts.
   TextNodeImpl* _openText = nullptr;
   bool _collecting = false;
   std::string _text;
   // Nodes linked into the tree but not yet on the scoreboard, by kind.
   bool _countInBulk = false;
   int _made[kProcessingInstructionNode + 1] = {};
};

}  // namespace

void SetDefaultDocLimits(const DocLimits& limits) {
   VerifyLimits(limits);
   std::lock_guard<std::mutex> lock(g_defaultLimitsMutex);
   g_defaultLimits = limits;
}

DocLimits GetDefaultDocLimits() {
   std::lock_guard<std::mutex> lock(g_defaultLimitsMutex);
   return g_defaultLimits;
}

void CreateXMLDocumentHandler(Ref<XMLHandler>& out) {
   out = new XMLDocHandlerImpl(GetDefaultDocLimits());
}

void CreateXMLDocumentHandler(const DocLimits& limits, Ref<XMLHandler>& out) {
   out = new XMLDocHandlerImpl(limits);
}

}  // namespace Pelmora::Xml
