// Fuzzes the flat reader with the configuration round trip. A tree with a line break in a
// value may be refused on writing: the syntax has no escape for it.

#include "pelmora/service/config.h"
#include "support/configRoundTrip.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   return PelmoraFuzz::CheckConfigRoundTrip(
       data, size,
       [](std::string& text, Pelmora::Ref<Pelmora::Service::Config>& out) {
          Pelmora::Service::CreateFlatStringConfig(text, out);
       },
       true);
}
