// Performance counters against their peers: MeterAccumulator::Sample against a
// std::mutex-guarded sum/count/min/max update (alone and with two threads on one meter),
// executing a compiled regular-expression query over 10,000 counters against running
// boost::regex_search over the same 10,000 names, and the Prometheus export of 10,000
// counters against writing the same lines with snprintf.

#include <boost/regex.hpp>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <mutex>
#include <string>
#include <vector>

#include "pelmora/io/writers.h"
#include "pelmora/pelmora.h"
#include "support/ratioMain.h"

using namespace Pelmora;
using namespace Pelmora::PerfCounter;

namespace {

// The peer: what a component would write by hand.
struct MutexMeter {
   std::mutex mutex;
   long long total = 0, count = 0, min = LLONG_MAX, max = LLONG_MIN;
   void Sample(long long v) {
      std::lock_guard<std::mutex> lock(mutex);
      total += v;
      ++count;
      min = std::min(min, v);
      max = std::max(max, v);
   }
};

void BM_MeterAccumulatorSample(benchmark::State& state) {
   MeterAccumulator meter(nullptr, "/Bench/Meter");
   long long v = 0;
   for (auto _ : state) meter.Sample(v++ & 1023);
   benchmark::DoNotOptimize(meter.GetMeter());
}
BENCHMARK(BM_MeterAccumulatorSample);

void BM_MutexSumMinMax(benchmark::State& state) {
   MutexMeter meter;
   long long v = 0;
   for (auto _ : state) meter.Sample(v++ & 1023);
   benchmark::DoNotOptimize(meter.total);
}
BENCHMARK(BM_MutexSumMinMax);

// Both threads sample one shared meter.
void BM_MeterAccumulatorSample2Threads(benchmark::State& state) {
   static MeterAccumulator* const meter = new MeterAccumulator(nullptr, "/Bench/Shared");
   long long v = state.thread_index();
   for (auto _ : state) meter->Sample(v++ & 1023);
}
BENCHMARK(BM_MeterAccumulatorSample2Threads)->Threads(2)->UseRealTime();

void BM_MutexSumMinMax2Threads(benchmark::State& state) {
   static MutexMeter* const meter = new MutexMeter();
   long long v = state.thread_index();
   for (auto _ : state) meter->Sample(v++ & 1023);
}
BENCHMARK(BM_MutexSumMinMax2Threads)->Threads(2)->UseRealTime();

// 1,000 groups of 10 counters: "/Svc/Pool<i>/Shard='<j>'/<Field>", one publisher per group.
constexpr int kGroups = 1000, kPerGroup = 10;
const char* const kFields[kPerGroup] = {"Busy", "Idle", "Queued", "Done", "Failed",
                                        "Retried", "Bytes", "Waits", "Spins", "Parks"};

class GroupValues : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit GroupValues(long long base) : _base(base) {}
   void CollectValues(RefVector<Metadata>& metadata, std::vector<Value>& values) override {
      for (size_t i = 0; i < metadata.size(); ++i) values.emplace_back(_base + static_cast<long long>(i));
   }

private:
   const long long _base;
};

struct Population {
   Ref<Registry> registry;
   RefVector<RegistryItem> items;
   std::vector<std::string> names;

   Population() {
      CreateCounterRegistry(registry);
      for (int g = 0; g < kGroups; ++g) {
         RefVector<Metadata> metadata;
         for (int c = 0; c < kPerGroup; ++c) {
            std::string name = "/Svc/Pool" + std::to_string(g / 10) + "/Shard='" +
                               std::to_string(g % 10) + "'/" + kFields[c];
            names.push_back(name);
            metadata.push_back(new Metadata(name, c % 2 ? Metadata::TYPE_COUNTER : Metadata::TYPE_GAUGE));
         }
         Ref<GroupPublisher> publisher = new GroupValues(g * 100LL);
         Ref<RegistryItem> item;
         registry->RegisterGroup(metadata, publisher.Get(), item);
         items.push_back(item);
      }
   }
};

Population& GetPopulation() {
   static Population* const population = new Population();
   return *population;
}

// Selects one counter in ten: every "Busy".
const char* const kPattern = "shard='[0-9]+'/busy$";

