// Logging as the configuration asks: the default manager's outputs and writers, the
// default levels, the syslog and alternate logs and the per-subsystem levels.

#include "src/app/appImpl.h"

#include <cstdlib>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/service/logWriters.h"

namespace Pelmora::Service {

namespace {

constexpr const char* kFileWriter = "file";
constexpr const char* kConsoleWriter = "console";
constexpr const char* kSyslogWriter = "syslog";
constexpr const char* kAlternateOutput = "alternateLog";

std::string JoinPath(const std::string& directory, const std::string& name) {
   if (directory.empty() || (!name.empty() && name[0] == '/')) return name;
   return directory.back() == '/' ? directory + name : directory + "/" + name;
}

// Replaces the writer `name` of `output` (removing it when `writer` is null).
void PutWriter(LogOutput* output, const char* name, LogWriter* writer) {
   Ref<LogWriter> old;
   output->RemoveWriter(name, old);
   if (old) old->Close();
   if (writer) output->AddWriter(name, writer);
}

bool IsKnownLevel(const std::string& name) {
   Logger::CombinedLevel mask;
   return FindLevelMask(name, mask);
}

// A writer level read from `key`: unknown names fall back to `fallback` with a complaint.
std::string ReadWriterLevel(Config::View* view, Logger* log, const std::string& key,
                            const std::string& fallback) {
   std::string level;
   if (!view->Get(key, &level) || level.empty()) return fallback;
   if (IsKnownLevel(level)) return level;
   PELMORA_LOG_WARNING(log, "Unrecognized %1 '%2' using '%3'", key, level, fallback);
   return fallback;
}

}  // namespace

std::string ApplyLogLevel(Logger* logger, const std::string& key, const std::string& wanted,
                          const std::string& fallback, bool memory, std::string& complaint) {
   std::string level = wanted.empty() ? fallback : wanted;
   bool ok = memory ? logger->SetMemLevelByName(level) : logger->SetLevelByName(level);
   if (!ok) {
      level = fallback;
      if (memory) {
         logger->SetMemLevelByName(level);
      } else {
         logger->SetLevelByName(level);
      }
      complaint = MessageFormatter::ASPrint("Unrecognized %1 '%2' using '%3'", key, wanted, fallback);
   }
   return level;
}

void AppImpl::InitializeLogging() {
   Logger* log = _logger.Get();
   LogManager* manager = _logManager.Get();
   Config::View* view = _view.Get();
   Ref<LogOutput> output;
   manager->GetOrCreateLogOutput(LogManager::kDefaultOutput, output);
   // Complaints about the levels wait for the writers, so that they reach the log files.
   std::string levelComplaint, memoryComplaint;
   try {
      std::string level, memoryLevel = "verbose";
      view->Get("log/level", &level);
      view->Get("log/memoryLevel", &memoryLevel);
      level = ApplyLogLevel(log, "log/level", level, "info", false, levelComplaint);
      memoryLevel =
          ApplyLogLevel(log, "log/memoryLevel", memoryLevel, "verbose", true, memoryComplaint);
      manager->SetDefaultLevels(level, memoryLevel);

      bool fastPath = true;
      view->Get("log/useFastPath", &fastPath);
      SetUsingLogFastPath(fastPath);

      std::string directory, name;
      view->Get("log/directory", &directory);
      view->Get("log/name", &name);
      bool outputToFiles = !name.empty();
      view->Get("log/outputToFiles", &outputToFiles);
      bool haveFile = false;
      if (outputToFiles && !name.empty()) {
         LogFileOptions options;
         options.path = JoinPath(directory, name);
         options.level = ReadWriterLevel(view, log, "log/fileLevel", "trivia");
         view->Get("log/maxFileSize", &options.maxFileSize);
         view->Get("log/maxFileNum", &options.maxFileNum);
         std::string mode;
         if (view->Get("log/fileMode", &mode) && !mode.empty()) {
            char* end = nullptr;
            long value = strtol(mode.c_str(), &end, 8);
            if (*end != '\0' || value < 0 || value > 07777) {
               throw NumberFormatException("log/fileMode is not an octal mode: " + mode);
            }
            options.fileMode = static_cast<int>(value);
         }
         int flushMs = options.flushIntervalMs;
         view->Get("log/flushIntervalMs", &flushMs);
         options.flushIntervalMs = flushMs;
         view->Get("log/threadBufferSize", &options.threadBufferSize);
         try {
            Ref<LogWriter> file;
            CreateFileLogWriter(kFileWriter, options, file);
            PutWriter(output.Get(), kFileWriter, file.Get());
            haveFile = true;
         } catch (const Exception& e) {
            PELMORA_LOG_ERROR(log, "Failed to open log file %1: %2", options.path, e.GetMessage());
         }
      }

      // Without a file the console keeps what would otherwise be lost.
      bool outputToConsole = !haveFile;
      view->Get("log/outputToConsole", &outputToConsole);
      Ref<LogWriter> console;
      if (outputToConsole) {
         CreateConsoleLogWriter(kConsoleWriter,
                                ReadWriterLevel(view, log, "log/consoleLevel", "trivia"), false,
                                console);
      }
      PutWriter(output.Get(), kConsoleWriter, console.Get());

      bool outputToMemory = true;
      int memoryLogSizeK = 256;
      view->Get("log/outputToMemory", &outputToMemory);
      view->Get("log/memoryLogSizeK", &memoryLogSizeK);
      Ref<LogOutput> memory;
      manager->GetOrCreateLogOutput(LogManager::kMemoryOutput, memory);
      Ref<LogWriter> ring;
      if (outputToMemory && memoryLogSizeK > 0) {
         CreateMemLogWriter(LogManager::kMemoryOutput, memoryLogSizeK, "trivia", ring);
      }
      PutWriter(output.Get(), LogManager::kMemoryOutput, ring.Get());
      PutWriter(memory.Get(), LogManager::kMemoryOutput, ring.Get());

      bool outputToSyslog = false;
      view->Get("log/outputToSyslog", &outputToSyslog);
      Ref<LogWriter> syslog;
      if (outputToSyslog) {
         // CreateSyslogLog
         LogSyslogOptions options;
         options.ident = name;
         options.level = ReadWriterLevel(view, log, "log/syslogLevel", "trivia");
         view->Get("log/syslogSocket", &options.socketPath);
         Ref<SyslogLogWriter> writer;
         CreateSyslogLogWriter(kSyslogWriter, options, writer);
         syslog = writer.Get();
      }
      PutWriter(output.Get(), kSyslogWriter, syslog.Get());

      // CreateAlternateLog: an output of its own for those who ask for it by name.
      std::string alternateName;
      view->Get("log/alternateLog/name", &alternateName);
      if (!alternateName.empty()) {
         std::string alternateDirectory = directory;
         view->Get("log/alternateLog/directory", &alternateDirectory);
         LogFileOptions options;
         options.path = JoinPath(alternateDirectory, alternateName);
         options.level = ReadWriterLevel(view, log, "log/alternateLog/level", "trivia");
         view->Get("log/maxFileSize", &options.maxFileSize);
         view->Get("log/maxFileNum", &options.maxFileNum);
         Ref<LogOutput> alternate;
         manager->GetOrCreateLogOutput(kAlternateOutput, alternate);
         try {
            Ref<LogWriter> file;
            CreateFileLogWriter(kFileWriter, options, file);
            PutWriter(alternate.Get(), kFileWriter, file.Get());
         } catch (const Exception& e) {
            PELMORA_LOG_ERROR(log, "Failed to open log file %1: %2", options.path, e.GetMessage());
         }
      }
   } catch (const Exception& e) {
      PELMORA_LOG_ERROR(log, "Encountered errors while reading log parameters: %1", e.GetMessage());
   }
   for (const std::string* complaint : {&levelComplaint, &memoryComplaint}) {
      if (!complaint->empty()) PELMORA_LOG_WARNING(log, "%1", *complaint);
   }
   try {
      manager->LoadLogLevels(_config.Get());
   } catch (const Exception& e) {
      PELMORA_LOG_ERROR(log, "Encountered errors while reading log parameters: %1", e.GetMessage());
   }
   PELMORA_LOG_INFO(log, "Logging uses fast path: %1", IsUsingLogFastPath() ? "true" : "false");
}

}  // namespace Pelmora::Service
