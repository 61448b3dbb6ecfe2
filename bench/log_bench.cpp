// Logging: a call below the logger's level, and a short line to a file (and to a file
// and the memory ring, as in a daemon) with one and two threads, against spdlog's
// synchronous file sink and against the floor, a preformatted line written with fwrite
// under a mutex. The floor's default stdio buffer makes far more write(2) calls than our
// buffered file writer; the matched floor gives its FILE our buffer size, so that both
// sides pay for about as many. Each file benchmark also reports the process's CPU time
// per line ("proc_cpu_ns"): our flusher thread's share counts. Our file rolls over every
// 64 MiB, as a daemon's would; the floor's file never does, so each roll's cost is ours
// alone.

#include <spdlog/sinks/basic_file_sink.h>
#include <spdlog/spdlog.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <string>

#include "pelmora/service.h"
#include "support/ratioMain.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

const std::string& Dir() {
   static const std::string dir = [] {
      char pattern[] = "/tmp/pelmora-log-bench-XXXXXX";
      return std::string(mkdtemp(pattern));
   }();
   return dir;
}

// "info" to a file rolling over every 64 MiB; with `ring`, to the 256 KiB memory ring as
// well, as in a daemon. Without it nothing goes to memory: the disabled call costs the
// level test alone.
Logger* MakeFileLogger(const std::string& file, bool ring) {
   Ref<Logger> logger;
   CreateLogger(nullptr, "bench", "info", nullptr, logger);
   logger->SetMemLevelByName(ring ? "info" : "none");
   LogFileOptions options;
   options.path = Dir() + "/" + file;
   options.maxFileSize = 64ll << 20;
   options.maxFileNum = 2;
   Ref<LogWriter> writer;
   CreateFileLogWriter("file", options, writer);
   logger->GetLogOutput()->AddWriter("file", writer.Get());
   if (ring) {
      Ref<LogWriter> memory;
      CreateMemLogWriter(LogManager::kMemoryOutput, 256, "trivia", memory);
      logger->GetLogOutput()->AddWriter(LogManager::kMemoryOutput, memory.Get());
   }
   return logger.Release();
}

Logger* PelmoraFileLogger() {
   static Logger* const logger = MakeFileLogger("pelmora.log", false);
   return logger;
}

Logger* PelmoraFileAndRingLogger() {
   static Logger* const logger = MakeFileLogger("pelmora-ring.log", true);
   return logger;
}

spdlog::logger* SpdlogFileLogger() {
   static spdlog::logger* const logger = [] {
      auto sink = std::make_shared<spdlog::sinks::basic_file_sink_mt>(Dir() + "/spdlog.log", true);
      auto* made = new spdlog::logger("bench", sink);
      made->set_level(spdlog::level::info);
      return made;
   }();
   return logger;
}

struct FloorFile {
   std::mutex mutex;
   FILE* file;
   // `bufferSize` 0: the C library's default buffer.
   FloorFile(const char* name, size_t bufferSize)
      : file(fopen((Dir() + "/" + name).c_str(), "we")) {
      if (bufferSize > 0) setvbuf(file, nullptr, _IOFBF, bufferSize);
   }
};
FloorFile& Floor() {
   static FloorFile* const floor = new FloorFile("floor.log", 0);
   return *floor;
}
FloorFile& MatchedFloor() {
   static FloorFile* const floor =
       new FloorFile("floor-matched.log", static_cast<size_t>(LogFileOptions().bufferSize));
   return *floor;
}

// User and system CPU time of the whole process, read by thread 0 before its measured
// loop and after it. The loop's end waits for every thread; what the others do before
// their loops start is next to nothing.
class ProcessCpuPerLine {
public:
   explicit ProcessCpuPerLine(benchmark::State& state) : _state(state) {
      if (_state.thread_index() == 0) _start = Now();
   }
   // After the loop. Only thread 0 sets the counter, so the sum over threads is its value.
   void Report() {
      if (_state.thread_index() != 0) return;
      double lines = static_cast<double>(_state.iterations()) * _state.threads();
      if (lines > 0) _state.counters["proc_cpu_ns"] = (Now() - _start) / lines;
   }

private:
   static double Now() {
      struct rusage usage;
      getrusage(RUSAGE_SELF, &usage);
      auto ns = [](const timeval& t) { return t.tv_sec * 1e9 + t.tv_usec * 1e3; };
      return ns(usage.ru_utime) + ns(usage.ru_stime);
   }

