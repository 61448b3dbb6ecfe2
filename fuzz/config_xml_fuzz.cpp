// Fuzzes the XML configuration loader. Only FileFormatException may leave the loading of
// fuzzed input; a loaded tree must write (everything the parser accepts is writable) and
// the written text must load again and write to the same text.

#include <cstdint>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "support/configRoundTrip.h"
#include "support/silentSink.h"

using namespace Pelmora;
using namespace Pelmora::Service;

extern "C" int LLVMFuzzerInitialize(int*, char***) {
   PelmoraFuzz::InstallSilentSink();
   return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   // Everything the parser accepts is writable: no refusal is allowed.
   return PelmoraFuzz::CheckConfigRoundTrip(
       data, size, [](std::string& text, Ref<Config>& out) { CreateXmlStringConfig(text, out); },
       false);
}
