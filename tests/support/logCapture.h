#pragma once
// Captures what the layers below the logger report through the report sink, so tests can
// check logged texts without a logger. Thread-safe.

#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "src/internal/report.h"

namespace Pelmora::TestSupport {

class LogCapture : public Internal::ReportSink {
public:
   bool IsLevelEnabled(int) override { return true; }
   void Log(int level, const std::string& text) override {
      std::lock_guard<std::mutex> lock(_mutex);
      _lines.push_back(std::to_string(level) + " " + text);
   }
   void LogMemoryBuffer(int, const std::string&, bool) override {}
   void Flush() override {}

   // "level text" per line.
   std::vector<std::string> Lines() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _lines;
   }
   // As Lines, forgetting them.
   std::vector<std::string> Take() {
      std::lock_guard<std::mutex> lock(_mutex);
      return std::exchange(_lines, {});
   }

private:
   std::mutex _mutex;
   std::vector<std::string> _lines;
};

// Installed for its lifetime. Only for tests whose threads stop logging before it goes;
// otherwise install a LogCapture that lives until exit.
class ScopedLogCapture : public LogCapture {
public:
   ScopedLogCapture() { Internal::SetReportSink(this); }
   ~ScopedLogCapture() { Internal::SetReportSink(nullptr); }
};

}  // namespace Pelmora::TestSupport
