#pragma once
// RegistryImpl keeps the counter tree (one node per path component, a counter's node
// pointing at its group), the registered groups in registration order and the live
// queries, which it tells of groups coming and going.
//
// Locks, in the order they may be taken: the registry's reader/writer lock, the query
// list mutex, a query's own mutex, then whatever a publisher takes while collecting.

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "pelmora/object/weak.h"
#include "pelmora/perfCounter/registry.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora::PerfCounter {

class RegistryImpl;
class QueryImpl;

// Counters registered together with one publisher.
class GroupImpl : public ObjectImpl {
public:
   GroupImpl(RegistryImpl* registry, uint64_t sequence, RefVector<Metadata> metadata,
             GroupPublisher* publisher);

   // Null once unregistered or once the registry is gone; for comparing, not for calling:
   // the registry may be destroyed at any time by another thread.
   RegistryImpl* GetRegistry() const { return _registry.load(std::memory_order_acquire); }
   // A counted reference to the registry while the group is registered and the registry
   // lives; null otherwise. What a caller holds while it calls the registry.
   Ref<RegistryImpl> HoldRegistry() const;
   void Detach() { _registry.store(nullptr, std::memory_order_release); }
   uint64_t GetSequence() const { return _sequence; }
   RefVector<Metadata>& GetMetadata() { return _metadata; }
   GroupPublisher* GetPublisher() const { return _publisher.Get(); }
   // Asks the publisher for the whole group; panics if it answers with the wrong count.
   void CollectValues(std::vector<Value>& values);

private:
   std::atomic<RegistryImpl*> _registry;
   const WeakRef<RegistryImpl> _registryLink;
   const uint64_t _sequence;
   RefVector<Metadata> _metadata;
   const Ref<GroupPublisher> _publisher;
};

// One path component. A node is a counter when it has a group; it may have children too.
struct CounterNode {
   std::string component;
   CounterNode* parent = nullptr;
   std::map<std::string, std::unique_ptr<CounterNode>, std::less<>> children;
   GroupImpl* group = nullptr;  // kept alive by the registry's group map
   int index = -1;              // the counter's place in its group

   GroupPublisher* GetPublisher() const { return group ? group->GetPublisher() : nullptr; }
   Metadata* GetMetadata() const { return group ? group->GetMetadata()[index].Get() : nullptr; }
};

// Holds the read lock for a scope unless the thread already holds the lock for writing
// (a read hold the thread has is simply taken again).
class RegistryReadGuard {
public:
   explicit RegistryReadGuard(System::RWLockableObject* lock)
      : _lock(lock), _held(!lock->IsWriteLocked()) {
      if (_held) _lock->ReadLock();
   }
   ~RegistryReadGuard() {
      if (_held) _lock->Unlock();
   }
   RegistryReadGuard(const RegistryReadGuard&) = delete;
   RegistryReadGuard& operator=(const RegistryReadGuard&) = delete;

private:
   System::RWLockableObject* const _lock;
   const bool _held;
};

// Holds the write lock for a scope unless the thread already holds it.
class RegistryWriteGuard {
public:
   explicit RegistryWriteGuard(System::RWLockableObject* lock)
      : _lock(lock), _held(!lock->IsWriteLocked()) {
      if (_held) _lock->WriteLock();
   }
   ~RegistryWriteGuard() {
      if (_held) _lock->Unlock();
   }
   RegistryWriteGuard(const RegistryWriteGuard&) = delete;
   RegistryWriteGuard& operator=(const RegistryWriteGuard&) = delete;

private:
   System::RWLockableObject* const _lock;
   const bool _held;
};

// The queries joined to a registry. Each query shares the list with its registry, so a
// query dropped while its registry dies leaves through the list and never touches the
// registry itself.
struct QueryList {
   System::NativeMutex mutex;
   std::set<QueryImpl*> queries PELMORA_GUARDED_BY(mutex);
};

// Weakly linkable so that a registration can hold it while calling it (HoldRegistry).
class RegistryImpl : public virtual Registry,
                     public WeakLinkableImpl<System::RWLockableObjectImpl> {
public:
   RegistryImpl();
   ~RegistryImpl() override;

   void Register(Metadata* metadata, Publisher* publisher, Ref<RegistryItem>& out) override;
   void RegisterGroup(RefVector<Metadata>& metadata, GroupPublisher* publisher,
                      Ref<RegistryItem>& out) override;
   void CreateNamesQuery(std::vector<std::string>& names, Ref<Query>& out) override;
   void CreateRegexQuery(const std::string& pattern, bool caseSensitive,
                         Ref<Query>& out) override;
   void EnumeratePath(const std::string& path, std::vector<std::string>& out) override;
   void CollectAll(QueryResults& results) override;
   int GetCounterCount() override;
   using ObjectImpl::ToString;
   std::string ToString() const override;

   // Removes a group's counters; nothing when it is no longer registered here.
   void UnregisterGroup(GroupImpl* group);

   // For queries; the caller holds the lock (read or write).
   CounterNode* FindNode(std::string_view path) const;
   void ForEachCounter(const std::function<void(CounterNode*)>& visit) const;
   void AddQuery(QueryImpl* query);
   const std::shared_ptr<QueryList>& GetQueryList() const { return _queryList; }

   static bool IsValidCounterName(const std::string& name);

private:
   // Throws unless every name of the batch may be registered; under the write lock.
   void ValidateNewCounters(const RefVector<Metadata>& metadata);
   void AddToTree(GroupImpl* group, std::vector<CounterNode*>& nodes);
   void Prune(CounterNode* node);

   std::unique_ptr<CounterNode> _root;
   // Registration order; the groups' nodes, for removal.
   std::map<uint64_t, std::pair<Ref<GroupImpl>, std::vector<CounterNode*>>> _groups;
   uint64_t _nextSequence = 1;
   int _counterCount = 0;

   // Queries are added under the read lock, so the list has a mutex of its own; they are
   // told of changes under the write lock.
   const std::shared_ptr<QueryList> _queryList = std::make_shared<QueryList>();
};

}  // namespace Pelmora::PerfCounter
