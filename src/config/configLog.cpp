// The configuration's logger: a child of the default logger, made on first use.

#include "src/config/configLog.h"

namespace Pelmora::Service {

Logger* ConfigLogger() noexcept {
   static Logger* const logger = MakeReportLogger("config");
   return logger;
}

}  // namespace Pelmora::Service
