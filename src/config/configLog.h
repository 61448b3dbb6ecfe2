#pragma once
// How the configuration logs: through the "config" logger, the one place to point
// elsewhere. The level is tested before anything is formatted, and logging never throws
// to its caller (it runs in destructors and clean-up paths).

#include "src/internal/subsystemLog.h"

namespace Pelmora::Service {

constexpr int kConfigLogError = 4;
constexpr int kConfigLogWarning = 8;

Logger* ConfigLogger() noexcept;

template <class... Args>
void LogConfig(int level, const char* format, const Args&... args) noexcept {
   Report(ConfigLogger(), level, format, args...);
}

}  // namespace Pelmora::Service
