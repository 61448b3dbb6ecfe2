// Fuzzes the XML configuration loader. Only FileFormatException may leave the loading of
// fuzzed input; a loaded tree must write (everything the parser accepts is writable) and
// the written text must load again and write to the same text.

#include <cstdint>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "src/core/report.h"
#include "support/configRoundTrip.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

// Refused entities log a line per input; the fuzzer needs none of them.
class SilentSink : public Internal::ReportSink {
public:
   bool IsLevelEnabled(int) override { return false; }
   void Log(int, const std::string&) override {}
   void LogMemoryBuffer(int, const std::string&, bool) override {}
   void Flush() override {}
};

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
   static SilentSink sink;
   Internal::SetReportSink(&sink);
   return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   // Everything the parser accepts is writable: no refusal is allowed.
   return PelmoraFuzz::CheckConfigRoundTrip(
       data, size, [](std::string& text, Ref<Config>& out) { CreateXmlStringConfig(text, out); },
       false);
}
