#pragma once
// Light-weight statistics: accumulators that a thread fills without locks and that are
// merged into shared, published ones later. LwCounter is a plain count, LwMeterAccumulator
// a meter, LwHistoryMeterAccumulator a meter that also keeps its most recent samples.
// A Factory makes an accumulator of one kind. An LwStatsBuilder collects accumulators
// under nested namespaces, keyed like "Pool/Thread='io'/Busy". None of these is
// thread-safe: each instance belongs to one thread at a time.

#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "pelmora/object/export.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/perfCounter/counter.h"
#include "pelmora/object/lwStatsProvider.h"
#include "pelmora/perfCounter/meter.h"

namespace Pelmora::PerfCounter {

using NamedValues = std::vector<std::pair<Ref<Metadata>, Value>>;

class PELMORA_EXPORT LwAccumulator : public ObjectImpl {
public:
   enum Type {
      TYPE_COUNTER = 1,
      TYPE_METER = 2,
      TYPE_HISTORY_METER = 3,
   };

   explicit LwAccumulator(std::string name) : _name(std::move(name)) {}
   const std::string& GetName() const { return _name; }

   virtual Type GetType() const = 0;
   virtual void Sample(long long value) = 0;
   // Folds `source` in, as if its samples had been taken here. InvalidArgumentException
   // when it is of another type.
   virtual void Merge(LwAccumulator* source) = 0;
   // Appends the counters this accumulator publishes, named from its name, with values.
   virtual void GetValues(NamedValues& out) = 0;
   // Appends the values GetValues gives, in the same order, without making metadata.
   virtual void ReadValues(std::vector<Value>& out) const = 0;
   // The count of a counter, the total of a meter.
   virtual long long GetTotal() const = 0;
   virtual void Reset() = 0;
   // An empty accumulator of the same kind and shape under another name.
   virtual void CreateEmpty(const std::string& name, Ref<LwAccumulator>& out) const = 0;
   // The numbers as text, without the name: "count=5", "total=.. numSamples=.. ...".
   virtual std::string Describe() const = 0;

protected:
   void CheckSameType(const LwAccumulator* source) const;

private:
   const std::string _name;
};

// A plain count: Sample adds its value. Published as one counter under its name.
class PELMORA_EXPORT LwCounter : public LwAccumulator {
public:
   static constexpr Type kType = TYPE_COUNTER;
   explicit LwCounter(std::string name) : LwAccumulator(std::move(name)) {}

   Type GetType() const override { return kType; }
   void Sample(long long value) override;
   void Merge(LwAccumulator* source) override;
   void GetValues(NamedValues& out) override;
   void ReadValues(std::vector<Value>& out) const override { out.emplace_back(_count); }
   long long GetTotal() const override { return _count; }
   void Reset() override { _count = 0; }
   void CreateEmpty(const std::string& name, Ref<LwAccumulator>& out) const override;
   std::string Describe() const override;

private:
   long long _count = 0;
};

// A meter sampled without a lock. Published as the five meter counters under its name.
class PELMORA_EXPORT LwMeterAccumulator : public LwAccumulator {
public:
   static constexpr Type kType = TYPE_METER;
   explicit LwMeterAccumulator(std::string name) : LwAccumulator(std::move(name)) {}

   Type GetType() const override { return kType; }
   void Sample(long long value) override { _meter.Sample(value); }
   void Merge(LwAccumulator* source) override;
   void GetValues(NamedValues& out) override;
   void ReadValues(std::vector<Value>& out) const override;
   long long GetTotal() const override { return _meter.GetTotal(); }
   void Reset() override { _meter.Reset(); }
   void CreateEmpty(const std::string& name, Ref<LwAccumulator>& out) const override;
   std::string Describe() const override;

   const Meter& GetMeter() const { return _meter; }

protected:
   Meter _meter;
};

// A meter that also keeps the last `historySize` samples. When full, a new sample pushes
// out the oldest; merged samples count as newer than the ones already held.
class PELMORA_EXPORT LwHistoryMeterAccumulator : public LwMeterAccumulator {
public:
   static constexpr Type kType = TYPE_HISTORY_METER;
   // InvalidArgumentException unless `historySize` is at least 1.
   LwHistoryMeterAccumulator(std::string name, int historySize);

