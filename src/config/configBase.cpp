// The configuration tree, its views and its typed values; loading and flushing through a
// backend. The syntaxes live in configXml.cpp and configFlat.cpp.

#include "src/config/configBase.h"

#include <algorithm>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <shared_mutex>
#include <strings.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"
#include "pelmora/system/systemFactory.h"

namespace Pelmora::Service {

using Node = ConfigBase::Node;

namespace {

// A node with this many children gets a lookup index.
constexpr size_t kIndexThreshold = 8;

// The standard guards over a pointer to the configuration's lock.
struct ReadGuard : std::shared_lock<ConfigLock> {
   explicit ReadGuard(ConfigLock* lock) : std::shared_lock<ConfigLock>(*lock) {}
};
struct WriteGuard : std::unique_lock<ConfigLock> {
   explicit WriteGuard(ConfigLock* lock) : std::unique_lock<ConfigLock>(*lock) {}
};

void ValidatePath(std::string_view path) {
   ForEachSegment(path, [](const PathSegment&) { return true; });
}

// Leading blanks and a sign as strtol takes them; nothing may follow the digits.
std::string_view SkipLeadingBlanks(std::string_view text) {
   size_t i = 0;
   while (i < text.size() && (text[i] == ' ' || text[i] == '\t')) ++i;
   return text.substr(i);
}

// Drops a leading "+" that a digit (or for doubles a dot) follows.
bool DropPlus(std::string_view& text) {
   if (!text.empty() && text[0] == '+') {
      if (text.size() < 2 || text[1] == '-' || text[1] == '+') return false;
      text.remove_prefix(1);
   }
   return true;
}

bool ParseSigned(std::string_view text, long long min, long long max, long long* out) {
   text = SkipLeadingBlanks(text);
   if (!DropPlus(text)) return false;
   long long v = 0;
   auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), v, 10);
   if (ec != std::errc() || end != text.data() + text.size() || v < min || v > max) return false;
   *out = v;
   return true;
}

bool ParseUnsigned(std::string_view text, unsigned long long max, unsigned long long* out) {
   text = SkipLeadingBlanks(text);
   if (!DropPlus(text) || (!text.empty() && text[0] == '-')) return false;
   unsigned long long v = 0;
   auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), v, 10);
   if (ec != std::errc() || end != text.data() + text.size() || v > max) return false;
   *out = v;
   return true;
}

[[noreturn]] void ThrowNotInteger() { throw NumberFormatException("Config Value not an integer"); }

Ref<Node> CloneTree(const Node* source) {
   std::string_view id = source->GetId();
   Ref<Node> copy = new Node(source->GetTag(), source->HasId() ? &id : nullptr);
   if (source->HasValue()) copy->SetValue(source->GetValue());
   for (const Ref<Node>& child : source->GetChildren()) copy->AppendChild(CloneTree(child.Get()).Get());
   return copy;
}

void Merge(Node* target, const Node* source) {
   if (source->HasValue()) {
      while (!target->GetChildren().empty()) target->RemoveChild(target->GetChildren().back().Get());
      target->SetValue(source->GetValue());
   }
   for (const Ref<Node>& child : source->GetChildren()) {
      std::string_view id = child->GetId();
      const std::string_view* idp = child->HasId() ? &id : nullptr;
      Node* existing = target->FindChild(child->GetTag(), idp);
      if (!existing) {
         // The defaults being merged win over a value in their way.
         if (target->HasValue()) target->ClearValue();
         Ref<Node> fresh = new Node(child->GetTag(), idp);
         target->AppendChild(fresh.Get());
         existing = fresh.Get();
      }
      Merge(existing, child.Get());
   }
}

// A view: a prefix, and the nodes of the two trees there when they exist. The cached
// nodes are written only under the configuration's write lock (or before the view is
// shared) and read under either lock; a cache whose node has left its tree is ignored.
class ViewBase : public Config::View, public ObjectImpl {
public:
   ViewBase(ConfigBase* config, std::string prefix, bool defaultsView)
       : _config(config), _prefix(std::move(prefix)), _defaultsView(defaultsView) {}

   // With the read lock held, before the view is handed out.
   void Resolve() {
      _main = FindNode(_config->GetRoot(_defaultsView), _prefix);
      if (!_defaultsView) _defaults = FindNode(_config->GetRoot(true), _prefix);
   }

   bool Get(const std::string& path, std::string* value) override {
      ReadGuard guard(_config->GetLock());
      const Node* node = Lookup(path);
      if (!node) return false;
      *value = node->GetValue();
      return true;
   }

