// A tour of the core: objects and a weak reference, a formatted message, an exception
// caught, cloned, rethrown and printed with its backtrace; then logging to the console
// and to a rolling file as a configuration file says.

#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <memory>

#include "pelmora/pelmora.h"

using namespace Pelmora;

namespace {

// A session of some daemon: reference counted, and reachable through weak references.
class Session : public WeakLinkableImpl<> {
public:
   explicit Session(std::string user) : _user(std::move(user)) {}
   const std::string& GetUser() const { return _user; }

private:
   std::string _user;
};

}  // namespace

// Exported, so that its frame is named in the backtrace.
void OpenConfiguration(const std::string& path) {
   throw FileIONotFoundException("Failed to open read file", path);
}

int main(int argc, char** argv) {
   Ref<Session> session = new Session("operator");
   WeakRef<Session> observer = session;
   std::cout << MessageFormatter::ASPrint("%1 belongs to %2 (%3 reference)\n", session,
                                          session->GetUser(), session->GetRefCount());

   if (Ref<Session> promoted = observer.Promote()) {
      std::cout << "weak reference promoted while the session lives\n";
   }
   session.Reset();
   std::cout << "after the last reference: promoted = " << std::boolalpha
             << static_cast<bool>(observer.Promote()) << ", detached = " << observer.IsDetached()
             << "\n";

   std::unique_ptr<Exception> kept;
   try {
      OpenConfiguration("/etc/daemon/settings.xml");
   } catch (const Exception& e) {
      kept.reset(e.Clone());  // kept for later, e.g. to hand to another thread
   }
   try {
      kept->Throw();
   } catch (const FileIONotFoundException& e) {
      std::cout << MessageFormatter::ASPrint("rethrown as its own type: %1 (path %2)\n", e,
                                             e.GetPath());
      std::cout << "thrown at:\n" << e.Where();
   }

   // Settings come from a configuration file (the first argument, or the tour's own);
   // the defaults tree answers for what the file leaves out.
   std::string configPath = argc > 1 ? argv[1] : PELMORA_EXAMPLE_CONFIG;
   Ref<Service::Config> config;
   Service::CreateXmlFileConfig(configPath, -1, 0, config);
   Ref<Service::Config::View> defaults;
   config->GetDefaultsMainView(defaults);
   const char* tmp = std::getenv("TMPDIR");
   defaults->Set("log/directory", std::string(tmp && *tmp ? tmp : "/tmp") + "/core_tour-logs");
   defaults->Set("log/name", "core_tour.log");
   defaults->Set("log/level", "info");
   defaults->Set("log/fileLevel", "trivia");
   defaults->Set("log/consoleLevel", "warning");
   Ref<Service::Config::View> settings;
   config->GetView("log", settings);
   std::string logDir, logName, level, fileLevel, consoleLevel;
   settings->Get("directory", &logDir);
   settings->Get("name", &logName);
   settings->Get("level", &level);
   settings->Get("fileLevel", &fileLevel);
   settings->Get("consoleLevel", &consoleLevel);

   // Logging. The default logger already writes to the console (standard error); the
   // console keeps its configured level, the rolling file what the loggers let through,
   // and the "level" entries give single subsystems levels of their own.
   std::filesystem::remove_all(logDir);
   std::filesystem::create_directories(logDir);
   Service::LogFileOptions fileOptions;
   fileOptions.path = logDir + "/" + logName;
   fileOptions.level = fileLevel;
   settings->Get("maxFileSize", &fileOptions.maxFileSize);
   settings->Get("maxFileNum", &fileOptions.maxFileNum);
   Ref<Service::LogWriter> file;
   Service::CreateFileLogWriter("file", fileOptions, file);
   Service::Logger* logger = Service::GetDefaultLogger();
   logger->SetLevelByName(level);
   logger->GetLogOutput()->AddWriter("file", file.Get());
   Ref<Service::LogWriter> console;
   logger->GetLogOutput()->GetWriter("console", console);
   if (console) console->SetLevelByName(consoleLevel);
   logger->GetLogManager()->LoadLogLevels(config.Get());

   Ref<Service::Logger> sessions;
   logger->CreateLogger("sessions", sessions);
   Service::SetLogContext("user", "operator");
   for (int i = 1; i <= 60; ++i) {
      PELMORA_LOG_INFO(sessions.Get(), "session %1 opened from %2", i, "10.0.0.7");
      PELMORA_LOG_VERBOSE(sessions.Get(), "session %1 has %2 roles", i, i % 3 + 1);
   }
   PELMORA_LOG_WARNING(sessions.Get(), "session table %1%% full", 85);
   PELMORA_LOG_ERROR(logger, "kept exception: %1", *kept);
   Service::SetLogContext("user", "");
   logger->GetLogManager()->Flush();

   std::cout << "log files in " << logDir << ":\n";
   for (const auto& entry : std::filesystem::directory_iterator(logDir)) {
      std::cout << "  " << entry.path().filename().string() << " (" << entry.file_size()
                << " bytes)\n";
   }

   std::string scores;
   ObjectImpl::GetScores(scores);
   std::cout << "live objects per class:\n" << scores;
   return 0;
}
