#pragma once
// The configuration tree and the machinery every syntax shares: nodes, path walking,
// typed views, loading and flushing through a backend. A syntax supplies Parse and Write.
// Locking: the tree is guarded by one reader-writer lock per configuration (a plain
// shared mutex: reads are the hot path, never nest, and need no per-thread bookkeeping);
// Load, Flush and Refresh are serialised by a second mutex so that the tree stays readable
// while a file is read or written.

#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "pelmora/io/readerWriter.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/config.h"
#include "pelmora/system/lockable.h"
#include "src/config/configBackend.h"
#include "src/config/configLock.h"

namespace Pelmora::Service {

// One segment of a path: a tag and an optional id, viewing the path's text.
struct PathSegment {
   std::string_view tag;
   std::string_view id;
   bool hasId = false;
};

// Splits the segment text `text` (non-empty) into tag and id; false when a "[" has no
// closing "]" at the end.
bool ParseSegment(std::string_view text, PathSegment& out);

[[noreturn]] void ThrowBadSegment(std::string_view path);

// Calls `visit` with each segment of a slash-separated path, skipping empty ones; throws
// InvalidArgumentException for a malformed segment before visiting any. `visit` returns
// false to stop the walk.
template <class Visit>
void ForEachSegment(std::string_view path, Visit&& visit);

// Blanks, tabs, carriage returns and line feeds: what the syntaxes trim.
bool IsTrimmed(char c);
std::string_view Trim(std::string_view text);

class ConfigBase : public virtual Config, public ObjectImpl {
public:
   class Node : public ObjectImpl {
   public:
      Node(std::string_view tag, const std::string_view* id);

      const std::string& GetTag() const { return _tag; }
      bool HasId() const { return _hasId; }
      const std::string& GetId() const { return _id; }
      bool HasValue() const { return _hasValue; }
      const std::string& GetValue() const { return _value; }
      void SetValue(std::string value);
      void ClearValue();
      const std::vector<Ref<Node>>& GetChildren() const { return _children; }
      Node* GetParent() const { return _parent; }
      // False once the node has left its tree (unset, or its tree replaced by a load).
      bool IsValid() const { return _valid; }
      // Equal tags, and ids both absent or both present and equal.
      bool operator==(const Node& other) const;
      bool Matches(std::string_view tag, const std::string_view* id) const;
      // "tag" or "tag[id]".
      std::string GetName() const;

      Node* FindChild(std::string_view tag, const std::string_view* id) const;
      // The child must not be in a tree and must not equal an existing child.
      void AppendChild(Node* child);
      // Unlinks `child` and marks its subtree invalid.
      void RemoveChild(Node* child);
      // Marks this subtree invalid (its tree was replaced).
      void Invalidate();

   private:
      static void AppendKey(std::string& key, std::string_view tag, const std::string_view* id);
      void IndexChild(Node* child);

      std::string _tag;
      std::string _id;
      std::string _value;
      bool _hasId;
      bool _hasValue = false;
      bool _valid = true;
      std::vector<Ref<Node>> _children;
      Node* _parent = nullptr;
      // Built once a node has many children, so that lookups stay constant-time.
      struct KeyHash {
         using is_transparent = void;
         size_t operator()(std::string_view key) const { return std::hash<std::string_view>()(key); }
      };
      std::unordered_map<std::string, Node*, KeyHash, std::equal_to<>> _index;
   };

   static constexpr const char* kRootTag = "config";

   explicit ConfigBase(ConfigBackend* backend);

   void GetMainView(Ref<View>& out) override;
   void GetDefaultsMainView(Ref<View>& out) override;
   void GetView(const std::string& path, Ref<View>& out) override;
   void GetDefaultsView(const std::string& path, Ref<View>& out) override;
   void Load() override;
   void Flush() override;
   bool Refresh() override;
   bool IsDirty() override;

   // Turns text into a tree whose root the result is; FileFormatException when malformed.
   virtual void Parse(const std::string& text, Ref<Node>& root) = 0;
   // Writes a tree; InvalidArgumentException when the syntax cannot hold it.
   virtual void Write(const Node* root, Writer* writer) = 0;

   // Merges a copy of `source` into the defaults tree's root; values of `source` win.
   void MergeIntoDefaults(const Node* source);

   ConfigLock* GetLock() { return &_lock; }
   Node* GetRoot(bool defaults) const { return defaults ? _defaults.Get() : _main.Get(); }
   // Called with the write lock held when a view changed the main tree.
   void MarkDirty() { _dirty = true; ++_changes; }

protected:
   // Reads the backend into a tree; the caller holds _ioMutex.
   void LoadLocked();

private:
   void NewView(const std::string& path, bool defaults, Ref<View>& out);

   Ref<ConfigBackend> _backend;
   ConfigLock _lock;
   Ref<System::Mutex> _ioMutex;
   Ref<Node> _main;
   Ref<Node> _defaults;
   bool _dirty = false;
   unsigned long long _changes = 0;
};

// Walks `path` from `from`, matching tag and id at each level; null when absent.
ConfigBase::Node* FindNode(ConfigBase::Node* from, std::string_view path);
// As FindNode, creating what is missing; InvalidArgumentException where a node with a
// non-empty value is in the way (an empty value gives way to children).
ConfigBase::Node* MakeNode(ConfigBase::Node* from, std::string_view path);
// Creates or finds the child for one segment under `parent`, with the rule above.
ConfigBase::Node* MakeChild(ConfigBase::Node* parent, const PathSegment& segment);

// The variants: each a syntax over a backend, or memory only.
void CreateXmlConfig(ConfigBackend* backend, Ref<ConfigBase>& out);
void CreateFlatConfig(ConfigBackend* backend, const std::string& separator, Ref<ConfigBase>& out);
void CreatePropertiesConfig(ConfigBackend* backend, Ref<ConfigBase>& out);

// ---- template definitions

template <class Visit>
void ForEachSegment(std::string_view path, Visit&& visit) {
   // Brackets are rare: only paths holding one need a checking pass before the walk.
   bool check = path.find('[') != std::string_view::npos;
   for (int pass = check ? 0 : 1; pass < 2; ++pass) {
      size_t start = 0;
      while (start < path.size()) {
         size_t end = path.find('/', start);
         if (end == std::string_view::npos) end = path.size();
         if (end > start) {
            PathSegment segment;
            bool ok = ParseSegment(path.substr(start, end - start), segment);
            if (pass == 0) {
               if (!ok) ThrowBadSegment(path);
            } else if (!visit(segment)) {
               return;
            }
         }
         start = end + 1;
      }
   }
}

}  // namespace Pelmora::Service
