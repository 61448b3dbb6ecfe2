#pragma once
// The logger the SOAP layer reports through when a caller gives none.

#include "pelmora/service/logger.h"

namespace Pelmora::Soap {

// A child "soap" of the default logger, made on first use and kept until exit.
Service::Logger* GetSoapLogger();

// `logger`, or the SOAP layer's when it is null.
inline Service::Logger* OrSoapLogger(Service::Logger* logger) { return logger != nullptr ? logger : GetSoapLogger(); }

}  // namespace Pelmora::Soap
