// Meters: the sampling rule, the published accumulator and the reading side.

#include "pelmora/perfCounter/meter.h"

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora::PerfCounter {

namespace {

// Sums wrap instead of overflowing: a counter that runs for years must not be undefined.
long long WrappingAdd(long long a, long long b) {
   return static_cast<long long>(static_cast<unsigned long long>(a) +
                                 static_cast<unsigned long long>(b));
}

}  // namespace

long long Meter::Get(Counter counter) const {
   switch (counter) {
      case COUNTER_TOTAL: return _total;
      case COUNTER_NUM_SAMPLES: return _numSamples;
      case COUNTER_MIN: return _min;
      case COUNTER_MAX: return _max;
      case COUNTER_MEAN: return _mean;
   }
   throw InvalidArgumentException(std::to_string(static_cast<int>(counter)));
}

void Meter::Set(Counter counter, long long value) {
   switch (counter) {
      case COUNTER_TOTAL: _total = value; return;
      case COUNTER_NUM_SAMPLES: _numSamples = value; return;
      case COUNTER_MIN: _min = value; return;
      case COUNTER_MAX: _max = value; return;
      case COUNTER_MEAN: _mean = value; return;
   }
   throw InvalidArgumentException(std::to_string(static_cast<int>(counter)));
}

void Meter::Sample(long long value) {
   _total = WrappingAdd(_total, value);
   _numSamples += 1;
   // "> 1" rather than "!= 1": a meter set up with a negative count starts over instead
   // of dividing by zero (or LLONG_MIN by -1).
   if (_numSamples > 1) [[likely]] {
      if (value < _min) _min = value;
      if (value > _max) _max = value;
      _mean = _total / _numSamples;
      return;
   }
   _min = _max = _mean = value;
}

void Meter::Merge(const Meter* src) {
   PELMORA_VERIFY(src->_numSamples >= 0);
   if (src->_numSamples == 0) return;
   if (_numSamples <= 0) {
      *this = *src;
      return;
   }
   _total = WrappingAdd(_total, src->_total);
   _numSamples += src->_numSamples;
   if (src->_min < _min) _min = src->_min;
   if (src->_max > _max) _max = src->_max;
   _mean = _total / _numSamples;
}

bool Meter::Equals(const Meter* other) const {
   return other && _total == other->_total && _numSamples == other->_numSamples &&
          _min == other->_min && _max == other->_max && _mean == other->_mean;
}

std::string Meter::ToString() const {
   return "Meter total=" + std::to_string(_total) + " numSamples=" + std::to_string(_numSamples) +
          " min=" + std::to_string(_min) + " max=" + std::to_string(_max) +
          " mean=" + std::to_string(_mean);
}

const char* Meter::GetCounterName(Counter counter) {
   static const char* const kNames[kCounterCount] = {"total", "numSamples", "min", "max", "mean"};
   if (counter < 0 || counter >= kCounterCount) {
      throw InvalidArgumentException(std::to_string(static_cast<int>(counter)));
   }
   return kNames[counter];
}

Metadata::Type Meter::GetCounterType(Counter counter) {
   if (counter < 0 || counter >= kCounterCount) {
      throw InvalidArgumentException(std::to_string(static_cast<int>(counter)));
   }
   return static_cast<Metadata::Type>(static_cast<int>(Metadata::TYPE_METER_TOTAL) + counter);
}

// The fields under their mutex, and the publisher of them: the registry holds it while
// published, so a query never reaches a destroyed accumulator.
class MeterAccumulator::State : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit State(const Meter& initial) : meter(initial) {}

   void CollectValues(RefVector<Metadata>& metadata, std::vector<Value>& values) override {
      values.resize(metadata.size());
      System::NativeSynchronized lock(mutex);
      for (size_t i = 0; i < metadata.size(); ++i) {
         auto counter = static_cast<Meter::Counter>(metadata[i]->GetType() - Metadata::TYPE_METER_TOTAL);
         values[i].Set(meter.Get(counter));
      }
   }

   System::NativeMutex mutex;  // the meter
   Meter meter PELMORA_GUARDED_BY(mutex);

   System::NativeMutex publishMutex;  // the rest; taken before the registry's lock
   bool visible[Meter::kCounterCount] PELMORA_GUARDED_BY(publishMutex) = {true, true, true, true, true};
   Ref<RegistryItem> item PELMORA_GUARDED_BY(publishMutex);
};

