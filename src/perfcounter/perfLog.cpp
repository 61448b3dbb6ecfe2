#include "src/perfcounter/perfLog.h"

#include "src/core/report.h"

namespace Pelmora::PerfCounter::Internal {

void LogText(int level, const std::string& text) {
   Pelmora::Internal::ReportSink& sink = Pelmora::Internal::GetReportSink();
   if (sink.IsLevelEnabled(level)) sink.Log(level, text);
}

}  // namespace Pelmora::PerfCounter::Internal
