#pragma once
// A benchmark main that starts and joins one thread before measuring (until a process
// has a second thread, the C and C++ runtimes skip atomic instructions and locks look
// cheaper than they are), runs every benchmark, then prints "ours vs peer" ratios.

#include <benchmark/benchmark.h>

#include <cstdio>
#include <map>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace PelmoraBench {

class RatioReporter : public benchmark::ConsoleReporter {
public:
   void ReportRuns(const std::vector<Run>& runs) override {
      for (const Run& run : runs) {
         if (run.run_type != Run::RT_Iteration) continue;
         _nanos[run.benchmark_name()] = run.GetAdjustedRealTime();
         for (const auto& [name, counter] : run.counters) {
            _counters[name][run.benchmark_name()] = counter.value;
         }
      }
      ConsoleReporter::ReportRuns(runs);
   }
   // Prints time(ours) / time(peer) for each pair: below 1 means ours is faster.
   void PrintRatios(const std::vector<std::pair<std::string, std::string>>& pairs) {
      std::printf("\nratios (time of ours / time of peer; below 1.00 is faster):\n");
      for (const auto& [ours, peer] : pairs) {
         auto a = _nanos.find(ours);
         auto b = _nanos.find(peer);
         if (a == _nanos.end() || b == _nanos.end() || b->second == 0) continue;
         std::printf("  %-40s vs %-32s %6.2fx\n", ours.c_str(), peer.c_str(), a->second / b->second);
      }
   }

   // As PrintRatios, for a counter the benchmarks set (a cost per item: below 1 is cheaper).
   void PrintCounterRatios(const std::string& counter,
                           const std::vector<std::pair<std::string, std::string>>& pairs) {
      const std::map<std::string, double>& values = _counters[counter];
      std::printf("\nratios of %s (ours / peer; below 1.00 is cheaper):\n", counter.c_str());
      for (const auto& [ours, peer] : pairs) {
         auto a = values.find(ours);
         auto b = values.find(peer);
         if (a == values.end() || b == values.end() || b->second == 0) continue;
         std::printf("  %-40s vs %-32s %6.2fx\n", ours.c_str(), peer.c_str(), a->second / b->second);
      }
   }

private:
   std::map<std::string, double> _nanos;
   std::map<std::string, std::map<std::string, double>> _counters;
};

inline int RunWithRatios(int argc, char** argv,
                         const std::vector<std::pair<std::string, std::string>>& pairs) {
   std::thread([] {}).join();
   benchmark::Initialize(&argc, argv);
   RatioReporter reporter;
   benchmark::RunSpecifiedBenchmarks(&reporter);
   reporter.PrintRatios(pairs);
   benchmark::Shutdown();
   return 0;
}

// As above, and the same pairs compared by each of `counters` as well.
inline int RunWithRatios(int argc, char** argv,
                         const std::vector<std::pair<std::string, std::string>>& pairs,
                         const std::vector<std::string>& counters) {
   std::thread([] {}).join();
   benchmark::Initialize(&argc, argv);
   RatioReporter reporter;
   benchmark::RunSpecifiedBenchmarks(&reporter);
   reporter.PrintRatios(pairs);
   for (const std::string& counter : counters) reporter.PrintCounterRatios(counter, pairs);
   benchmark::Shutdown();
   return 0;
}

}  // namespace PelmoraBench