   benchmark::State& _state;
   double _start = 0;
};

const std::string kClient = "10.1.2.3:40112";

void BM_PelmoraDisabled(benchmark::State& state) {
   Logger* logger = PelmoraFileLogger();
   int i = 0;
   for (auto _ : state) {
      PELMORA_LOG_VERBOSE(logger, "request %1 from %2", ++i, kClient);
      benchmark::ClobberMemory();
   }
}
BENCHMARK(BM_PelmoraDisabled);

void BM_SpdlogDisabled(benchmark::State& state) {
   spdlog::logger* logger = SpdlogFileLogger();
   int i = 0;
   for (auto _ : state) {
      logger->debug("request {} from {}", ++i, kClient);
      benchmark::ClobberMemory();
   }
}
BENCHMARK(BM_SpdlogDisabled);

// About 100 bytes with either prefix.
void PelmoraLines(benchmark::State& state, Logger* logger) {
   int i = 0;
   ProcessCpuPerLine cpu(state);
   for (auto _ : state) {
      PELMORA_LOG_INFO(logger, "request %1 served for client %2 in time", ++i, kClient);
   }
   cpu.Report();
   state.SetItemsProcessed(state.iterations());
}

void BM_PelmoraFile(benchmark::State& state) { PelmoraLines(state, PelmoraFileLogger()); }
BENCHMARK(BM_PelmoraFile)->Threads(1)->Threads(2)->UseRealTime();

void BM_PelmoraFileAndRing(benchmark::State& state) {
   PelmoraLines(state, PelmoraFileAndRingLogger());
}
BENCHMARK(BM_PelmoraFileAndRing)->Threads(1)->Threads(2)->UseRealTime();

void BM_SpdlogFile(benchmark::State& state) {
   spdlog::logger* logger = SpdlogFileLogger();
   int i = 0;
   ProcessCpuPerLine cpu(state);
   for (auto _ : state) {
      logger->info("request {} served for client {} in time", ++i, kClient);
   }
   cpu.Report();
   state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_SpdlogFile)->Threads(1)->Threads(2)->UseRealTime();

void FloorLines(benchmark::State& state, FloorFile& floor) {
   const std::string line =
       "2026-11-23T10:57:52.123+00:00 [0x1a2b info 'bench'] request 12345 served for client "
       "10.1.2.3:40112 in time\n";
   ProcessCpuPerLine cpu(state);
   for (auto _ : state) {
      std::lock_guard<std::mutex> lock(floor.mutex);
      fwrite(line.data(), 1, line.size(), floor.file);
   }
   cpu.Report();
   state.SetItemsProcessed(state.iterations());
}

void BM_FloorFwrite(benchmark::State& state) { FloorLines(state, Floor()); }
BENCHMARK(BM_FloorFwrite)->Threads(1)->Threads(2)->UseRealTime();

void BM_FloorFwriteMatched(benchmark::State& state) { FloorLines(state, MatchedFloor()); }
BENCHMARK(BM_FloorFwriteMatched)->Threads(1)->Threads(2)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
   int result = PelmoraBench::RunWithRatios(
       argc, argv,
       {{"BM_PelmoraDisabled", "BM_SpdlogDisabled"},
        {"BM_PelmoraFile/real_time/threads:1", "BM_SpdlogFile/real_time/threads:1"},
        {"BM_PelmoraFile/real_time/threads:2", "BM_SpdlogFile/real_time/threads:2"},
        {"BM_PelmoraFile/real_time/threads:1", "BM_FloorFwrite/real_time/threads:1"},
        {"BM_PelmoraFile/real_time/threads:2", "BM_FloorFwrite/real_time/threads:2"},
        {"BM_PelmoraFileAndRing/real_time/threads:1", "BM_FloorFwrite/real_time/threads:1"},
        {"BM_PelmoraFileAndRing/real_time/threads:2", "BM_FloorFwrite/real_time/threads:2"},
        {"BM_PelmoraFile/real_time/threads:1", "BM_FloorFwriteMatched/real_time/threads:1"},
        {"BM_PelmoraFile/real_time/threads:2", "BM_FloorFwriteMatched/real_time/threads:2"}},
       {"proc_cpu_ns"});
   std::filesystem::remove_all(Dir());
   return result;
}
