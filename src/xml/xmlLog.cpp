// The XML layer's logger: a child of the default logger, made on first use.

#include "src/xml/xmlLog.h"

namespace Pelmora::Xml {

Service::Logger* XmlLogger() noexcept {
   static Service::Logger* const logger = Service::MakeReportLogger("xml");
   return logger;
}

}  // namespace Pelmora::Xml
