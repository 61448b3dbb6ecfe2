#pragma once
// Loggers over a writer that keeps every piece, and readers of the lines they write.

#include <gtest/gtest.h>
#include <unistd.h>
#include <atomic>
#include <fstream>
#include <regex>
#include <string>
#include <thread>
#include <vector>
#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/writers.h"
#include "pelmora/object/ref.h"
#include "pelmora/service.h"
#include "tests/support/pieceWriter.h"
#include "tests/support/watchdog.h"
extern "C" void __cxa_finalize(void* dso);

namespace Pelmora::TestSupport {

using namespace Pelmora;
using namespace Pelmora::Service;

// Counts how often it is formatted; may log while being formatted.
class CountingObject : public ObjectImpl {
public:
   std::string ToString() const override {
      ++calls;
      if (nested) PELMORA_LOG_ERROR(nested, "inner %1", 7);
      return "counted";
   }
   mutable std::atomic<int> calls{0};
   Logger* nested = nullptr;
};

inline std::vector<std::string> SplitLines(const std::string& text) {
   std::vector<std::string> lines;
   for (size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos; start = end + 1)
      lines.push_back(text.substr(start, end - start));
   return lines;
}

struct TestLogger {
   explicit TestLogger(const std::string& level = "info") : target(new PieceWriter()) {
      CreateLogger(target.Get(), "sub", level, nullptr, logger);
   }
   std::vector<std::string> Lines() const { return SplitLines(target->Text()); }
   // Adds a memory ring of `size` to the logger's output (under `name`) and the memory output.
   void AddRing(int size, const std::string& name) {
      Ref<LogWriter> ring;
      CreateMemLogWriter("memory", size, "trivia", ring);
      Ref<LogOutput> memory;
      logger->GetLogManager()->GetOrCreateLogOutput("memory", memory);
      memory->AddWriter("memory", ring.Get());
      logger->GetLogOutput()->AddWriter(name, ring.Get());
   }
   Ref<PieceWriter> target;
   Ref<Logger> logger;
};

inline const std::string kPrefix =
    "\\d{4}-\\d{2}-\\d{2}T\\d{2}:\\d{2}:\\d{2}\\.\\d{3}[+-]\\d{2}:\\d{2} \\[0x[0-9a-f]+ ";

inline bool Matches(const std::string& line, const std::string& rest) {
   return std::regex_match(line, std::regex(kPrefix + rest));
}

// Whether thread `tid` of this process is asleep in the kernel (waiting on a lock).
inline bool IsAsleep(pid_t tid) {
   std::ifstream in("/proc/self/task/" + std::to_string(tid) + "/stat");
   std::string stat((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
   size_t end = stat.rfind(')');  // the state follows the command name
   return end != std::string::npos && end + 2 < stat.size() && stat[end + 2] == 'S';
}

}  // namespace Pelmora::TestSupport
