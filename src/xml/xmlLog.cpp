// The XML layer's log output: the "xml" logger under the default logger, or the report
// sink while another one stands in for the logging layer's.

#include "src/xml/xmlLog.h"

#include "pelmora/service/logMacros.h"
#include "src/core/report.h"
#include "src/service/logDefault.h"

namespace Pelmora::Xml {

namespace {

Service::Logger* XmlLogger() noexcept {
   static Service::Logger* const logger = Service::MakeReportLogger("xml");
   return Service::IsLoggingReportSinkActive() ? logger : nullptr;
}

}  // namespace

bool IsXmlLogEnabled(int level) noexcept {
   try {
      if (Service::Logger* logger = XmlLogger()) {
         return logger->IsLevelWanted(static_cast<Service::Logger::LogLevel>(level));
      }
      return Internal::GetReportSink().IsLevelEnabled(level);
   } catch (...) {
      return false;
   }
}

void WriteXmlLog(int level, const std::string& text) noexcept {
   try {
      if (Service::Logger* logger = XmlLogger()) {
         Service::LogInternal(logger, static_cast<Service::Logger::LogLevel>(level), "%1", text);
         return;
      }
      Internal::GetReportSink().Log(level, text);
   } catch (...) {
      // A failing sink has nowhere to report to.
   }
}

}  // namespace Pelmora::Xml
