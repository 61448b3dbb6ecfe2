#pragma once
// The Registry is the directory of named counters: components register counters with
// the publisher that supplies their values, monitoring code selects counters by name or
// regular expression through queries and reads their current values. Counter names are
// paths ("/Pool/Thread/Busy"). The registry holds its publishers; registrations last until
// their RegistryItem is unregistered (dropping the item does not unregister). A Registry
// is a reader/writer lock: registration takes it exclusively, queries share it, and a
// caller may hold it around several calls. Thread-safe.

#include <string>
#include <vector>

#include "pelmora/object/export.h"
#include "pelmora/object/containers.h"
#include "pelmora/perfCounter/counter.h"
#include "pelmora/system/rwLock.h"

namespace Pelmora::PerfCounter {

// The handle of one registration.
class PELMORA_EXPORT RegistryItem : public virtual Object {
public:
   // Removes the counters this item registered; later calls do nothing.
   virtual void Unregister() = 0;
   virtual bool IsRegistered() const = 0;
};

// One counter as a query found it.
struct PELMORA_EXPORT QueryResult {
   Ref<Metadata> metadata;
   Value value;
   // "name = value".
   std::string ToString() const;
};
using QueryResults = std::vector<QueryResult>;

enum QueryOption {
   // Counters registered after the query was compiled join its selection when they
   // match. On by default; off, the selection stays as compiled until Clear.
   QUERY_OPTION_TRACK_NEW_COUNTERS = 0,
   // Execute orders its results by counter name rather than by registration. Off by default.
   QUERY_OPTION_SORT_BY_NAME = 1,
};

// A compiled selection of counters that can be executed many times. Counters registered
// later are added when they match, unregistered ones leave it. Thread-safe.
class PELMORA_EXPORT Query : public virtual Object {
public:
   // InvalidArgumentException for an unknown option.
   virtual void SetQueryOption(QueryOption option, bool value) = 0;
   virtual bool GetQueryOption(QueryOption option) const = 0;
   // Appends one result per selected counter. Takes the registry's read lock unless the
   // caller holds it (read or write). An uninitialised query panics.
   virtual void Execute(QueryResults& results) = 0;
   // Forgets the selection; the next Execute computes it again from the counter tree.
   virtual void Clear() = 0;
   // Detaches the query from its registry for good; Execute then panics.
   virtual void Uninitialize() = 0;
};

class PELMORA_EXPORT Registry : public virtual System::RWLockableObject {
public:
   // Registers one counter. InvalidArgumentException for a bad name ("Invalid argument : "
   // and the name), AlreadyExistsException when the name is taken.
   virtual void Register(Metadata* metadata, Publisher* publisher, Ref<RegistryItem>& out) = 0;
   // Registers a group whose values one publisher supplies together. The names are checked
   // as a batch: if one is refused, none is registered.
   virtual void RegisterGroup(RefVector<Metadata>& metadata, GroupPublisher* publisher,
                              Ref<RegistryItem>& out) = 0;
   // Selects the counters named exactly as one of `names`. The caller must not hold the
   // registry's write lock.
   virtual void CreateNamesQuery(std::vector<std::string>& names, Ref<Query>& out) = 0;
   // Selects the counters whose names contain a match of `pattern` (Perl syntax), ignoring
   // case unless `caseSensitive`. InvalidArgumentException for a pattern that does not compile.
   virtual void CreateRegexQuery(const std::string& pattern, bool caseSensitive,
                                 Ref<Query>& out) = 0;
   // The names of the children of `path` in the counter tree, in order; "/" is the root.
   // Empty for a path with no children or none at all.
   virtual void EnumeratePath(const std::string& path, std::vector<std::string>& out) = 0;
   // Every registered counter with its value, in name order.
   virtual void CollectAll(QueryResults& results) = 0;
   virtual int GetCounterCount() = 0;
};

// The process-wide registry. Lives until exit.
PELMORA_EXPORT Registry* GetCounterRegistry();
// A registry of its own, for a component that keeps its counters apart (and for tests).
PELMORA_EXPORT void CreateCounterRegistry(Ref<Registry>& out);

}  // namespace Pelmora::PerfCounter
