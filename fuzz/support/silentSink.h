#pragma once
// Refused entities and limits log a line per input; a fuzzer needs none of them. Install
// once, from LLVMFuzzerInitialize.

#include <string>

#include "src/internal/report.h"

namespace PelmoraFuzz {

class SilentSink : public Pelmora::Internal::ReportSink {
public:
   bool IsLevelEnabled(int) override { return false; }
   void Log(int, const std::string&) override {}
   void LogMemoryBuffer(int, const std::string&, bool) override {}
   void Flush() override {}
};

inline void InstallSilentSink() {
   static SilentSink sink;
   Pelmora::Internal::SetReportSink(&sink);
}

}  // namespace PelmoraFuzz
