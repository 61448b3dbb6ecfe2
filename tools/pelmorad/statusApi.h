#pragma once
// What the status page shows, as JSON: the process and its HTTP service, the thread
// pool's figures, the thread-state board, counters and the tail of the in-memory log
// ring. Each part is read from the library's own registries when asked.

#include <string>
#include <vector>

#include "pelmora/perfCounter/registry.h"
#include "tools/pelmorad/json.h"

namespace Pelmora::Daemon {

struct ProcessFacts {
   std::string name;
   std::string version;
   std::string url;
   std::string stateDir;
   std::string configFile;
   long long startedAtMicroseconds = 0;  // wall clock
   double uptimeSeconds = 0;
   bool stopping = false;
   int connections = 0;
};

void WriteProcess(JsonWriter& json, const ProcessFacts& facts);
// Thread pool settings and per-queue statistics of the process's pool.
void WritePool(JsonWriter& json);
// Every thread with posted states: [{"thread": id, "states": [...]}].
void WriteThreadStates(JsonWriter& json);
// The counters whose names match `pattern` (empty: all), in name order.
// InvalidArgumentException for a pattern that does not compile.
void QueryCounters(const std::string& pattern, PerfCounter::QueryResults& results);
// The same as [{"name", "type", "value"}].
void WriteCounters(JsonWriter& json, const std::string& pattern);
// The last `lines` lines of the in-memory log ring, oldest first.
std::vector<std::string> GetLogTail(int lines);
void WriteLogTail(JsonWriter& json, int lines);

}  // namespace Pelmora::Daemon
