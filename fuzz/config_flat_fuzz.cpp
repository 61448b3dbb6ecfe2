// Fuzzes the flat reader. Text that reads must write back (or be refused as unwritable
// with InvalidArgumentException), and what was written must read again to the same text.
// Only FileFormatException may leave the reading of fuzzed input.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"

using namespace Pelmora;
using namespace Pelmora::Service;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   std::string text(reinterpret_cast<const char*>(data), size);
   Ref<Config> config;
   try {
      CreateFlatStringConfig(text, config);
   } catch (const FileFormatException&) {
      return 0;
   }
   std::string written;
   Ref<Config> copy;
   CreateFlatStringConfig(written, copy);  // empty text: an empty configuration
   // Write the parsed tree out through the original configuration's own text.
   try {
      config->Flush();
   } catch (const InvalidArgumentException&) {
      return 0;
   }
   written = text;
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
