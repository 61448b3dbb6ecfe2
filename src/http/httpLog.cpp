#include "src/http/httpLog.h"

namespace Pelmora::Http {

Service::Logger* GetHttpLogger() {
   // Never destroyed: completions on pool threads may log while the process exits.
   static Service::Logger* const logger = [] {
      Ref<Service::Logger> child;
      Service::GetDefaultLogger()->CreateLogger("http", child);
      return child.Release();
   }();
   return logger;
}

}  // namespace Pelmora::Http
