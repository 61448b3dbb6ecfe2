#pragma once
// The one place where the counters write a log line; it goes to the process's report
// sink, which the logging layer points at the default logger.

#include <string>

namespace Pelmora::PerfCounter::Internal {

constexpr int kLogError = 4;
constexpr int kLogWarning = 8;

void LogText(int level, const std::string& text);

}  // namespace Pelmora::PerfCounter::Internal
