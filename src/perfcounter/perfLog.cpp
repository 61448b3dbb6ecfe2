// The counters' log output: the "perfcounter" logger under the default logger, or the
// report sink while another one stands in for the logging layer's.

#include "src/perfcounter/perfLog.h"

#include "src/internal/subsystemLog.h"

namespace Pelmora::PerfCounter::Internal {

void LogText(int level, const std::string& text) {
   static Service::Logger* const logger = Service::MakeReportLogger("perfcounter");
   if (Service::IsReportWanted(logger, level)) Service::WriteReport(logger, level, text);
}

}  // namespace Pelmora::PerfCounter::Internal