   bool Get(const std::string& path, int* value) override {
      long long v;
      if (!GetSigned(path, INT32_MIN, INT32_MAX, &v)) return false;
      *value = static_cast<int>(v);
      return true;
   }

   bool Get(const std::string& path, long long* value) override {
      return GetSigned(path, INT64_MIN, INT64_MAX, value);
   }

   bool Get(const std::string& path, unsigned int* value) override {
      std::string text;
      if (!Get(path, &text)) return false;
      unsigned long long v;
      if (!ParseUnsigned(text, UINT32_MAX, &v)) ThrowNotInteger();
      *value = static_cast<unsigned int>(v);
      return true;
   }

   bool Get(const std::string& path, double* value) override {
      std::string text;
      if (!Get(path, &text)) return false;
      std::string_view s = SkipLeadingBlanks(text);
      double v = 0;
      bool ok = DropPlus(s);
      if (ok) {
         auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), v);
         ok = ec == std::errc() && end == s.data() + s.size();
      }
      if (!ok) throw NumberFormatException("Config value not a double");
      *value = v;
      return true;
   }

   bool Get(const std::string& path, bool* value) override {
      std::string text;
      if (!Get(path, &text)) return false;
      if (strcasecmp(text.c_str(), "true") == 0 && text.size() == 4) {
         *value = true;
      } else if (strcasecmp(text.c_str(), "false") == 0 && text.size() == 5) {
         *value = false;
      } else {
         throw NumberFormatException("Config Value not a boolean");
      }
      return true;
   }

   void Set(const std::string& path, const char* value) override {
      if (!value) throw InvalidArgumentException("value");
      SetText(path, std::string(value));
   }
   void Set(const std::string& path, int value) override { SetText(path, std::to_string(value)); }
   void Set(const std::string& path, unsigned int value) override {
      SetText(path, std::to_string(value));
   }
   void Set(const std::string& path, long long value) override {
      SetText(path, std::to_string(value));
   }
   void Set(const std::string& path, double value) override {
      char buffer[64];
      auto [end, ec] = std::to_chars(buffer, buffer + sizeof(buffer), value);
      SetText(path, std::string(buffer, ec == std::errc() ? end : buffer));
   }
   void Set(const std::string& path, bool value) override {
      SetText(path, value ? "true" : "false");
   }

   void Unset(const std::string& path) override {
      WriteGuard guard(_config->GetLock());
      Node* base = MainBase();
      if (!base) {
         ValidatePath(path);
         return;
      }
      Node* node = FindNode(base, path);
      if (!node) return;
      Node* parent = node->GetParent();
      if (!parent) {
         // The root stays; what it holds goes.
         if (node->HasValue()) node->ClearValue();
         while (!node->GetChildren().empty()) node->RemoveChild(node->GetChildren().back().Get());
      } else {
         parent->RemoveChild(node);
         // An emptied ancestor would read back as an empty value.
         while (parent->GetParent() && parent->GetChildren().empty() && !parent->HasValue()) {
            Node* up = parent->GetParent();
            up->RemoveChild(parent);
            parent = up;
         }
      }
      Changed();
   }

   bool IsSet(const std::string& path) override {
      ReadGuard guard(_config->GetLock());
      Node* base = MainBase();
      if (!base) {
         ValidatePath(path);
         return false;
      }
      return FindNode(base, path) != nullptr;
   }

   void GetView(const std::string& path, Ref<View>& out) override {
      ValidatePath(path);
      Ref<ViewBase> view = new ViewBase(_config.Get(), _prefix + "/" + path, _defaultsView);
      ReadGuard guard(_config->GetLock());
      view->Resolve();
      out = view;
   }

   void GenerateId(const std::string& path, std::string* id) override {
      std::vector<PathSegment> segments;
      ForEachSegment(path, [&](const PathSegment& s) {
         segments.push_back(s);
         return true;
      });
      if (segments.empty()) throw InvalidArgumentException("GenerateId needs a path");
      const PathSegment& last = segments.back();

      ReadGuard guard(_config->GetLock());
      Node* parent = MainBase();
      for (size_t i = 0; parent && i + 1 < segments.size(); ++i) {
         parent = parent->FindChild(segments[i].tag, segments[i].hasId ? &segments[i].id : nullptr);
      }
      const Node* lastChild = nullptr;
      if (parent) {
         const auto& children = parent->GetChildren();
         for (auto it = children.rbegin(); it != children.rend(); ++it) {
            if ((*it)->GetTag() == last.tag) {
               lastChild = it->Get();
               break;
            }
         }
      }
      if (!lastChild) {
         *id = "0000";
         return;
      }
      if (!lastChild->HasId()) {
         throw InvalidArgumentException("GenerateId: " + lastChild->GetTag() + " has no id");
      }
      const std::string& current = lastChild->GetId();
      size_t n = current.size();
      bool digits = n >= 4 && std::all_of(current.end() - 4, current.end(),
                                          [](char c) { return c >= '0' && c <= '9'; });
      int number = digits ? std::stoi(current.substr(n - 4)) : 0;
      if (!digits || number == 9999) {
         // Past 9999 the id grows by four digits rather than wrapping onto used ids.
         *id = current + "0000";
         return;
      }
      char next[16];
      std::snprintf(next, sizeof(next), "%04d", number + 1);
      *id = current.substr(0, n - 4) + next;
   }

   void GetChildNames(const std::string& path, std::vector<std::string>& names) override {
      names.clear();
      ReadGuard guard(_config->GetLock());
      Node* mainBase = MainBase();
      Node* defaultsBase = DefaultsBase();
      if (!mainBase && !defaultsBase) ValidatePath(path);
      const Node* main = mainBase ? FindNode(mainBase, path) : nullptr;
      const Node* defaults = defaultsBase ? FindNode(defaultsBase, path) : nullptr;
      if (main) {
         for (const Ref<Node>& child : main->GetChildren()) names.push_back(child->GetName());
      }
      if (defaults) {
         for (const Ref<Node>& child : defaults->GetChildren()) {
            const std::string* id = child->HasId() ? &child->GetId() : nullptr;
            std::string_view idView = id ? std::string_view(*id) : std::string_view();
            if (!main || !main->FindChild(child->GetTag(), id ? &idView : nullptr)) {
               names.push_back(child->GetName());
            }
         }
      }
   }

   // A copy of what this view sees of its main tree, or null.
   Ref<Node> Snapshot() {
      ReadGuard guard(_config->GetLock());
      Node* base = MainBase();
      return base ? CloneTree(base) : Ref<Node>();
   }

   ConfigBase* GetConfig() const { return _config.Get(); }

