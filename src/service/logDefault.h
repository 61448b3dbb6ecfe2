#pragma once
// For the layers below the logger that reach it through the report hook (XML, counters).

#include "pelmora/service/logger.h"

namespace Pelmora::Service {

// A child of the default logger for `subsystem`, made once by the caller and kept until
// exit; makes the default logger (and installs its report sink) on first use. Null on
// failure; never throws.
Logger* MakeReportLogger(const char* subsystem) noexcept;
// Whether the report sink installed is the logging layer's; false while another stands
// in (a test's capture), whose reports then go to that sink instead.
bool IsLoggingReportSinkActive() noexcept;

}  // namespace Pelmora::Service
