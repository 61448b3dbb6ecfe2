#pragma once
// The scoreboard counts live referenced instances per class, keyed by the address of
// the class's type-name string. It is a best-effort statistic: a fixed table allocated
// once, updated lock-free, that silently drops classes whose row is full. Thread-safe.
// The reference tracker records where instances of chosen classes were first referenced.

#include <string>
#include <unordered_set>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/object/lwStatsProvider.h"

namespace Pelmora {

class PELMORA_EXPORT Scoreboard : public PerfCounter::LwStatsProvider {
public:
   // Reports each counted class as Scoreboard/Class='<mangled name>'/Instances.
   void GetStats(PerfCounter::LwStatsBuilder& builder) override = 0;
   virtual void Increment(const char* name) = 0;
   virtual void Decrement(const char* name) = 0;
   // One line "(row, cell) => name - count" per counted class.
   virtual void Serialize(std::string& out) const = 0;
   // The number of classes counted.
   virtual int GetSize() const = 0;
   virtual ~Scoreboard() = default;
   // Calls `visitor` with each counted class's name and count; lock-free, so a count may
   // be a moment old.
   using ClassVisitor = void (*)(void* context, const char* name, int count);
   virtual void VisitClasses(ClassVisitor visitor, void* context) const = 0;
   // Counts `delta` instances at once (negative: fewer), for code that makes or drops
   // objects by the thousand. By default one Increment or Decrement per instance. Last,
   // so that the operations before it keep their places for code built earlier.
   virtual void Add(const char* name, int delta) {
      for (; delta > 0; --delta) Increment(name);
      for (; delta < 0; ++delta) Decrement(name);
   }
};

// The process-wide scoreboard; null until the first object is referenced. Lives until exit.
PELMORA_EXPORT Scoreboard* GetScoreboard();

class PELMORA_EXPORT RefTracker : public virtual Object {
public:
   // Appends, per tracked class, the backtraces of first references by descending count.
   virtual void GetScores(std::string& out) = 0;
   virtual void OnFirstIncRef(Object* object, const std::type_info& type) = 0;
   virtual void OnFinalDecRef(Object* object, const std::type_info& type) = 0;
};

// Creates the reference tracker for the named classes (mangled names) and installs it
// process-wide. The installed tracker lives until exit.
PELMORA_EXPORT void CreateRefTracker(const std::unordered_set<std::string>& classNames, Ref<RefTracker>& out);
// The installed tracker, or null.
PELMORA_EXPORT RefTracker* GetRefTracker();

}  // namespace Pelmora
