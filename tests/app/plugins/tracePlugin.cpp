// A plug-in that appends "<name>:<event>" lines to the file named by
// $PELMORA_TEST_PLUGIN_TRACE, so a test sees the order of calls across plug-ins.

#include <cstdio>
#include <cstdlib>

#include "pelmora/service/plugin.h"

namespace {

void Trace(const char* event) {
   const char* path = getenv("PELMORA_TEST_PLUGIN_TRACE");
   if (!path) return;
   if (FILE* file = fopen(path, "a")) {
      fprintf(file, "%s:%s\n", PELMORA_TEST_PLUGIN_NAME, event);
      fclose(file);
   }
}

class TracePlugin : public virtual Pelmora::Service::Plugin, public Pelmora::ObjectImpl {
public:
   void Init() override { Trace("init"); }
   void Start() override { Trace("start"); }
   void Shutdown() override { Trace("shutdown"); }
   ~TracePlugin() override { Trace("released"); }
};

}  // namespace

extern "C" __attribute__((visibility("default"))) Pelmora::Service::Plugin*
PELMORA_TEST_PLUGIN_ENTRY() {
   Trace("entry");
   return new TracePlugin();
}
