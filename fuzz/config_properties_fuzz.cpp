// Fuzzes the properties reader with the configuration round trip; a tree the syntax
// cannot hold may be refused on writing.

#include "pelmora/service/config.h"
#include "src/config/configBase.h"
#include "support/configRoundTrip.h"

using namespace Pelmora;
using namespace Pelmora::Service;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   return PelmoraFuzz::CheckConfigRoundTrip(
       data, size,
       [](std::string& text, Ref<Config>& out) {
          Ref<ConfigBackend> backend;
          CreateStringConfigBackend(text, backend);
          Ref<ConfigBase> config;
          CreatePropertiesConfig(backend.Get(), config);
          config->Load();
          out = config.Get();
       },
       true);
}
