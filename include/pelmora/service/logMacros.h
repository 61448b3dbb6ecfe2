#pragma once
// Writing a message: LogInternal formats "%1".."%9" placeholders into one line of a
// logger; the PELMORA_LOG macros test the level first, so an unwanted message costs one
// load and one test and no argument is evaluated. Nothing here throws to its caller: a
// failure while formatting still ends the line and is dropped.

#include <atomic>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/formatter/printFormatter.h"
#include "pelmora/service/logger.h"

namespace Pelmora {
struct ParsedFormat;
}

namespace Pelmora::Service {

// Writes one line always (the caller tested the level): Begin, the message, End.
PELMORA_EXPORT void LogInternalArgs(Logger* logger, Logger::LogLevel level, const char* format,
                     const PrintFormatter* args, int count) noexcept;

// Where a PELMORA_LOG call site keeps its format, parsed by the site's first line, so that
// later lines skip the placeholder scan. Only a string literal may use one: its text
// cannot change under the site. Constant-initialised, so a site costs no guard.
struct LogFormatSite {
   std::atomic<const ParsedFormat*> parsed{nullptr};
};

// LogInternalArgs for a call site: `site` may be null (a format that is not a literal).
PELMORA_EXPORT void LogInternalSiteArgs(LogFormatSite* site, Logger* logger,
                                        Logger::LogLevel level, const char* format,
                                        const PrintFormatter* args, int count) noexcept;

template <class... Args>
inline void LogInternalAt(LogFormatSite* site, Logger* logger, Logger::LogLevel level,
                          const char* format, const Args&... args) noexcept {
   static_assert(sizeof...(Args) <= 9, "at most nine arguments");
   if constexpr (sizeof...(Args) == 0) {
      LogInternalSiteArgs(site, logger, level, format, nullptr, 0);
   } else {
      const PrintFormatter formatters[] = {PrintFormatter(args)...};
      LogInternalSiteArgs(site, logger, level, format, formatters, sizeof...(Args));
   }
}

inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format) noexcept {
   LogInternalArgs(logger, level, format, nullptr, 0);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1) noexcept {
   const PrintFormatter args[] = {a1};
   LogInternalArgs(logger, level, format, args, 1);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2) noexcept {
   const PrintFormatter args[] = {a1, a2};
   LogInternalArgs(logger, level, format, args, 2);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2,
                        const PrintFormatter& a3) noexcept {
   const PrintFormatter args[] = {a1, a2, a3};
   LogInternalArgs(logger, level, format, args, 3);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2,
                        const PrintFormatter& a3, const PrintFormatter& a4) noexcept {
   const PrintFormatter args[] = {a1, a2, a3, a4};
   LogInternalArgs(logger, level, format, args, 4);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2,
                        const PrintFormatter& a3, const PrintFormatter& a4,
                        const PrintFormatter& a5) noexcept {
   const PrintFormatter args[] = {a1, a2, a3, a4, a5};
   LogInternalArgs(logger, level, format, args, 5);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2,
                        const PrintFormatter& a3, const PrintFormatter& a4,
                        const PrintFormatter& a5, const PrintFormatter& a6) noexcept {
   const PrintFormatter args[] = {a1, a2, a3, a4, a5, a6};
   LogInternalArgs(logger, level, format, args, 6);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2,
                        const PrintFormatter& a3, const PrintFormatter& a4,
                        const PrintFormatter& a5, const PrintFormatter& a6,
                        const PrintFormatter& a7) noexcept {
   const PrintFormatter args[] = {a1, a2, a3, a4, a5, a6, a7};
   LogInternalArgs(logger, level, format, args, 7);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2,
                        const PrintFormatter& a3, const PrintFormatter& a4,
                        const PrintFormatter& a5, const PrintFormatter& a6,
                        const PrintFormatter& a7, const PrintFormatter& a8) noexcept {
   const PrintFormatter args[] = {a1, a2, a3, a4, a5, a6, a7, a8};
   LogInternalArgs(logger, level, format, args, 8);
}
inline void LogInternal(Logger* logger, Logger::LogLevel level, const char* format,
                        const PrintFormatter& a1, const PrintFormatter& a2,
                        const PrintFormatter& a3, const PrintFormatter& a4,
                        const PrintFormatter& a5, const PrintFormatter& a6,
                        const PrintFormatter& a7, const PrintFormatter& a8,
                        const PrintFormatter& a9) noexcept {
   const PrintFormatter args[] = {a1, a2, a3, a4, a5, a6, a7, a8, a9};
   LogInternalArgs(logger, level, format, args, 9);
}

// Writes the in-memory ring of `logger`'s manager (its "memory" output) out through
// `logger`'s output at `level`, framed by lines naming `message`. Nothing without a
// memory output.
PELMORA_EXPORT void LogMemoryBuffer(Logger* logger, Logger::LogLevel level, const std::string& message) noexcept;
// Writes the ring of the memory output `memory` out through the default logger's output.
PELMORA_EXPORT void WriteMemoryBuffer(LogOutput* memory, Logger::LogLevel level,
                       const std::string& message) noexcept;
// Writes one error line holding `fault` to `logger`'s memory writers only.
PELMORA_EXPORT void WriteFaultToMemoryBuffer(Logger* logger, const PrintFormatter& fault) noexcept;

}  // namespace Pelmora::Service

// PELMORA_LOG(logger, level, format, args...): `logger` is evaluated once; the format and
// the arguments only when the level is wanted. A format that the compiler knows to be
// constant (a string literal) is parsed once per call site.
#define PELMORA_LOG_FORMAT_(format, ...) format
#define PELMORA_LOG(logger, level, ...)                                                   \
   do {                                                                                   \
      ::Pelmora::Service::Logger* pelmoraLogger_ = (logger);                              \
      if (pelmoraLogger_->IsLevelWanted(level)) {                                         \
         static ::Pelmora::Service::LogFormatSite pelmoraSite_;                           \
         ::Pelmora::Service::LogInternalAt(                                               \
             __builtin_constant_p(PELMORA_LOG_FORMAT_(__VA_ARGS__, 0)) ? &pelmoraSite_    \
                                                                       : nullptr,         \
             pelmoraLogger_, (level), __VA_ARGS__);                                       \
      }                                                                                   \
   } while (0)

#define PELMORA_LOG_QUIET(logger, ...) \
   PELMORA_LOG(logger, ::Pelmora::Service::Logger::LOG_QUIET, __VA_ARGS__)
#define PELMORA_LOG_PANIC(logger, ...) \
   PELMORA_LOG(logger, ::Pelmora::Service::Logger::LOG_PANIC, __VA_ARGS__)
#define PELMORA_LOG_ERROR(logger, ...) \
   PELMORA_LOG(logger, ::Pelmora::Service::Logger::LOG_ERROR, __VA_ARGS__)
#define PELMORA_LOG_WARNING(logger, ...) \
   PELMORA_LOG(logger, ::Pelmora::Service::Logger::LOG_WARNING, __VA_ARGS__)
#define PELMORA_LOG_INFO(logger, ...) \
   PELMORA_LOG(logger, ::Pelmora::Service::Logger::LOG_INFO, __VA_ARGS__)
#define PELMORA_LOG_VERBOSE(logger, ...) \
   PELMORA_LOG(logger, ::Pelmora::Service::Logger::LOG_VERBOSE, __VA_ARGS__)
#define PELMORA_LOG_TRIVIA(logger, ...) \
   PELMORA_LOG(logger, ::Pelmora::Service::Logger::LOG_TRIVIA, __VA_ARGS__)
