// Per-subsystem log levels read from the configuration's "level" entries; installed as the
// log manager's loader when the library is loaded.

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "pelmora/service/logMacros.h"
#include "src/internal/hooks.h"

namespace Pelmora::Service {

namespace {

// Bad entries are reported on the default logger: the manager has no logger of its own,
// and a daemon's operator reads the default output.
template <class... Args>
void Warn(const char* format, const Args&... args) {
   PELMORA_LOG_WARNING(GetDefaultLogger(), format, args...);
}

void LoadLogLevels(LogManager& manager, Config& config) {
   Ref<Config::View> view;
   config.GetMainView(view);
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
         bool ok = prefix ? manager.SetLogLevelForPrefix(name, logLevel) : manager.SetLogLevel(name, logLevel);
         if (!ok) Warn("Unrecognized logLevel '%2' for '%1'", name, logLevel);
      }
      if (settings->Get("memoryLevel", &memLevel)) {
         bool ok = prefix ? manager.SetMemLevelForPrefix(name, memLevel) : manager.SetMemLevel(name, memLevel);
         if (!ok) Warn("Unrecognized memoryLevel '%2' for '%1'", name, memLevel);
      }
   }
}

[[maybe_unused]] const bool g_installed = (Internal::SetLogLevelsLoader(&LoadLogLevels), true);

}  // namespace

}  // namespace Pelmora::Service
