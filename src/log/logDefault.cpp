// The process's default manager and logger, the report sink that sends exception dumps
// and panic reports through them, and writing the in-memory ring out.

#include "src/internal/subsystemLog.h"

#include <chrono>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/service/logWriters.h"
#include "src/internal/report.h"
#include "src/log/logImpl.h"

namespace Pelmora::Service {

namespace {

// The ring of the default manager before any configuration.
constexpr int kDefaultMemoryLogSizeK = 256;
constexpr const char* kDefaultSubsystem = "default";

// How long a dying process waits for a log lock before it reads the ring without it.
constexpr std::chrono::milliseconds kReportLockWait{100};

std::string CollectRing(LogOutput* memory) {
   std::string text;
   auto* impl = dynamic_cast<LogOutputImpl*>(memory);
   if (!impl) return text;
   for (Ref<LogWriter>& writer : impl->Snapshot()) {
      if (auto* ring = dynamic_cast<MemLogWriterImpl*>(writer.Get())) text += ring->GetText();
   }
   return text;
}

// As CollectRing in a dying process, with no lock waited for past a short bound: the
// thread holding one may be gone (the report child has only the panicking thread). When
// the memory output stays locked, `fallback`, the ring taken from the default output,
// is read alone.
std::string CollectRingForReport(LogOutput* memory, LogWriter* fallback) {
   std::string text;
   auto deadline = std::chrono::steady_clock::now() + kReportLockWait;
   RefVector<LogWriter> writers;
   auto* impl = dynamic_cast<LogOutputImpl*>(memory);
   if (!impl || !impl->TrySnapshot(deadline, writers)) {
      writers.clear();
      if (fallback) writers.push_back(fallback);
   }
   for (Ref<LogWriter>& writer : writers) {
      if (auto* ring = dynamic_cast<MemLogWriterImpl*>(writer.Get())) {
         text += ring->GetTextForReport(deadline);
      }
   }
   return text;
}

// The ring goes out as one block at the output half of `level` only, so that the memory
// writers do not take their own lines in again.
void WriteRing(LogOutput* destination, Logger::LogLevel level, const std::string& message,
               const std::string& text) {
   if (!destination) return;
   std::string block = "----- Recent log lines (" + message + ") -----\n";
   block += text;
   if (!text.empty() && text.back() != '\n') block += '\n';
   block += "----- End of recent log lines -----\n";
   destination->WriteMessage(static_cast<Logger::CombinedLevel>(level), block.data(),
                             static_cast<int>(block.size()));
}

void WriteRing(LogOutput* memory, LogOutput* destination, Logger::LogLevel level,
               const std::string& message) {
   if (!memory || !destination) return;
   WriteRing(destination, level, message, CollectRing(memory));
}

class LoggingReportSink : public Internal::ReportSink {
public:
   bool IsLevelEnabled(int level) override {
      return GetDefaultLogger()->IsLevelWanted(static_cast<Logger::LogLevel>(level));
   }

   void Log(int level, const std::string& text) override {
      LogInternal(GetDefaultLogger(), static_cast<Logger::LogLevel>(level), "%1", text);
   }

   // Locks the manager only when the panic did not come from under its lock, which the
   // static analysis cannot follow.
   void LogMemoryBuffer(int level, const std::string& message, bool detach) override
      PELMORA_NO_THREAD_SAFETY_ANALYSIS {
      Logger* logger = GetDefaultLogger();
      auto logLevel = static_cast<Logger::LogLevel>(level);
      if (!detach) {
         Service::LogMemoryBuffer(logger, logLevel, message);
         return;
      }
      // The process is dying: the ring stops taking lines while it is written out.
      LogManager* manager = logger->GetLogManager();
      Ref<LogOutput> memory;
      Ref<LogWriter> ring;
      // The panic may have come from inside the manager, with its lock held.
      bool locked = !manager->IsLocked();
      if (locked) manager->Lock();
      try {
         manager->RemoveLogOutput(LogManager::kMemoryOutput, memory);
         if (memory) logger->GetLogOutput()->RemoveWriter(LogManager::kMemoryOutput, ring);
      } catch (...) {
      }
      if (locked) manager->Unlock();
      if (!memory) return;
      try {
         WriteRing(logger->GetLogOutput(), logLevel, message,
                   CollectRingForReport(memory.Get(), ring.Get()));
      } catch (...) {
      }
   }