void BM_RegexQueryExecute(benchmark::State& state) {
   Population& population = GetPopulation();
   Ref<Query> query;
   population.registry->CreateRegexQuery(kPattern, false, query);
   QueryResults results;
   for (auto _ : state) {
      results.clear();
      query->Execute(results);
   }
   if (results.size() != kGroups) state.SkipWithError("wrong selection");
   state.counters["selected"] = static_cast<double>(results.size());
}
BENCHMARK(BM_RegexQueryExecute)->Unit(benchmark::kMicrosecond);

void BM_BoostRegexSearchAll(benchmark::State& state) {
   Population& population = GetPopulation();
   const boost::regex regex(kPattern, boost::regex::perl | boost::regex::icase);
   std::vector<const std::string*> matched;
   for (auto _ : state) {
      matched.clear();
      for (const std::string& name : population.names) {
         if (boost::regex_search(name, regex)) matched.push_back(&name);
      }
   }
   if (matched.size() != kGroups) state.SkipWithError("wrong selection");
}
BENCHMARK(BM_BoostRegexSearchAll)->Unit(benchmark::kMicrosecond);

// Not paired: what creating (compiling) the query costs once.
void BM_RegexQueryCreate(benchmark::State& state) {
   Population& population = GetPopulation();
   for (auto _ : state) {
      Ref<Query> query;
      population.registry->CreateRegexQuery(kPattern, false, query);
   }
}
BENCHMARK(BM_RegexQueryCreate)->Unit(benchmark::kMicrosecond);

void BM_PrometheusExport(benchmark::State& state) {
   Population& population = GetPopulation();
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   for (auto _ : state) {
      writer->Reset();
      WritePrometheusText(population.registry.Get(), writer.Get());
   }
   state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * writer->GetLength());
}
BENCHMARK(BM_PrometheusExport)->Unit(benchmark::kMicrosecond);

// The same document written by hand: families and label values known in advance, values
// formatted with snprintf.
void BM_SnprintfExport(benchmark::State& state) {
   Population& population = GetPopulation();
   std::vector<std::string> familyNames;
   for (int pool = 0; pool < kGroups / 10; ++pool) {
      for (int c = 0; c < kPerGroup; ++c) {
         familyNames.push_back("Svc_Pool" + std::to_string(pool) + "_" + kFields[c]);
      }
   }
   std::vector<size_t> order(familyNames.size());
   for (size_t i = 0; i < order.size(); ++i) order[i] = i;
   std::sort(order.begin(), order.end(),
             [&](size_t a, size_t b) { return familyNames[a] < familyNames[b]; });
   std::string text;
   char line[512];
   for (auto _ : state) {
      text.clear();
      for (size_t f : order) {
         int pool = static_cast<int>(f) / kPerGroup, c = static_cast<int>(f) % kPerGroup;
         const char* name = familyNames[f].c_str();
         const char* type = c % 2 ? "counter" : "gauge";
         int n = std::snprintf(line, sizeof line, "# HELP %s %s /Svc/Pool%d/Shard='*'/%s\n# TYPE %s %s\n",
                               name, c % 2 ? "Counter" : "Gauge", pool, kFields[c], name, type);
         text.append(line, static_cast<size_t>(n));
         for (int shard = 0; shard < 10; ++shard) {
            long long value = (pool * 10 + shard) * 100LL + c;
            n = std::snprintf(line, sizeof line, "%s{Shard=\"%d\"} %lld\n", name, shard, value);
            text.append(line, static_cast<size_t>(n));
         }
      }
      benchmark::DoNotOptimize(text.data());
   }
   state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(text.size()));
   // Only a like-for-like comparison counts.
   Ref<StringWriter> ours;
   CreateStringWriter(ours);
   WritePrometheusText(population.registry.Get(), ours.Get());
   if (ours->GetString() != text) state.SkipWithError("the peer writes another document");
}
BENCHMARK(BM_SnprintfExport)->Unit(benchmark::kMicrosecond);

}  // namespace

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(
       argc, argv,
       {{"BM_MeterAccumulatorSample", "BM_MutexSumMinMax"},
        {"BM_MeterAccumulatorSample2Threads/real_time/threads:2", "BM_MutexSumMinMax2Threads/real_time/threads:2"},
        {"BM_RegexQueryExecute", "BM_BoostRegexSearchAll"},
        {"BM_PrometheusExport", "BM_SnprintfExport"}});
}
