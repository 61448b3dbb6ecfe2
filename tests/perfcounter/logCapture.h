#pragma once
// Captures what the counters log through the report sink while a test runs.

#include <mutex>
#include <string>
#include <vector>

#include "src/core/report.h"

namespace Pelmora::PerfCounter::TestSupport {

class LogCapture : public Pelmora::Internal::ReportSink {
public:
   LogCapture() { Pelmora::Internal::SetReportSink(this); }
   ~LogCapture() { Pelmora::Internal::SetReportSink(nullptr); }

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

private:
   std::mutex _mutex;
   std::vector<std::string> _lines;
};

}  // namespace Pelmora::PerfCounter::TestSupport
