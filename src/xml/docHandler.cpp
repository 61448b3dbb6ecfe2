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
#include "src/xml/nodeArena.h"
#include "src/xml/nodeImpl.h"
#include "src/xml/xmlLog.h"

namespace Pelmora::Xml {
namespace {

// The character data buffer a handler keeps between texts: larger ones are given back.
constexpr size_t kKeptTextBytes = 64 * 1024;

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
   const ElementName* Find(std::string_view qualifiedName, NodeArena* arena) {
      if (_slots.empty()) _slots.resize(kFirstSize);
      uint64_t hash = Hash(qualifiedName);
      size_t mask = _slots.size() - 1;
      for (size_t i = hash & mask;; i = (i + 1) & mask) {
         Slot& slot = _slots[i];
         if (!slot.name) {
            slot.name = arena->NewName(qualifiedName, slot.key);
            slot.hash = hash;
            const ElementName* made = slot.name;
            if (++_count * 2 > _slots.size()) Grow();
            return made;
         }
         if (slot.hash == hash && slot.key == qualifiedName) return slot.name;
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

   static uint64_t Hash(std::string_view text) {
      uint64_t hash = 14695981039346656037ull;  // FNV-1a
      for (char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 1099511628211ull;
      return hash;
   }

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

class XMLDocHandlerImpl final : public virtual XMLHandler, public ObjectImpl {
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
      _textOpen = false;
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
      _textOpen = false;
      _names.Clear();
      _document.Reset();
      ReleaseArena();
   }

   void OnStartElement(const std::string& name, int line, int column,
                       const char** attributes) override {
      CloseText();
      IncNodeCountAndValidate(name.size());
      std::unique_ptr<ElementNodeImpl> element(
          new (_arena) ElementNodeImpl(_names.Find(name, _arena), line, column, _arena));
      // Each length is taken once, for the limit and for the copy.
      _attributes.clear();
      for (const char** attribute = attributes; *attribute; attribute += 2) {
         size_t nameLength = std::strlen(attribute[0]);
         size_t valueLength = std::strlen(attribute[1]);
         ValidateByteCount(nameLength + valueLength);
         _attributes.push_back({attribute[0], nameLength, attribute[1], valueLength});
      }
      element->DefineParsedAttributes(_attributes.data(), _attributes.size());
      Push(std::move(element));
   }

   void OnEndElement(const std::string&) override {
      CloseText();
      Pop();
   }

   // Expat splits character data at line ends and references: one text node takes all,
   // collected here first so that the node's text is allocated once, at its full size.
   // The limits count each piece as it comes, the node with the first.
   void OnCharacters(const char* data, int length) override {
      if (_textOpen) {
         ValidateByteCount(static_cast<uint64_t>(length));
         _text.append(data, static_cast<size_t>(length));
         return;
      }
      IncNodeCountAndValidate(static_cast<uint64_t>(length));
      _text.assign(data, static_cast<size_t>(length));
      _textOpen = true;
   }

   void OnStartCData() override {
      CloseText();
      IncNodeCountAndValidate(0);
      Push(std::unique_ptr<CDataNodeImpl>(new (_arena) CDataNodeImpl()));
   }

   void OnEndCData() override {
      CloseText();
      Pop();
   }

   // Comments and processing instructions hold text too, so their bytes count as well.
   void OnComment(const std::string& text) override {
      CloseText();
      IncNodeCountAndValidate(text.size());
      AppendLeaf(std::unique_ptr<CommentNodeImpl>(new (_arena) CommentNodeImpl(text)));
   }

   void OnProcessingInstruction(const std::string& target, const std::string& data) override {
      CloseText();
      IncNodeCountAndValidate(target.size() + data.size());
      AppendLeaf(std::unique_ptr<ProcessingInstructionNodeImpl>(
          new (_arena) ProcessingInstructionNodeImpl(target, data)));
   }

   void OnXMLDeclaration(const std::string& version, const std::string& encoding, int) override {
      _document->SetXMLVersion(version);
      _document->SetEncoding(encoding);
   }

private:
   // Appends `node` to the top node and makes it the top. Until the tree holds it, the
   // node is owned here, so a refused insertion frees it.
   // The kind of node is known here, which spares the checks and calls that find it out.
   template <class T>
   void Push(std::unique_ptr<T> node) {
      constexpr int kKind = KindOf<T>();
      NodeImpl* added = node.get();
      const Open& parent = _stack.back();
      if (parent.kind == kElementNode && kKind != kProcessingInstructionNode) {
         parent.node->AppendParsedChildOfElement(added, !_countInBulk);
      } else {
         parent.node->AppendParsedChild(added, !_countInBulk);
      }
      static_cast<void>(node.release());  // the tree holds it now
      if (_countInBulk) ++_made[kKind];
      _stack.push_back({added, kKind});
      if (_restricted && _stack.size() > _maxDepth) {
         LogXml(kXmlLogWarning, "XML document too deep: %1 (max: %2)", _stack.size(), _maxDepth);
         throw ParsingAbortedException();
      }
   }

   void Pop() {
      PELMORA_VERIFY(_stack.size() > 1);
      _stack.pop_back();
   }

   template <class T>
   void AppendLeaf(std::unique_ptr<T> node) {
      Push(std::move(node));
      Pop();
   }

   // Makes the text node of the character data collected so far.
   void CloseText() {
      if (!_textOpen) return;
      _textOpen = false;
      AppendLeaf(std::unique_ptr<TextNodeImpl>(new (_arena) TextNodeImpl(_text.data(), _text.size())));
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
   // Character data not yet made into a node; the buffer keeps up to kKeptTextBytes.
   std::string _text;
   bool _textOpen = false;
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
