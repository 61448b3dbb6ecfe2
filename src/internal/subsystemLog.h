#pragma once
// For the layers below the logger that reach it through the report hook (XML, counters).

#include <string>

#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/service/logger.h"

namespace Pelmora::Service {

// A child of the default logger for `subsystem`, made once by the caller and kept until
// exit; makes the default logger (and installs its report sink) on first use. Null on
// failure; never throws.
Logger* MakeReportLogger(const char* subsystem) noexcept;
// Whether the report sink installed is the logging layer's; false while another stands
// in (a test's capture), whose reports then go to that sink instead.
bool IsLoggingReportSinkActive() noexcept;

// A layer's report at `level` (a logger level bit): through `logger` while the logging
// layer's sink is installed and `logger` exists, else through the sink standing in.
// Neither throws.
bool IsReportWanted(Logger* logger, int level) noexcept;
void WriteReport(Logger* logger, int level, const std::string& text) noexcept;

// Formats and writes a report only when it is wanted; a failure to format loses the
// message and nothing else.
template <class... Args>
void Report(Logger* logger, int level, const char* format, const Args&... args) noexcept {
   if (!IsReportWanted(logger, level)) return;
   try {
      if constexpr (sizeof...(Args) == 0) {
         WriteReport(logger, level, format);
      } else {
         WriteReport(logger, level, MessageFormatter::ASPrint(format, args...));
      }
   } catch (...) {
   }
}

}  // namespace Pelmora::Service