MeterAccumulator::MeterAccumulator(Registry* registry, const std::string& name)
   : MeterAccumulator(registry, name, Meter()) {}

MeterAccumulator::MeterAccumulator(Registry* registry, const std::string& name,
                                   const Meter& initial)
   : _registry(registry), _name(name), _state(new State(initial)) {}

MeterAccumulator::~MeterAccumulator() {
   System::NativeSynchronized lock(_state->publishMutex);
   if (!_state->item) return;
   _state->item->Unregister();
   // The item holds the state through its group: dropping it breaks the cycle.
   _state->item.Reset();
}

void MeterAccumulator::Sample(long long value) {
   System::NativeSynchronized lock(_state->mutex);
   _state->meter.Sample(value);
}

Meter MeterAccumulator::GetMeter() const {
   System::NativeSynchronized lock(_state->mutex);
   return _state->meter;
}

void MeterAccumulator::Reset() {
   System::NativeSynchronized lock(_state->mutex);
   _state->meter.Reset();
}

void MeterAccumulator::Publish() {
   System::NativeSynchronized lock(_state->publishMutex);
   if (_state->item || !_registry) throw InvalidStateException();
   RefVector<Metadata> metadata;
   for (int c = 0; c < Meter::kCounterCount; ++c) {
      if (!_state->visible[c]) continue;
      auto counter = static_cast<Meter::Counter>(c);
      metadata.push_back(new Metadata(_name + "/" + Meter::GetCounterName(counter),
                                      Meter::GetCounterType(counter)));
   }
   if (metadata.empty()) throw InvalidStateException();
   _registry->RegisterGroup(metadata, _state.Get(), _state->item);
}

void MeterAccumulator::Unpublish() {
   System::NativeSynchronized lock(_state->publishMutex);
   if (!_state->item) throw InvalidStateException();
   _state->item->Unregister();
   _state->item.Reset();
}

bool MeterAccumulator::IsPublished() const {
   System::NativeSynchronized lock(_state->publishMutex);
   return static_cast<bool>(_state->item);
}

void MeterAccumulator::SetCounterVisible(Meter::Counter counter, bool visible) {
   Meter::GetCounterName(counter);  // checks the range
   System::NativeSynchronized lock(_state->publishMutex);
   if (_state->item) throw InvalidStateException();
   _state->visible[counter] = visible;
}

bool MeterAccumulator::IsCounterVisible(Meter::Counter counter) const {
   Meter::GetCounterName(counter);
   System::NativeSynchronized lock(_state->publishMutex);
   return _state->visible[counter];
}

MeterAccessor::MeterAccessor(Registry* registry, const std::string& name) : _name(name) {
   std::vector<std::string> names;
   for (int c = 0; c < Meter::kCounterCount; ++c) {
      names.push_back(name + "/" + Meter::GetCounterName(static_cast<Meter::Counter>(c)));
   }
   registry->CreateNamesQuery(names, _query);
}

int MeterAccessor::Refresh() {
   QueryResults results;
   _query->Execute(results);
   return Consume(results);
}

int MeterAccessor::Consume(const QueryResults& results) {
   int found = 0;
   for (const QueryResult& result : results) {
      const std::string& name = result.metadata->GetName();
      int type = result.metadata->GetType();
      if (type < Metadata::TYPE_METER_TOTAL || type > Metadata::TYPE_METER_MEAN) continue;
      auto counter = static_cast<Meter::Counter>(type - Metadata::TYPE_METER_TOTAL);
      const char* field = Meter::GetCounterName(counter);
      // "<name>/<field>" exactly.
      if (name.size() != _name.size() + 1 + std::char_traits<char>::length(field) ||
          name.compare(0, _name.size(), _name) != 0 || name[_name.size()] != '/' ||
          name.compare(_name.size() + 1, std::string::npos, field) != 0) {
         continue;
      }
      _meter.Set(counter, result.value.Get());
      ++found;
   }
   return found;
}

}  // namespace Pelmora::PerfCounter
