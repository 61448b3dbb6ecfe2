#include "tools/pelmorad/statusApi.h"

#include <list>
#include <map>

#include "pelmora/io/writers.h"
#include "pelmora/perfCounter/lwStats.h"
#include "pelmora/perfCounter/registry.h"
#include "pelmora/service/app.h"
#include "pelmora/service/logger.h"
#include "pelmora/system/threadPool.h"
#include "pelmora/system/threadState.h"

namespace Pelmora::Daemon {

void WriteProcess(JsonWriter& json, const ProcessFacts& facts) {
   json.Key("name").String(facts.name);
   json.Key("version").String(facts.version);
   json.Key("pid").Number(static_cast<long long>(getpid()));
   json.Key("url").String(facts.url);
   json.Key("stateDir").String(facts.stateDir);
   json.Key("configFile").String(facts.configFile);
   json.Key("startedAt").Number(facts.startedAtMicroseconds / 1000);
   json.Key("uptimeSeconds").Number(facts.uptimeSeconds);
   json.Key("state").String(facts.stopping ? "stopping" : "running");
   json.Key("connections").Number(static_cast<long long>(facts.connections));
}

void WritePool(JsonWriter& json) {
   json.BeginObject();
   System::ThreadPool* pool = System::GetThreadPool();
   if (pool) {
      System::ThreadPoolConfig config;
      pool->GetConfig(config);
      json.Key("minThreads").Number(static_cast<long long>(config.minThreads));
      json.Key("maxThreads").Number(static_cast<long long>(config.maxThreads));
      json.Key("reservationRatio").Number(static_cast<long long>(config.reservationRatio));
      json.Key("shuttingDown").Bool(pool->IsShuttingDown());
      Ref<PerfCounter::LwStatsBuilder> builder;
      PerfCounter::CreateLwStatsBuilder(builder);
      pool->GetStats(*builder);
      std::vector<std::pair<Ref<PerfCounter::LwAccumulator>, std::string>> entries;
      builder->GetEntries(entries);
      json.Key("stats").BeginArray();
      for (const auto& [accumulator, key] : entries) {
         json.BeginObject();
         json.Key("key").String(key);
         json.Key("value").String(accumulator->Describe());
         json.EndObject();
      }
      json.EndArray();
   }
   json.EndObject();
}

void WriteThreadStates(JsonWriter& json) {
   std::map<long long, std::list<std::string>> states;
   System::CopyThreadStates(states, 3);
   json.BeginArray();
   for (const auto& [thread, messages] : states) {
      if (messages.empty()) continue;
      json.BeginObject();
      json.Key("thread").Number(thread);
      json.Key("states").BeginArray();
      for (const std::string& message : messages) json.String(message);
      json.EndArray();
      json.EndObject();
   }
   json.EndArray();
}

void QueryCounters(const std::string& pattern, PerfCounter::QueryResults& results) {
   PerfCounter::Registry* registry = PerfCounter::GetCounterRegistry();
   if (pattern.empty()) {
      registry->CollectAll(results);
   } else {
      Ref<PerfCounter::Query> query;
      registry->CreateRegexQuery(pattern, false, query);
      query->SetQueryOption(PerfCounter::QUERY_OPTION_SORT_BY_NAME, true);
      query->Execute(results);
      query->Uninitialize();
   }
}

void WriteCounters(JsonWriter& json, const std::string& pattern) {
   PerfCounter::QueryResults results;
   QueryCounters(pattern, results);
   json.BeginArray();
   for (const PerfCounter::QueryResult& result : results) {
      json.BeginObject();
      json.Key("name").String(result.metadata->GetName());
      json.Key("type").String(PerfCounter::Metadata::TypeName(result.metadata->GetType()));
      json.Key("value").Number(result.value.Get());
      json.EndObject();
   }
   json.EndArray();
}

std::vector<std::string> GetLogTail(int lines) {
   std::vector<std::string> tail;
   if (lines <= 0) return tail;
   Service::LogManager* manager = Service::GetDefaultLogManager();
   Ref<Service::LogOutput> memory, output;
   manager->FindLogOutput(Service::LogManager::kMemoryOutput, memory);
   manager->FindLogOutput(Service::LogManager::kDefaultOutput, output);
   if (!memory || !output) return tail;
   Ref<Service::LogWriter> ring;
   memory->GetWriter(Service::LogManager::kMemoryOutput, ring);
   auto* text = ring ? dynamic_cast<RingStringWriter*>(ring->GetTarget()) : nullptr;
   if (!text) return tail;
   std::string all;
   {
      // Lines reach the ring under the default output's write lock: the read lock keeps
      // them out while the ring is copied.
      output->RecursiveReadLock();
      try {
         all = text->GetText();
      } catch (...) {
         output->ReadUnlock();
         throw;
      }
      output->ReadUnlock();
   }
   // A full ring has overwritten the start of its oldest line.
   if (all.size() + 64 >= static_cast<size_t>(text->GetRingSize())) {
      size_t end = all.find('\n');
      all.erase(0, end == std::string::npos ? all.size() : end + 1);
   }
   size_t end = all.size();
   while (end > 0 && static_cast<int>(tail.size()) < lines) {
      if (all[end - 1] == '\n') --end;
      size_t start = all.rfind('\n', end == 0 ? 0 : end - 1);
      start = start == std::string::npos ? 0 : start + 1;
      if (end > start) tail.push_back(all.substr(start, end - start));
      end = start;
   }
   return {tail.rbegin(), tail.rend()};
}

void WriteLogTail(JsonWriter& json, int lines) {
   json.BeginArray();
   for (const std::string& line : GetLogTail(lines)) json.String(line);
   json.EndArray();
}

}  // namespace Pelmora::Daemon
