// The standard-error report sink used until logging installs its own.

#include "src/internal/report.h"

#include <unistd.h>

#include <atomic>
#include <cerrno>

namespace Pelmora::Internal {

namespace {

class StderrSink : public ReportSink {
public:
   bool IsLevelEnabled(int) override { return true; }
   void Log(int, const std::string& text) override {
      WriteAll(text.data(), text.size());
      WriteAll("\n", 1);
   }
   void LogMemoryBuffer(int, const std::string&, bool) override {}  // no memory output here
   void Flush() override {}

private:
   // Plain write(2): this runs in panicking and forked processes.
   static void WriteAll(const char* data, size_t size) {
      while (size > 0) {
         ssize_t n = write(STDERR_FILENO, data, size);
         if (n < 0 && errno == EINTR) continue;
         if (n <= 0) return;
         data += n;
         size -= static_cast<size_t>(n);
      }
   }
};

StderrSink g_stderrSink;
std::atomic<ReportSink*> g_sink{nullptr};

}  // namespace

void SetReportSink(ReportSink* sink) { g_sink.store(sink, std::memory_order_release); }

bool SetReportSinkIfUnset(ReportSink* sink) {
   ReportSink* expected = nullptr;
   return g_sink.compare_exchange_strong(expected, sink, std::memory_order_acq_rel) ||
          expected == sink;
}

ReportSink& GetReportSink() {
   ReportSink* sink = g_sink.load(std::memory_order_acquire);
   return sink ? *sink : g_stderrSink;
}

}  // namespace Pelmora::Internal
