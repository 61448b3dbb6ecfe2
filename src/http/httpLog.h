#pragma once
// The logger the HTTP layer reports through when a caller gives none.

#include "pelmora/service/logger.h"

namespace Pelmora::Http {

// A child "http" of the default logger, made on first use and kept until exit.
Service::Logger* GetHttpLogger();

}  // namespace Pelmora::Http
