#pragma once
// The logger this layer writes to: the initialised manager's, else the default logger.

#include "pelmora/service/logger.h"

namespace Pelmora::Authorize {

Service::Logger* AuthLog();
// The manager sets its logger in Init and null in Shutdown; it keeps the logger alive
// in between.
void SetAuthLog(Service::Logger* logger);

}  // namespace Pelmora::Authorize
