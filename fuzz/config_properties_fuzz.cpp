// Fuzzes the properties reader, with the flat reader's round-trip checks: what reads must
// write back or be refused with InvalidArgumentException, and what was written must read
// again to the same text. Only FileFormatException may leave the reading of fuzzed input.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "src/service/configBase.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

Ref<ConfigBase> Properties(std::string& text) {
   Ref<ConfigBackend> backend;
   CreateStringConfigBackend(text, backend);
   Ref<ConfigBase> config;
   CreatePropertiesConfig(backend.Get(), config);
   return config;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   std::string text(reinterpret_cast<const char*>(data), size);
   Ref<ConfigBase> config = Properties(text);
   try {
      config->Load();
   } catch (const FileFormatException&) {
      return 0;
   }
   try {
      config->Flush();
   } catch (const InvalidArgumentException&) {
      return 0;
   }
   std::string written = text;
   Ref<ConfigBase> copy = Properties(written);
   try {
      copy->Load();
   } catch (const FileFormatException& e) {
      std::fprintf(stderr, "written text does not read (%s):\n%s\n", e.what(), written.c_str());
      std::abort();
   }
   copy->Flush();
   if (written != text) {
      std::fprintf(stderr, "second write differs:\n%s\n---\n%s\n", text.c_str(), written.c_str());
      std::abort();
   }
   return 0;
}