   Type GetType() const override { return kType; }
   void Sample(long long value) override;
   void Merge(LwAccumulator* source) override;
   void Reset() override;
   void CreateEmpty(const std::string& name, Ref<LwAccumulator>& out) const override;
   std::string Describe() const override;

   int GetHistorySize() const { return static_cast<int>(_ring.size()); }
   // The samples held, oldest first.
   void GetHistory(std::vector<long long>& out) const;

private:
   void Remember(long long value);

   std::vector<long long> _ring;
   size_t _next = 0;    // where the next sample goes
   size_t _filled = 0;  // how many slots hold samples
};

// Makes accumulators of one kind; what a builder uses when a key is first seen.
class PELMORA_EXPORT FactoryBase {
public:
   virtual LwAccumulator::Type GetType() const = 0;
   virtual void Create(const std::string& name, Ref<LwAccumulator>& out) const = 0;
   virtual ~FactoryBase() = default;
};

// Factory<LwCounter>, Factory<LwMeterAccumulator>, Factory<LwHistoryMeterAccumulator, int>
// (with the history size): the arguments after the name are kept and passed to each new one.
template <class T, class... Args>
class Factory : public FactoryBase {
public:
   explicit Factory(Args... args) : _args(std::move(args)...) {}
   LwAccumulator::Type GetType() const override { return T::kType; }
   void Create(const std::string& name, Ref<LwAccumulator>& out) const override {
      out = std::apply([&name](const Args&... args) { return new T(name, args...); }, _args);
   }

private:
   std::tuple<Args...> _args;
};

using CounterFactory = Factory<LwCounter>;
using MeterFactory = Factory<LwMeterAccumulator>;
using HistoryMeterFactory = Factory<LwHistoryMeterAccumulator, int>;

// Collects accumulators under a stack of namespaces. Push("Pool") then Push("Thread", "io")
// then Insert("Busy", ...) fills the key "Pool/Thread='io'/Busy". A key is checked with
// ValidateStatsScope when first seen; an invalid one is logged and its samples dropped.
class PELMORA_EXPORT LwStatsBuilder : public virtual Object {
public:
   virtual void Push(const std::string& name) = 0;
   // Enters the namespace name='value'.
   virtual void Push(const std::string& name, const std::string& value) = 0;
   // Leaves the innermost namespace; panics when there is none.
   virtual void Pop() = 0;
   // Merges `accumulator` into the builder's one under `name`, made by `factory` if new.
   virtual void Insert(const std::string& name, LwAccumulator* accumulator,
                       const FactoryBase& factory) = 0;
   // Samples `value` into the builder's accumulator under `name`, made by `factory` if new.
   // InvalidArgumentException when the existing one is of another kind.
   virtual void Insert(const std::string& name, long long value, const FactoryBase& factory) = 0;
   // The total of the accumulator under `name` in the current namespace; false if none.
   virtual bool GetTotalCount(const std::string& name, long long& out) const = 0;
   // One line per accumulator, in key order: the key, a blank, its Describe text.
   virtual void Serialize(Writer* writer) const = 0;
   // Drops every accumulator and namespace.
   virtual void Reset() = 0;
   // Exchanges everything with another builder of this library.
   virtual void Swap(LwStatsBuilder& other) = 0;
   // Each accumulator with its key, in key order.
   virtual void GetEntries(std::vector<std::pair<Ref<LwAccumulator>, std::string>>& out) const = 0;
   virtual int GetSize() const = 0;
};

PELMORA_EXPORT void CreateLwStatsBuilder(Ref<LwStatsBuilder>& out);

// Whether `key` is a well-formed statistics key: non-empty, starting with A-Z, not ending
// in "/" or "=", no "//", every "/" followed by A-Z, every "=" followed by "'" and at most
// one "=" per segment. An invalid key is logged at error level and gives false.
PELMORA_EXPORT bool ValidateStatsScope(const std::string& key);

}  // namespace Pelmora::PerfCounter
