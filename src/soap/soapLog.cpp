#include "src/soap/soapLog.h"

namespace Pelmora::Soap {

Service::Logger* GetSoapLogger() {
   // Never destroyed: completions on pool threads may log while the process exits.
   static Service::Logger* const logger = [] {
      Ref<Service::Logger> child;
      Service::GetDefaultLogger()->CreateLogger("soap", child);
      return child.Release();
   }();
   return logger;
}

}  // namespace Pelmora::Soap