private:
   Node* MainBase() {
      if (_main && _main->IsValid()) return _main.Get();
      return FindNode(_config->GetRoot(_defaultsView), _prefix);
   }
   Node* DefaultsBase() {
      if (_defaultsView) return nullptr;
      if (_defaults && _defaults->IsValid()) return _defaults.Get();
      return FindNode(_config->GetRoot(true), _prefix);
   }

   // With either lock held: the node with a value at `path`, main tree first.
   const Node* Lookup(std::string_view path) {
      Node* mainBase = MainBase();
      if (mainBase) {
         const Node* node = FindNode(mainBase, path);
         if (node && node->HasValue()) return node;
      }
      Node* defaultsBase = DefaultsBase();
      if (defaultsBase) {
         const Node* node = FindNode(defaultsBase, path);
         if (node && node->HasValue()) return node;
      }
      if (!mainBase && !defaultsBase) ValidatePath(path);
      return nullptr;
   }

   bool GetSigned(const std::string& path, long long min, long long max, long long* value) {
      std::string text;
      if (!Get(path, &text)) return false;
      if (!ParseSigned(text, min, max, value)) ThrowNotInteger();
      return true;
   }

   void SetText(const std::string& path, std::string value) {
      ValidatePath(path);
      WriteGuard guard(_config->GetLock());
      if (!_main || !_main->IsValid()) _main = MakeNode(_config->GetRoot(_defaultsView), _prefix);
      Node* target = MakeNode(_main.Get(), path);
      if (!target->GetParent()) {
         throw InvalidArgumentException("the root of a configuration holds no value");
      }
      if (!target->GetChildren().empty()) {
         throw InvalidArgumentException("Node has both value and children: " + target->GetName());
      }
      target->SetValue(std::move(value));
      Changed();
   }

   void Changed() {
      if (!_defaultsView) _config->MarkDirty();
   }

   Ref<ConfigBase> _config;
   std::string _prefix;
   bool _defaultsView;
   Ref<Node> _main;
   Ref<Node> _defaults;
};

// Memory only.
class ScratchConfigImpl : public ConfigBase {
public:
   ScratchConfigImpl() : ConfigBase(nullptr) {}
   void Parse(const std::string&, Ref<Node>&) override { throw NotSupportedException(); }
   void Write(const Node*, Writer*) override { throw NotSupportedException(); }
};

}  // namespace

// ---- paths

