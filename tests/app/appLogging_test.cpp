// Logging as the configuration sets it up: levels and their fallbacks, file, console and
// memory writers, the fast path switch and per-subsystem levels.

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <gtest/gtest.h>

#include <cstring>

#include "pelmora/service.h"
#include "tests/support/appProcess.h"

namespace Pelmora::Service {
namespace {

using Testing::Contains;
using Testing::CountOf;
using Testing::ReadText;
using Testing::ScratchDir;
using Testing::WriteText;

std::string Config(const ScratchDir& dir, const std::string& log, const std::string& extra = "") {
   std::string path = dir / "app.xml";
   WriteText(path, "<config><log><directory>" + dir.Path() + "</directory><name>app.log</name>" +
                       log + "</log><pelmora><daemon><handleSignals>false</handleSignals></daemon>"
                       "</pelmora>" + extra + "</config>");
   return path;
}

std::string LogOf(const ScratchDir& dir) {
   GetDefaultLogManager()->Flush();
   return ReadText(dir / "app.log");
}

// Runs `scenario` in a child that must end with status 0 (a failed check ends it with 100).
void InChild(const std::function<void()>& scenario) {
   EXPECT_EXIT((scenario(), _exit(0)), testing::ExitedWithCode(0), "");
}

TEST(AppLoggingDeathTest, UnknownLevelsFallBackWithOneComplaintEach) {
   ScratchDir dir;
   std::string config = Config(dir, "<level>loud</level><memoryLevel>all</memoryLevel>");
   InChild([&] {
      InitApp(config);
      Logger* logger = GetDefaultLogger();
      APP_CHILD_CHECK(logger->GetLevelByName() == "info");
      APP_CHILD_CHECK(logger->GetMemLevelByName() == "verbose");
      std::string log = LogOf(dir);
      APP_CHILD_CHECK(CountOf(log, "Unrecognized log/level 'loud' using 'info'") == 1);
      APP_CHILD_CHECK(CountOf(log, "Unrecognized log/memoryLevel 'all' using 'verbose'") == 1);
      APP_CHILD_CHECK(Contains(log, "warning 'default'] Unrecognized log/level"));
      // New loggers follow the fallbacks too.
      Ref<Logger> child;
      logger->CreateLogger("later", child);
      APP_CHILD_CHECK(child->GetLevelByName() == "info");
   });
}

TEST(AppLoggingDeathTest, LevelsFileModeFastPathAndSubsystemLevelsComeFromTheConfiguration) {
   ScratchDir dir;
   std::string config =
       Config(dir,
              "<level>warning</level><memoryLevel>info</memoryLevel><fileMode>0600</fileMode>"
              "<useFastPath>false</useFastPath><outputToConsole>false</outputToConsole>",
              "<level><a><logName>chatty</logName><logLevel>trivia</logLevel></a></level>");
   InChild([&] {
      InitApp(config);
      Logger* logger = GetDefaultLogger();
      APP_CHILD_CHECK(logger->GetLevelByName() == "warning");
      APP_CHILD_CHECK(logger->GetMemLevelByName() == "info");
      APP_CHILD_CHECK(!IsUsingLogFastPath());
      Ref<Logger> chatty, quiet;
      logger->CreateLogger("chatty", chatty);
      logger->CreateLogger("other", quiet);
      APP_CHILD_CHECK(chatty->GetLevelByName() == "trivia");
      APP_CHILD_CHECK(quiet->GetLevelByName() == "warning");
      PELMORA_LOG_VERBOSE(chatty.Get(), "wanted verbose line");
      PELMORA_LOG_INFO(quiet.Get(), "unwanted info line");
      Ref<LogOutput> output;
      GetDefaultLogManager()->FindLogOutput(LogManager::kDefaultOutput, output);
      Ref<LogWriter> console;
      output->GetWriter("console", console);
      APP_CHILD_CHECK(!console);
      std::string log = LogOf(dir);
      APP_CHILD_CHECK(Contains(log, "wanted verbose line"));
      APP_CHILD_CHECK(!Contains(log, "unwanted info line"));
      // Start-up's info lines stay out: the level is set before them.
      APP_CHILD_CHECK(!Contains(log, "Logging uses fast path"));
      struct stat info;
      APP_CHILD_CHECK(stat((dir / "app.log").c_str(), &info) == 0);
      APP_CHILD_CHECK((info.st_mode & 0777) == 0600);
   });
}

TEST(AppLoggingDeathTest, TheMemoryRingIsSizedFromTheConfigurationAndServesDumps) {
   ScratchDir dir;
   std::string config = Config(dir, "<level>info</level><memoryLevel>trivia</memoryLevel>"
                                    "<memoryLogSizeK>1</memoryLogSizeK>");
   InChild([&] {
      InitApp(config);
      Logger* logger = GetDefaultLogger();
      for (int i = 0; i < 100; ++i) PELMORA_LOG_TRIVIA(logger, "ring line %1", i);
      LogMemoryBuffer(logger, Logger::LOG_ERROR, "dump");
      std::string log = LogOf(dir);
      // Trivia lines reach only the ring; the dump shows its last kilobyte.
      APP_CHILD_CHECK(Contains(log, "ring line 99"));
      APP_CHILD_CHECK(!Contains(log, "ring line 0\n"));
      size_t start = log.find("----- Recent log lines (dump)");
      size_t end = log.find("----- End of recent log lines");
      APP_CHILD_CHECK(start != std::string::npos && end != std::string::npos);
      APP_CHILD_CHECK(end - start < 1300);
   });
}

TEST(AppLoggingDeathTest, SyslogAndTheAlternateLogAreAddedWhenConfigured) {
   ScratchDir dir;
   std::string socketPath = dir / "syslog";
   std::string config = Config(
       dir, "<level>info</level><outputToSyslog>true</outputToSyslog><syslogSocket>" +
                socketPath + "</syslogSocket><alternateLog><name>alt.log</name></alternateLog>");
   InChild([&] {
      int fd = socket(AF_UNIX, SOCK_DGRAM, 0);
      sockaddr_un address = {};
      address.sun_family = AF_UNIX;
      strncpy(address.sun_path, socketPath.c_str(), sizeof(address.sun_path) - 1);
      unlink(socketPath.c_str());
      APP_CHILD_CHECK(bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0);
      InitApp(config);
      PELMORA_LOG_WARNING(GetDefaultLogger(), "to syslog too");
      std::string got;
      for (int i = 0; i < 50 && !Contains(got, "to syslog too"); ++i) {
         pollfd p{fd, POLLIN, 0};
         APP_CHILD_CHECK(poll(&p, 1, 2000) == 1);
         char buffer[4096];
         ssize_t n = recv(fd, buffer, sizeof(buffer), 0);
         got.assign(buffer, n > 0 ? static_cast<size_t>(n) : 0);
      }
      // Warning in the daemon facility: 3 * 8 + 4.
      APP_CHILD_CHECK(got.rfind("<28>", 0) == 0);
      Ref<LogOutput> alternate;
      GetDefaultLogManager()->FindLogOutput("alternateLog", alternate);
      APP_CHILD_CHECK(alternate);
      const char line[] = "alternate line\n";
      alternate->WriteMessage(Logger::LOG_INFO, line, sizeof(line) - 1);
      alternate->Flush();
      APP_CHILD_CHECK(ReadText(dir / "alt.log") == line);
   });
}

TEST(AppLoggingDeathTest, BadLogSettingsAreReportedAndLogsGoToTheConsole) {
   ScratchDir dir;
   auto write = [&](const std::string& log) {
      std::string path = dir / "app.xml";
      WriteText(path, "<config><log>" + log + "</log><pelmora><daemon><handleSignals>false"
                      "</handleSignals></daemon></pelmora></config>");
      return path;
   };
   std::string malformed = write("<name>app.log</name><maxFileNum>x</maxFileNum>");
   EXPECT_EXIT((InitApp(malformed), _exit(0)), testing::ExitedWithCode(0),
               "Encountered errors while reading log parameters: ");
   std::string unopenable =
       write("<directory>" + dir.Path() + "/missing</directory><name>app.log</name>");
   EXPECT_EXIT((InitApp(unopenable), _exit(0)), testing::ExitedWithCode(0),
               "Failed to open log file .*missing/app.log(.|\n)*Logging uses fast path: true");
}

}  // namespace
}  // namespace Pelmora::Service
