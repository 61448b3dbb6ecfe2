// Fuzzes the XML configuration loader. Only FileFormatException may leave the loading of
// fuzzed input; a loaded tree must write (everything the parser accepts is writable) and
// the written text must load again and write to the same text.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "src/core/report.h"

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
   std::string text(reinterpret_cast<const char*>(data), size);
   Ref<Config> config;
   try {
      CreateXmlStringConfig(text, config);
   } catch (const FileFormatException&) {
      return 0;
   }
   try {
      config->Flush();
   } catch (const InvalidArgumentException& e) {
      std::fprintf(stderr, "a loaded tree does not write (%s)\n", e.what());
      std::abort();
   }
   std::string written = text;
   Ref<Config> copy;
   try {
      CreateXmlStringConfig(written, copy);
   } catch (const FileFormatException& e) {
      std::fprintf(stderr, "written text does not load (%s):\n%s\n", e.what(), written.c_str());
      std::abort();
   }
   copy->Flush();
   if (written != text) {
      std::fprintf(stderr, "second write differs:\n%s\n---\n%s\n", text.c_str(), written.c_str());
      std::abort();
   }
   return 0;
}
