// The counter registry: registration with its name checks, the counter tree, removal and
// the process-wide instance.

#include "src/perfcounter/registryImpl.h"

#include <algorithm>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "src/perfcounter/perfLog.h"
#include "src/perfcounter/queryImpl.h"

namespace Pelmora::PerfCounter {

namespace {

class RegistryItemImpl : public virtual RegistryItem, public ObjectImpl {
public:
   explicit RegistryItemImpl(GroupImpl* group) : _group(group) {}

   void Unregister() override {
      // Held, not just read: a private registry may lose its last reference meanwhile.
      Ref<RegistryImpl> registry = _group->HoldRegistry();
      if (registry) registry->UnregisterGroup(_group.Get());
   }
   bool IsRegistered() const override { return _group->GetRegistry() != nullptr; }

private:
   const Ref<GroupImpl> _group;
};

// Splits "/a/b/c" into its components; the name is known to be valid.
std::vector<std::string_view> SplitPath(std::string_view path) {
   std::vector<std::string_view> parts;
   size_t start = 1;
   while (start <= path.size()) {
      size_t slash = path.find('/', start);
      if (slash == std::string_view::npos) slash = path.size();
      if (slash > start) parts.push_back(path.substr(start, slash - start));
      start = slash + 1;
   }
   return parts;
}

std::string PathOf(const CounterNode* node) {
   std::vector<const std::string*> parts;
   for (; node && node->parent; node = node->parent) parts.push_back(&node->component);
   std::string path;
   for (auto it = parts.rbegin(); it != parts.rend(); ++it) path += "/" + **it;
   return path;
}

void VisitCounters(CounterNode* node, const std::function<void(CounterNode*)>& visit) {
   if (node->group) visit(node);
   for (auto& [name, child] : node->children) VisitCounters(child.get(), visit);
}

}  // namespace

GroupImpl::GroupImpl(RegistryImpl* registry, uint64_t sequence, RefVector<Metadata> metadata,
                     GroupPublisher* publisher)
   : _registry(registry), _registryLink(registry), _sequence(sequence),
     _metadata(std::move(metadata)), _publisher(publisher) {}

Ref<RegistryImpl> GroupImpl::HoldRegistry() const {
   if (!GetRegistry()) return Ref<RegistryImpl>();
   return _registryLink.Promote();
}

void GroupImpl::CollectValues(std::vector<Value>& values) {
   values.clear();
   _publisher->CollectValues(_metadata, values);
   PELMORA_VERIFY(values.size() == _metadata.size());
}

RegistryImpl::RegistryImpl() : _root(std::make_unique<CounterNode>()) {}

RegistryImpl::~RegistryImpl() {
   // Detached under the list's mutex: a query being dropped right now either left the list
   // already or waits for it, and is still alive while it hears of the loss.
   int left;
   {
      System::NativeSynchronized lock(_queryList->mutex);
      left = static_cast<int>(_queryList->queries.size());
      for (QueryImpl* query : _queryList->queries) query->OnRegistryGone();
      _queryList->queries.clear();
   }
   if (left > 0) {
      Internal::LogText(Internal::kLogWarning,
                        MessageFormatter::ASPrint("Destruction: Queries are still registered -- %1 queries.",
                                                  left));
   }
   if (_counterCount > 0) {
      Internal::LogText(Internal::kLogWarning,
                        MessageFormatter::ASPrint("Destruction: Counters are still registered -- %1 counters.",
                                                  _counterCount));
   }
   for (auto& [sequence, entry] : _groups) entry.first->Detach();
}

bool RegistryImpl::IsValidCounterName(const std::string& name) {
   return !name.empty() && name.front() == '/' && name.back() != '/' &&
          name.find("//") == std::string::npos;
}

void RegistryImpl::Register(Metadata* metadata, Publisher* publisher, Ref<RegistryItem>& out) {
   if (!metadata || !publisher) throw InvalidArgumentException();
   RefVector<Metadata> group{Ref<Metadata>(metadata)};
   Ref<GroupPublisher> adapter = new SingleGroupPublisher(publisher);
   RegisterGroup(group, adapter.Get(), out);
}

void RegistryImpl::RegisterGroup(RefVector<Metadata>& metadata, GroupPublisher* publisher,
                                 Ref<RegistryItem>& out) {
   if (!publisher || metadata.empty()) throw InvalidArgumentException();
   for (const Ref<Metadata>& m : metadata) {
      if (!m) throw InvalidArgumentException();
   }
   RegistryWriteGuard guard(this);
   ValidateNewCounters(metadata);
   Ref<GroupImpl> group = new GroupImpl(this, _nextSequence++, metadata, publisher);
   std::vector<CounterNode*> nodes;
   AddToTree(group.Get(), nodes);
   _groups.emplace(group->GetSequence(), std::make_pair(group, std::move(nodes)));
   _counterCount += static_cast<int>(metadata.size());
   {
      System::NativeSynchronized lock(_queryList->mutex);
      for (QueryImpl* query : _queryList->queries) query->OnGroupAdded(group.Get());
   }
   out = new RegistryItemImpl(group.Get());
}

void RegistryImpl::ValidateNewCounters(const RefVector<Metadata>& metadata) {
   PELMORA_VERIFY(this->IsWriteLocked());
   for (const Ref<Metadata>& m : metadata) {
      if (!IsValidCounterName(m->GetName())) throw InvalidArgumentException(m->GetName());
   }
   // Every offending name is logged before the batch is refused.
   std::unordered_set<std::string_view> seen;
   const std::string* refused = nullptr;
   for (const Ref<Metadata>& m : metadata) {
      const std::string& name = m->GetName();
      if (!seen.insert(name).second) {
         Internal::LogText(Internal::kLogWarning,
                           MessageFormatter::ASPrint("ValidateNewCounters: Counter %1 added twice.", name));
      } else if (CounterNode* node = FindNode(name); node && node->group) {
         Internal::LogText(Internal::kLogWarning,
                           MessageFormatter::ASPrint("ValidateNewCounters: Counter %1 exists.", name));
      } else {
         continue;
      }
      if (!refused) refused = &name;
   }
   if (refused) throw AlreadyExistsException(*refused);
}

void RegistryImpl::AddToTree(GroupImpl* group, std::vector<CounterNode*>& nodes) {
   PELMORA_VERIFY(this->IsWriteLocked());
   RefVector<Metadata>& metadata = group->GetMetadata();
   for (size_t i = 0; i < metadata.size(); ++i) {
      CounterNode* node = _root.get();
      for (std::string_view part : SplitPath(metadata[i]->GetName())) {
         auto it = node->children.find(part);
         if (it == node->children.end()) {
            auto child = std::make_unique<CounterNode>();
            child->component = std::string(part);
            child->parent = node;
            it = node->children.emplace(child->component, std::move(child)).first;
         }
         node = it->second.get();
      }
      node->group = group;
      node->index = static_cast<int>(i);
      nodes.push_back(node);
   }
}

void RegistryImpl::Prune(CounterNode* node) {
   while (node->parent && !node->group && node->children.empty()) {
      CounterNode* parent = node->parent;
      parent->children.erase(node->component);  // destroys node
      node = parent;
   }
}

void RegistryImpl::UnregisterGroup(GroupImpl* group) {
   RegistryWriteGuard guard(this);
   if (group->GetRegistry() != this) return;  // already gone
   auto it = _groups.find(group->GetSequence());
   PELMORA_VERIFY(it != _groups.end());
   Ref<GroupImpl> keep = it->second.first;
   {
      System::NativeSynchronized lock(_queryList->mutex);
      for (QueryImpl* query : _queryList->queries) query->OnGroupRemoved(group);
   }
   for (CounterNode* node : it->second.second) {
      node->group = nullptr;
      node->index = -1;
      Prune(node);
   }
   _counterCount -= static_cast<int>(group->GetMetadata().size());
   _groups.erase(it);
   group->Detach();
}

CounterNode* RegistryImpl::FindNode(std::string_view path) const {
   CounterNode* node = _root.get();
   if (path.empty() || path.front() != '/') return nullptr;
   for (std::string_view part : SplitPath(path)) {
      auto it = node->children.find(part);
      if (it == node->children.end()) return nullptr;
      node = it->second.get();
   }
   return node;
}

void RegistryImpl::ForEachCounter(const std::function<void(CounterNode*)>& visit) const {
   VisitCounters(_root.get(), visit);
}

void RegistryImpl::AddQuery(QueryImpl* query) {
   System::NativeSynchronized lock(_queryList->mutex);
   _queryList->queries.insert(query);
}

void RegistryImpl::EnumeratePath(const std::string& path, std::vector<std::string>& out) {
   RegistryReadGuard guard(this);
   const CounterNode* node = path == "/" ? _root.get() : FindNode(path);
   if (!node) return;
   for (const auto& [name, child] : node->children) out.push_back(name);
}

void RegistryImpl::CollectAll(QueryResults& results) {
   RegistryReadGuard guard(this);
   // Each group is asked once. Its counters are usually neighbours in the tree, so the
   // last group looked up is tried first.
   std::unordered_map<GroupImpl*, std::vector<Value>> values;
   GroupImpl* lastGroup = nullptr;
   std::vector<Value>* lastValues = nullptr;
   results.reserve(results.size() + static_cast<size_t>(_counterCount));
   ForEachCounter([&](CounterNode* node) {
      if (node->group != lastGroup) {
         auto [it, added] = values.try_emplace(node->group);
         if (added) node->group->CollectValues(it->second);
         lastGroup = node->group;
         lastValues = &it->second;
      }
      results.push_back({Ref<Metadata>(node->GetMetadata()), (*lastValues)[node->index]});
   });
}

int RegistryImpl::GetCounterCount() {
   RegistryReadGuard guard(this);
   return _counterCount;
}

std::string RegistryImpl::ToString() const {
   auto* self = const_cast<RegistryImpl*>(this);
   RegistryReadGuard guard(self);
   std::string text = "PerfCounter::Registry\n Publisher = { ";
   for (const auto& [sequence, entry] : _groups) {
      text += entry.first->GetPublisher()->ToString() + " (" +
              std::to_string(entry.first->GetMetadata().size()) + " counters) ";
   }
   text += "}\n CounterTree = { ";
   ForEachCounter([&text](CounterNode* node) {
      text += "\n   " + PathOf(node) + " => " + node->GetPublisher()->ToString();
   });
   text += " }\n Queries = { ";
   System::NativeSynchronized lock(_queryList->mutex);
   for (QueryImpl* query : _queryList->queries) text += query->ToString() + " ";
   text += "}";
   return text;
}

Registry* GetCounterRegistry() {
   // Never destroyed: counters may be read and released during static destruction.
   static RegistryImpl* const registry = [] {
      auto* created = new RegistryImpl();
      created->IncRef();
      return created;
   }();
   return registry;
}

void CreateCounterRegistry(Ref<Registry>& out) { out = new RegistryImpl(); }

}  // namespace Pelmora::PerfCounter
