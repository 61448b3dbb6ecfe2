#pragma once
// Where exception dumps and panic reports go. The core writes them to standard error;
// the logging layer installs a sink at start-up that writes through the default logger
// and its in-memory output. Levels use the logger's bit values.

#include <chrono>
#include <string>

namespace Pelmora::Internal {

constexpr int kReportPanicLevel = 2;
constexpr int kReportErrorLevel = 4;

class ReportSink {
public:
   // Whether `level` is enabled in the default logger's log or memory mask.
   virtual bool IsLevelEnabled(int level) = 0;
   virtual void Log(int level, const std::string& text) = 0;
   // Writes out the in-memory buffer of recent lines with `message`; `detach` takes the
   // memory output away first (a panic report, whose process is about to die).
   virtual void LogMemoryBuffer(int level, const std::string& message, bool detach) = 0;
   virtual void Flush() = 0;

protected:
   ~ReportSink() = default;
};

// `sink` must stay alive until exit; null restores the standard-error sink.
void SetReportSink(ReportSink* sink);
// Installs `sink` unless another one is installed; true when it is now the sink.
bool SetReportSinkIfUnset(ReportSink* sink);
ReportSink& GetReportSink();

// How long a panicking process waits for its report child to log before it kills the
// child and writes the report to standard error itself. 30 s unless changed.
void SetPanicReportTimeout(std::chrono::milliseconds limit);

// True in a panic's report child. It runs the panicking thread alone: a lock another
// thread held at fork time is never given back there, so the logging locks take such a
// lock over instead of waiting for it.
bool InReportChild();

}  // namespace Pelmora::Internal
