#pragma once
// Meters: a running total, sample count, minimum, maximum and mean of sampled values.
// Meter is the plain value (not thread-safe). MeterAccumulator is a named meter that many
// threads sample under its own mutex and that publishes its fields as counters
// "<name>/total", "/numSamples", "/min", "/max" and "/mean"; it unpublishes itself when
// destroyed and is thread-safe. MeterAccessor reads a published meter back through a
// query; it belongs to one thread.

#include <memory>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/perfCounter/registry.h"

namespace Pelmora::PerfCounter {

class PELMORA_EXPORT Meter {
public:
   // The meter's counters, in field order.
   enum Counter {
      COUNTER_TOTAL = 0,
      COUNTER_NUM_SAMPLES = 1,
      COUNTER_MIN = 2,
      COUNTER_MAX = 3,
      COUNTER_MEAN = 4,
   };
   static constexpr int kCounterCount = 5;

   Meter() = default;
   Meter(long long total, long long numSamples, long long min, long long max, long long mean)
      : _total(total), _numSamples(numSamples), _min(min), _max(max), _mean(mean) {}

   long long GetTotal() const { return _total; }
   long long GetNumSamples() const { return _numSamples; }
   long long GetMin() const { return _min; }
   long long GetMax() const { return _max; }
   long long GetMean() const { return _mean; }
   long long Get(Counter counter) const;
   void Set(Counter counter, long long value);

   // Adds one sample; the mean is the total divided by the count, truncated toward zero.
   void Sample(long long value);
   // Folds another meter in, as if its samples had been taken here.
   void Merge(const Meter* src);
   void Reset() { *this = Meter(); }

   bool Equals(const Meter* other) const;
   // "Meter total=.. numSamples=.. min=.. max=.. mean=..".
   std::string ToString() const;

   // "total", "numSamples", "min", "max", "mean".
   static const char* GetCounterName(Counter counter);
   static Metadata::Type GetCounterType(Counter counter);

private:
   long long _total = 0;
   long long _numSamples = 0;
   long long _min = 0;
   long long _max = 0;
   long long _mean = 0;
};

class PELMORA_EXPORT MeterAccumulator {
public:
   // `registry` may be null for a meter that is never published.
   MeterAccumulator(Registry* registry, const std::string& name);
   MeterAccumulator(Registry* registry, const std::string& name, const Meter& initial);
   ~MeterAccumulator();
   MeterAccumulator(const MeterAccumulator&) = delete;
   MeterAccumulator& operator=(const MeterAccumulator&) = delete;

   void Sample(long long value);
   // A consistent copy of the fields.
   Meter GetMeter() const;
   void Reset();

   // Registers the visible counters. InvalidStateException when already published or
   // without a registry; the registry's exceptions for a refused name.
   void Publish();
   // InvalidStateException when not published.
   void Unpublish();
   bool IsPublished() const;
   // Chooses which fields Publish registers (all by default). InvalidStateException while
   // published: the registered set cannot change under a reader.
   void SetCounterVisible(Meter::Counter counter, bool visible);
   bool IsCounterVisible(Meter::Counter counter) const;

   const std::string& GetName() const { return _name; }

   class State;

private:
   Registry* const _registry;
   const std::string _name;
   const Ref<State> _state;
};

class PELMORA_EXPORT MeterAccessor {
public:
   // Selects the counters of the meter `name` in `registry`.
   MeterAccessor(Registry* registry, const std::string& name);

   // Runs the query and takes the values; returns how many of the five counters were found.
   int Refresh();
   // Takes this meter's values from results gathered elsewhere (other counters are
   // ignored); returns how many were found. Fields not found keep their value.
   int Consume(const QueryResults& results);

   const Meter& GetMeter() const { return _meter; }
   const std::string& GetName() const { return _name; }

private:
   const std::string _name;
   Ref<Query> _query;
   Meter _meter;
};

}  // namespace Pelmora::PerfCounter
