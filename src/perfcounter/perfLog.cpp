// The counters' log output: the "perfcounter" logger under the default logger, or the
// report sink while another one stands in for the logging layer's.

#include "src/perfcounter/perfLog.h"

#include "pelmora/service/logMacros.h"
#include "src/core/report.h"
#include "src/service/logDefault.h"

namespace Pelmora::PerfCounter::Internal {

void LogText(int level, const std::string& text) {
   static Service::Logger* const logger = Service::MakeReportLogger("perfcounter");
   auto logLevel = static_cast<Service::Logger::LogLevel>(level);
   if (logger && Service::IsLoggingReportSinkActive()) {
      if (logger->IsLevelWanted(logLevel)) Service::LogInternal(logger, logLevel, "%1", text);
      return;
   }
   Pelmora::Internal::ReportSink& sink = Pelmora::Internal::GetReportSink();
   if (sink.IsLevelEnabled(level)) sink.Log(level, text);
}

}  // namespace Pelmora::PerfCounter::Internal
