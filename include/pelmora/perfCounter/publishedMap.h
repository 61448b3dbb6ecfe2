#pragma once
// Publishing light-weight statistics. A PublishedAccumulator keeps one accumulator
// registered in a registry, guarded by its own mutex. The PublishedAccumulatorMap maps
// statistics keys to published accumulators and folds builders into them: a key seen for
// the first time is published as "/" + key. Threads fill their own builder
// (GetTlsMapBuilder) without locks and pay only when a TlsScope merges it. Both classes
// are thread-safe; the process-wide map lives until exit.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/perfCounter/lwStats.h"
#include "pelmora/perfCounter/registry.h"

namespace Pelmora::PerfCounter {

class PELMORA_EXPORT PublishedAccumulator : public virtual Object {
public:
   // The name of the accumulator: the counter path its counters are published under.
   virtual const std::string& GetName() const = 0;
   virtual LwAccumulator::Type GetType() const = 0;
   virtual void Sample(long long value) = 0;
   virtual void Merge(LwAccumulator* source) = 0;
   // The current counters with their values.
   virtual void GetValues(NamedValues& out) = 0;
   // InvalidStateException when already published; the registry's exceptions for a
   // refused name.
   virtual void Publish() = 0;
   // InvalidStateException when not published.
   virtual void Unpublish() = 0;
   virtual bool IsPublished() const = 0;
};

// Takes over `accumulator`, whose name is the counter path to publish under.
PELMORA_EXPORT void CreatePublishedAccumulator(Registry* registry, LwAccumulator* accumulator,
                                Ref<PublishedAccumulator>& out);

// How many keys a map publishes at most unless told otherwise (SetKeyLimit): enough for
// every component's statistics, few enough that keys made from unbounded data (user or
// peer names) cannot grow the registry without end.
constexpr int kDefaultPublishedKeyLimit = 10000;

class PELMORA_EXPORT PublishedAccumulatorMap : public virtual Object {
public:
   // Folds every accumulator of `builder` into the published one of the same key, creating
   // and publishing it on first sight; publishing happens outside the map's lock. A failure
   // is logged and the merge goes on. Entries are refused, counted and logged (no more than
   // once each time the limit is reached) when the key is new and the map is at its key
   // limit, or when the key is published with another kind of accumulator. The caller must
   // not hold the registry's lock.
   virtual void Merge(LwStatsBuilder& builder) = 0;
   // Publishes a new accumulator under `key` holding what `accumulator` holds.
   // InvalidArgumentException for an invalid key, AlreadyExistsException for a known one,
   // FullException at the key limit.
   virtual void Add(const std::string& key, LwAccumulator* accumulator) = 0;
   // The most keys the map holds; keys already in it stay when the limit is lowered.
   virtual void SetKeyLimit(int limit) = 0;
   virtual int GetKeyLimit() = 0;
   // The builder entries Merge refused so far.
   virtual long long GetRefusedCount() = 0;
   virtual bool Find(const std::string& key, Ref<PublishedAccumulator>& out) = 0;
   // Unpublishes and forgets the key; false when it was not there.
   virtual bool Remove(const std::string& key) = 0;
   // Unpublishes and forgets every key.
   virtual void Clear() = 0;
   virtual int GetSize() = 0;
};

// The process-wide map, publishing in GetCounterRegistry(). Lives until exit.
PELMORA_EXPORT PublishedAccumulatorMap* GetPublishedAccumulatorMap();
// A map publishing in `registry`, which must outlive it.
PELMORA_EXPORT void CreatePublishedAccumulatorMap(Registry* registry, Ref<PublishedAccumulatorMap>& out);

// The calling thread's builder, made on first use and released with the thread.
PELMORA_EXPORT LwStatsBuilder* GetTlsMapBuilder();

// Brackets a stretch of work that fills the thread's builder. When the outermost scope of
// a thread ends, the builder is merged into `map` and emptied; nested scopes only count.
class PELMORA_EXPORT TlsScope {
public:
   explicit TlsScope(PublishedAccumulatorMap* map = GetPublishedAccumulatorMap());
   ~TlsScope();
   TlsScope(const TlsScope&) = delete;
   TlsScope& operator=(const TlsScope&) = delete;

   LwStatsBuilder& GetBuilder() { return *_builder; }

private:
   PublishedAccumulatorMap* const _map;
   LwStatsBuilder* const _builder;
   bool _outermost;
};

}  // namespace Pelmora::PerfCounter