   void Flush() override { GetDefaultLogManager()->Flush(); }
};

LogManagerImpl* MakeDefaultManager() {
   Ref<LogManager> manager;
   CreateLogManager(manager);
   Ref<LogOutput> output;
   manager->GetOrCreateLogOutput(LogManager::kDefaultOutput, output);
   // Until the application configures logging: every wanted line to standard error, and
   // the recent ones in the ring. The loggers' masks do the filtering.
   Ref<LogWriter> console;
   CreateConsoleLogWriter("console", "trivia", false, console);
   output->AddWriter("console", console.Get());
   Ref<LogWriter> ring;
   CreateMemLogWriter(LogManager::kMemoryOutput, kDefaultMemoryLogSizeK, "trivia", ring);
   output->AddWriter(LogManager::kMemoryOutput, ring.Get());
   Ref<LogOutput> memory;
   manager->GetOrCreateLogOutput(LogManager::kMemoryOutput, memory);
   memory->AddWriter(LogManager::kMemoryOutput, ring.Get());
   // Lives until exit, like everything that may log from other threads then.
   return dynamic_cast<LogManagerImpl*>(manager.Release());
}

LoggerImpl* MakeDefaultLogger() {
   LogManagerImpl* manager = dynamic_cast<LogManagerImpl*>(GetDefaultLogManager());
   Ref<LogOutput> output;
   manager->GetOrCreateLogOutput(LogManager::kDefaultOutput, output);
   Logger::CombinedLevel mask =
       manager->FindLogLevelForName(kDefaultSubsystem) |
       (manager->FindMemLevelForName(kDefaultSubsystem) << Logger::kMemoryShift);
   Ref<LoggerImpl> logger = new LoggerImpl(kDefaultSubsystem, mask, nullptr, manager,
                                           output.Get());
   static LoggingReportSink* const sink = new LoggingReportSink();
   Internal::SetReportSinkIfUnset(sink);
   return logger.Release();
}

}  // namespace

LogManager* GetDefaultLogManager() {
   static LogManagerImpl* const manager = MakeDefaultManager();
   return manager;
}

Logger* GetDefaultLogger() {
   static LoggerImpl* const logger = MakeDefaultLogger();
   return logger;
}

Logger* MakeReportLogger(const char* subsystem) noexcept {
   try {
      Ref<Logger> logger;
      GetDefaultLogger()->CreateLogger(subsystem, logger);
      return logger.Release();
   } catch (...) {
      return nullptr;
   }
}

bool IsLoggingReportSinkActive() noexcept {
   return dynamic_cast<LoggingReportSink*>(&Internal::GetReportSink()) != nullptr;
}

bool IsReportWanted(Logger* logger, int level) noexcept {
   try {
      if (logger && IsLoggingReportSinkActive()) {
         return logger->IsLevelWanted(static_cast<Logger::LogLevel>(level));
      }
      return Internal::GetReportSink().IsLevelEnabled(level);
   } catch (...) {
      return false;
   }
}

void WriteReport(Logger* logger, int level, const std::string& text) noexcept {
   try {
      if (logger && IsLoggingReportSinkActive()) {
         LogInternal(logger, static_cast<Logger::LogLevel>(level), "%1", text);
         return;
      }
      Internal::GetReportSink().Log(level, text);
   } catch (...) {
      // A failing sink has nowhere to report to.
   }
}

void CreateLogger(Writer* writer, const std::string& name, const std::string& level,
                  LogManager* manager, Ref<Logger>& out) {
   Ref<LogManager> owned = manager;
   if (!owned) CreateLogManager(owned);
   auto* impl = dynamic_cast<LogManagerImpl*>(owned.Get());
   if (!impl) throw InvalidArgumentException("log manager of another kind");
   Ref<LogOutput> output;
   impl->GetOrCreateLogOutput(LogManager::kDefaultOutput, output);
   if (writer) {
      Ref<LogWriter> main;
      CreateLogWriter("main", writer, "trivia", main);
      output->AddWriter("main", main.Get());
   }
   Logger::CombinedLevel logMask = impl->FindLogLevelForName(name);
   bool unknown = !level.empty() && !FindLevelMask(level, logMask);
   if (unknown) FindLevelMask("info", logMask);
   Ref<LoggerImpl> logger = new LoggerImpl(
       name, logMask | (impl->FindMemLevelForName(name) << Logger::kMemoryShift), nullptr, impl,
       output.Get());
   if (unknown) {
      PELMORA_LOG_WARNING(logger.Get(), "Unrecognized log/level '%1' using 'info'", level);
   }
   out = logger;
}

void LogMemoryBuffer(Logger* logger, Logger::LogLevel level, const std::string& message) noexcept {
   try {
      Ref<LogOutput> memory;
      logger->GetLogManager()->FindLogOutput(LogManager::kMemoryOutput, memory);
      WriteRing(memory.Get(), logger->GetLogOutput(), level, message);
   } catch (...) {
   }
}

void WriteMemoryBuffer(LogOutput* memory, Logger::LogLevel level,
                       const std::string& message) noexcept {
   try {
      WriteRing(memory, GetDefaultLogger()->GetLogOutput(), level, message);
   } catch (...) {
   }
}

void WriteFaultToMemoryBuffer(Logger* logger, const PrintFormatter& fault) noexcept {
   auto* impl = dynamic_cast<LoggerImpl*>(logger);
   if (!impl) return;
   try {
      impl->BeginCombined(static_cast<Logger::CombinedLevel>(Logger::LOG_ERROR)
                          << Logger::kMemoryShift);
   } catch (...) {
      return;
   }
   try {
      fault.Print(impl);
   } catch (...) {
   }
   try {
      impl->End();
   } catch (...) {
   }
}

}  // namespace Pelmora::Service