void ThrowBadSegment(std::string_view path) {
   throw InvalidArgumentException("Malformed configuration path: " + std::string(path));
}

bool ParseSegment(std::string_view text, PathSegment& out) {
   size_t open = text.find('[');
   if (open == std::string_view::npos) {
      out.tag = text;
      out.id = std::string_view();
      out.hasId = false;
      return true;
   }
   if (text.back() != ']' || open + 1 == text.size()) return false;
   out.tag = text.substr(0, open);
   out.id = text.substr(open + 1, text.size() - open - 2);
   out.hasId = true;
   return true;
}

bool IsTrimmed(char c) {
   return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

std::string_view Trim(std::string_view text) {
   size_t begin = 0;
   size_t end = text.size();
   while (begin < end && IsTrimmed(text[begin])) ++begin;
   while (end > begin && IsTrimmed(text[end - 1])) --end;
   return text.substr(begin, end - begin);
}

Node* FindNode(Node* from, std::string_view path) {
   Node* node = from;
   ForEachSegment(path, [&](const PathSegment& s) {
      node = node->FindChild(s.tag, s.hasId ? &s.id : nullptr);
      return node != nullptr;
   });
   return node;
}

Node* MakeChild(Node* parent, const PathSegment& segment) {
   const std::string_view* id = segment.hasId ? &segment.id : nullptr;
   Node* child = parent->FindChild(segment.tag, id);
   if (child) return child;
   if (parent->HasValue()) {
      if (!parent->GetValue().empty()) {
         throw InvalidArgumentException("Node has both value and children: " + parent->GetName());
      }
      parent->ClearValue();
   }
   Ref<Node> fresh = new Node(segment.tag, id);
   parent->AppendChild(fresh.Get());
   return fresh.Get();
}

Node* MakeNode(Node* from, std::string_view path) {
   if (!from) return nullptr;
   Node* node = from;
   ForEachSegment(path, [&](const PathSegment& s) {
      node = MakeChild(node, s);
      return true;
   });
   return node;
}

// ---- Node

Node::Node(std::string_view tag, const std::string_view* id)
    : _tag(tag), _id(id ? std::string(*id) : std::string()), _hasId(id != nullptr) {}

void Node::SetValue(std::string value) {
   _value = std::move(value);
   _hasValue = true;
}

void Node::ClearValue() {
   _value.clear();
   _hasValue = false;
}

bool Node::operator==(const Node& other) const {
   return _tag == other._tag && _hasId == other._hasId && (!_hasId || _id == other._id);
}

bool Node::Matches(std::string_view tag, const std::string_view* id) const {
   return _tag == tag && _hasId == (id != nullptr) && (!_hasId || _id == *id);
}

std::string Node::GetName() const {
   return _hasId ? _tag + "[" + _id + "]" : _tag;
}

void Node::AppendKey(std::string& key, std::string_view tag, const std::string_view* id) {
   // The tag's length first, so that no tag and id pair can spell another's key.
   uint32_t length = static_cast<uint32_t>(tag.size());
   key.append(reinterpret_cast<const char*>(&length), sizeof(length));
   key.append(tag);
   if (id) {
      key.push_back('\1');
      key.append(*id);
   }
}

Node* Node::FindChild(std::string_view tag, const std::string_view* id) const {
   if (_index.empty()) {
      for (const Ref<Node>& child : _children) {
         if (child->Matches(tag, id)) return child.Get();
      }
      return nullptr;
   }
   // Short keys are built on the stack: lookups are the hot path of every read.
   uint32_t length = static_cast<uint32_t>(tag.size());
   size_t size = sizeof(length) + tag.size() + (id ? 1 + id->size() : 0);
   char buffer[256];
   std::string heap;
   std::string_view key;
   if (size <= sizeof(buffer)) {
      char* p = buffer;
      std::memcpy(p, &length, sizeof(length));
      p += sizeof(length);
      std::memcpy(p, tag.data(), tag.size());
      p += tag.size();
      if (id) {
         *p++ = '\1';
         std::memcpy(p, id->data(), id->size());
      }
      key = std::string_view(buffer, size);
   } else {
      AppendKey(heap, tag, id);
      key = heap;
   }
   auto it = _index.find(key);
   return it == _index.end() ? nullptr : it->second;
}

void Node::IndexChild(Node* child) {
   std::string key;
   std::string_view id = child->_id;
   AppendKey(key, child->_tag, child->_hasId ? &id : nullptr);
   _index.emplace(std::move(key), child);
}

void Node::AppendChild(Node* child) {
   _children.emplace_back(child);
   child->_parent = this;
   if (!_index.empty()) {
      IndexChild(child);
   } else if (_children.size() >= kIndexThreshold) {
      for (const Ref<Node>& c : _children) IndexChild(c.Get());
   }
}

void Node::RemoveChild(Node* child) {
   auto it = std::find_if(_children.begin(), _children.end(),
                          [child](const Ref<Node>& c) { return c.Get() == child; });
   if (it == _children.end()) return;
   if (!_index.empty()) {
      std::string key;
      std::string_view id = child->_id;
      AppendKey(key, child->_tag, child->_hasId ? &id : nullptr);
      _index.erase(key);
   }
   Ref<Node> keep = *it;
   _children.erase(it);
   child->_parent = nullptr;
   child->Invalidate();
}

void Node::Invalidate() {
   _valid = false;
   for (const Ref<Node>& child : _children) child->Invalidate();
}

// ---- ConfigBase

ConfigBase::ConfigBase(ConfigBackend* backend)
    : _backend(backend), _main(new Node(kRootTag, nullptr)), _defaults(new Node(kRootTag, nullptr)) {
   System::GetSystemFactory()->CreateMutex(_ioMutex);
}

void ConfigBase::NewView(const std::string& path, bool defaults, Ref<View>& out) {
   ValidatePath(path);
   Ref<ViewBase> view = new ViewBase(this, path, defaults);
   ReadGuard guard(&_lock);
   view->Resolve();
   out = view;
}

void ConfigBase::GetMainView(Ref<View>& out) { NewView(std::string(), false, out); }
void ConfigBase::GetDefaultsMainView(Ref<View>& out) { NewView(std::string(), true, out); }
void ConfigBase::GetView(const std::string& path, Ref<View>& out) { NewView(path, false, out); }
void ConfigBase::GetDefaultsView(const std::string& path, Ref<View>& out) {
   NewView(path, true, out);
}

void ConfigBase::Load() {
   if (!_backend) throw NotSupportedException();
   System::Synchronized io(_ioMutex.Get());
   LoadLocked();
}

void ConfigBase::LoadLocked() {
   std::string text;
   Ref<Reader> reader;
   _backend->Open(reader);
   try {
      char buffer[16384];
      int n;
      while ((n = reader->Read(buffer, sizeof(buffer))) >= 0) text.append(buffer, n);
   } catch (...) {
      _backend->Close();
      throw;
   }
   _backend->Close();

   Ref<Node> root;
   Parse(text, root);
   WriteGuard guard(&_lock);
   Ref<Node> old = std::move(_main);
   _main = root;
   old->Invalidate();
   _dirty = false;
   ++_changes;
}

void ConfigBase::Flush() {
   if (!_backend) throw NotSupportedException();
   System::Synchronized io(_ioMutex.Get());
   // The text is made under the read lock; the slow part, the disk, runs without it.
   Ref<StringWriter> text;
   CreateStringWriter(text);
   unsigned long long snapshot;
   {
      ReadGuard guard(&_lock);
      Write(_main.Get(), text.Get());
      snapshot = _changes;
   }
   Ref<Writer> writer;
   _backend->Open(writer);
   try {
      writer->Write(text->GetString().data(), text->GetLength());
      writer->Flush();
      _backend->Commit();
   } catch (...) {
      _backend->Close();
      throw;
   }
   _backend->Close();
   WriteGuard guard(&_lock);
   if (_changes == snapshot) _dirty = false;
}

bool ConfigBase::Refresh() {
   if (!_backend) return false;
   System::Synchronized io(_ioMutex.Get());
   if (!_backend->HasChanged()) return false;
   LoadLocked();
   return true;
}

bool ConfigBase::IsDirty() {
   ReadGuard guard(&_lock);
   return _dirty;
}

void ConfigBase::MergeIntoDefaults(const Node* source) {
   WriteGuard guard(&_lock);
   Merge(_defaults.Get(), source);
}

// ---- factories

void CreateScratchConfig(Ref<Config>& out) { out = new ScratchConfigImpl(); }

void SetConfigDefaults(Config* config, Config::View* defaults) {
   auto* target = dynamic_cast<ConfigBase*>(config);
   auto* view = dynamic_cast<ViewBase*>(defaults);
   if (!target || !view) throw InvalidArgumentException("SetConfigDefaults");
   // Copy first, merge second: never two configurations' locks at once.
   Ref<Node> snapshot = view->Snapshot();
   if (snapshot) target->MergeIntoDefaults(snapshot.Get());
}

}  // namespace Pelmora::Service
