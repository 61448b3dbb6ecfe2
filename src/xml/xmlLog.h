#pragma once
// How the XML layer logs: through the "xml" logger, the one place to point elsewhere.
// The level is tested before anything is formatted, and logging never throws to its
// caller (it runs inside expat's callbacks).

#include "src/internal/subsystemLog.h"

namespace Pelmora::Xml {

constexpr int kXmlLogError = 4;
constexpr int kXmlLogWarning = 8;

Service::Logger* XmlLogger() noexcept;

template <class... Args>
void LogXml(int level, const char* format, const Args&... args) noexcept {
   Service::Report(XmlLogger(), level, format, args...);
}

}  // namespace Pelmora::Xml
