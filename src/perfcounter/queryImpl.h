#pragma once
// QueryImpl is the common part of names and regular-expression queries: the state
// machine (uninitialised, initialised, compiled), the selection of counters grouped by
// the group that publishes them, and the registry's notifications.

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "pelmora/perfCounter/registry.h"
#include "src/perfcounter/registryImpl.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora::PerfCounter {

class QueryImpl : public virtual Query, public ObjectImpl {
public:
   enum State { UNINITIALIZED, INITIALIZED, COMPILED };

   explicit QueryImpl(RegistryImpl* registry)
      : _registry(registry), _queryList(registry->GetQueryList()) {}
   ~QueryImpl() override;

   void SetQueryOption(QueryOption option, bool value) override;
   bool GetQueryOption(QueryOption option) const override;
   void Execute(QueryResults& results) override;
   void Clear() override;
   void Uninitialize() override;
   using ObjectImpl::ToString;
   std::string ToString() const override;

   // Joins the registry and compiles. The caller must not hold the registry's write lock.
   void Initialize();

   // From the registry, under its write lock.
   void OnGroupAdded(GroupImpl* group);
   void OnGroupRemoved(GroupImpl* group);
   // From a registry being destroyed: the query can no longer run.
   void OnRegistryGone();

protected:
   virtual bool Matches(const std::string& name) const = 0;
   // Adds every matching counter of the tree; the registry is locked.
   virtual void SelectFromTree() PELMORA_REQUIRES(_mutex) = 0;
   virtual std::string DescribeCriteria() const = 0;

   // Adds one counter node to the selection.
   void Select(CounterNode* node) PELMORA_REQUIRES(_mutex);

   RegistryImpl* const _registry;  // valid while the query is in the list
   const std::shared_ptr<QueryList> _queryList;
   // Guards the state and the selection; subclasses select under it.
   mutable System::NativeMutex _mutex;

private:
   struct Selected {
      Ref<GroupImpl> group;
      CounterNode* firstNode = nullptr;
      std::vector<int> indices;  // ascending: the group's order
   };

   void Compile() PELMORA_REQUIRES(_mutex);

   State _state PELMORA_GUARDED_BY(_mutex) = UNINITIALIZED;
   bool _trackNewCounters PELMORA_GUARDED_BY(_mutex) = true;
   bool _sortByName PELMORA_GUARDED_BY(_mutex) = false;
   std::map<uint64_t, Selected> _selection PELMORA_GUARDED_BY(_mutex);  // by group sequence: registration order
};

}  // namespace Pelmora::PerfCounter
