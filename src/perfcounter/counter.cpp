// Metadata, query results and the single-publisher adapter.

#include "pelmora/perfCounter/counter.h"

#include "pelmora/perfCounter/registry.h"

namespace Pelmora::PerfCounter {

const char* Metadata::TypeName(Type type) {
   switch (type) {
      case TYPE_COUNTER: return "counter";
      case TYPE_GAUGE: return "gauge";
      case TYPE_METER_TOTAL: return "meterTotal";
      case TYPE_METER_NUM_SAMPLES: return "meterNumSamples";
      case TYPE_METER_MIN: return "meterMin";
      case TYPE_METER_MAX: return "meterMax";
      case TYPE_METER_MEAN: return "meterMean";
   }
   return "unknown";
}

std::string Metadata::ToString() const {
   return ObjectImpl::ToString() + " _name=" + _name + " _type=" + TypeName(_type);
}

void SingleGroupPublisher::CollectValues(RefVector<Metadata>& metadata,
                                         std::vector<Value>& values) {
   values.assign(metadata.size(), Value());
   for (size_t i = 0; i < metadata.size(); ++i) _publisher->GetValue(metadata[i].Get(), values[i]);
}

std::string QueryResult::ToString() const {
   return (metadata ? metadata->GetName() : std::string("<none>")) + " = " +
          std::to_string(value.Get());
}

}  // namespace Pelmora::PerfCounter
