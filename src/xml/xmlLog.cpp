// The XML layer's log output: the report sink, until the logger takes its place.

#include "src/xml/xmlLog.h"

#include "src/core/report.h"

namespace Pelmora::Xml {

bool IsXmlLogEnabled(int level) noexcept {
   try {
      return Internal::GetReportSink().IsLevelEnabled(level);
   } catch (...) {
      return false;
   }
}

void WriteXmlLog(int level, const std::string& text) noexcept {
   try {
      Internal::GetReportSink().Log(level, text);
   } catch (...) {
      // A failing sink has nowhere to report to.
   }
}

}  // namespace Pelmora::Xml
