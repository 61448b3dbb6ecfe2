// Per-subsystem levels read from the configuration's "level" entries.

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "pelmora/service/logMacros.h"
#include "src/service/logImpl.h"

namespace Pelmora::Service {

namespace {

// Bad entries are reported on the default logger: the manager has no logger of its own,
// and a daemon's operator reads the default output.
template <class... Args>
void Warn(const char* format, const Args&... args) {
   PELMORA_LOG_WARNING(GetDefaultLogger(), format, args...);
}

}  // namespace

void LogManagerImpl::LoadLogLevels(Config* config) {
   Ref<Config::View> view;
   config->GetMainView(view);
   std::vector<std::string> entries;
   view->GetChildNames("level", entries);
   for (const std::string& entry : entries) {
      Ref<Config::View> settings;
      view->GetView("level/" + entry, settings);
      std::string name, logLevel, memLevel;
      bool prefix = false;
      if (!settings->Get("logName", &name) || name.empty()) {
         Warn("Log level entry '%1' names no logName", entry);
         continue;
      }
      try {
         settings->Get("prefix", &prefix);
      } catch (const NumberFormatException&) {
         Warn("Log level entry '%1' has a prefix that is not a boolean", entry);
         continue;
      }
      if (settings->Get("logLevel", &logLevel)) {
         bool ok = prefix ? SetLogLevelForPrefix(name, logLevel) : SetLogLevel(name, logLevel);
         if (!ok) Warn("Unrecognized logLevel '%2' for '%1'", name, logLevel);
      }
      if (settings->Get("memoryLevel", &memLevel)) {
         bool ok = prefix ? SetMemLevelForPrefix(name, memLevel) : SetMemLevel(name, memLevel);
         if (!ok) Warn("Unrecognized memoryLevel '%2' for '%1'", name, memLevel);
      }
   }
}

}  // namespace Pelmora::Service
