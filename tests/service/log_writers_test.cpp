// The file writer's rollover, buffering and reopening; the syslog writer on a socket of
// the test's own.

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service.h"

using namespace Pelmora;
using namespace Pelmora::Service;
namespace fs = std::filesystem;

namespace {

class TempDir {
public:
   TempDir() {
      char pattern[] = "/tmp/pelmora-log-XXXXXX";
      path = mkdtemp(pattern);
   }
   ~TempDir() { fs::remove_all(path); }
   std::string path;
};

std::string ReadFile(const std::string& path) {
   std::ifstream in(path, std::ios::binary);
   std::stringstream text;
   text << in.rdbuf();
   return text.str();
}

std::vector<std::string> SplitLines(const std::string& text) {
   std::vector<std::string> lines;
   std::stringstream in(text);
   for (std::string line; std::getline(in, line);) lines.push_back(line);
   return lines;
}

// A logger with no writer of its own, at "trivia", on a fresh manager.
Ref<Logger> MakeLogger() {
   Ref<Logger> logger;
   CreateLogger(nullptr, "files", "trivia", nullptr, logger);
   return logger;
}

}  // namespace

TEST(LogFileWriterTest, RolloverKeepsMaxFileNumFilesOfWholeLinesNewestInTheCurrentOne) {
   TempDir dir;
   LogFileOptions options;
   options.path = dir.path + "/service.log";
   options.maxFileSize = 300;
   options.maxFileNum = 3;
   Ref<LogWriter> writer;
   CreateFileLogWriter("file", options, writer);
   Ref<Logger> logger = MakeLogger();
   logger->GetLogOutput()->AddWriter("file", writer.Get());
   for (int i = 0; i < 200; ++i) PELMORA_LOG_INFO(logger.Get(), "line %1 of the test", i);
   logger->GetLogManager()->Flush();

   int files = 0;
   for (const auto& entry : fs::directory_iterator(dir.path)) {
      (void)entry;
      ++files;
   }
   EXPECT_EQ(files, 3);
   ASSERT_TRUE(fs::exists(options.path + ".2"));
   EXPECT_FALSE(fs::exists(options.path + ".3"));

   // Oldest to newest, the lines run on without a gap and end with the last one.
   std::regex lineRule(".* \\[0x[0-9a-f]+ info 'files'\\] line (\\d+) of the test");
   int expected = -1;
   for (const std::string& name : {options.path + ".2", options.path + ".1", options.path}) {
      std::string text = ReadFile(name);
      ASSERT_FALSE(text.empty());
      EXPECT_EQ(text.back(), '\n') << name;
      if (name != options.path) {
         EXPECT_GE(text.size(), 300u) << name;
      }
      for (const std::string& line : SplitLines(text)) {
         std::smatch match;
         ASSERT_TRUE(std::regex_match(line, match, lineRule)) << name << ": " << line;
         int number = std::stoi(match[1]);
         if (expected >= 0) {
            EXPECT_EQ(number, expected) << name;
         }
         expected = number + 1;
      }
   }
   EXPECT_EQ(expected, 200);
}

TEST(LogFileWriterTest, SingleFileStartsAgainWhenFull) {
   TempDir dir;
   LogFileOptions options;
   options.path = dir.path + "/one.log";
   options.maxFileSize = 50;
   options.maxFileNum = 1;
   options.bufferSize = 0;
   Ref<LogWriter> writer;
   CreateFileLogWriter("file", options, writer);
   Ref<Logger> logger = MakeLogger();
   logger->GetLogOutput()->AddWriter("file", writer.Get());
   for (int i = 0; i < 10; ++i) PELMORA_LOG_INFO(logger.Get(), "entry %1", i);
   std::vector<std::string> lines = SplitLines(ReadFile(options.path));
   ASSERT_EQ(lines.size(), 1u);  // each line is longer than the limit
   EXPECT_NE(lines[0].find("entry 9"), std::string::npos);
   EXPECT_EQ(std::distance(fs::directory_iterator(dir.path), fs::directory_iterator()), 1);
}

TEST(LogFileWriterTest, BufferedLinesReachTheFileBySeverityOrInterval) {
   TempDir dir;
   LogFileOptions options;
   options.path = dir.path + "/buffered.log";
   options.flushIntervalMs = 20;
   Ref<LogWriter> writer;
   CreateFileLogWriter("file", options, writer);
   Ref<Logger> logger = MakeLogger();
   logger->GetLogOutput()->AddWriter("file", writer.Get());

   PELMORA_LOG_ERROR(logger.Get(), "at once");
   EXPECT_NE(ReadFile(options.path).find("at once\n"), std::string::npos);

   PELMORA_LOG_INFO(logger.Get(), "later");
   auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
   while (ReadFile(options.path).find("later\n") == std::string::npos &&
          std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
   }
   EXPECT_NE(ReadFile(options.path).find("later\n"), std::string::npos);
}

TEST(LogFileWriterDeathTest, BufferedLinesReachTheFileAtExit) {
   // The child (a new run of this binary) names the file after its parent, this process.
   std::string path = "/tmp/pelmora-log-exit-" + std::to_string(getpid()) + ".log";
   EXPECT_EXIT(
       {
          LogFileOptions options;
          options.path = "/tmp/pelmora-log-exit-" + std::to_string(getppid()) + ".log";
          options.flushIntervalMs = 0;  // only a full buffer, Flush or exit write it out
          Ref<LogWriter> writer;
          CreateFileLogWriter("file", options, writer);
          Ref<Logger> logger = MakeLogger();
          logger->GetLogOutput()->AddWriter("file", writer.Get());
          PELMORA_LOG_INFO(logger.Get(), "left in the buffer");
          exit(0);
       },
       testing::ExitedWithCode(0), "");
   std::string text = ReadFile(path);
   unlink(path.c_str());
   EXPECT_NE(text.find("left in the buffer\n"), std::string::npos) << text;
}

TEST(LogFileWriterTest, ReopenFollowsAnOutsideRotation) {
   TempDir dir;
   LogFileOptions options;
   options.path = dir.path + "/rotated.log";
   Ref<LogWriter> writer;
   CreateFileLogWriter("file", options, writer);
   Ref<Logger> logger = MakeLogger();
   logger->GetLogOutput()->AddWriter("file", writer.Get());

   PELMORA_LOG_INFO(logger.Get(), "before");
   fs::rename(options.path, options.path + ".old");
   PELMORA_LOG_INFO(logger.Get(), "still old");
   logger->GetLogManager()->Reopen();
   PELMORA_LOG_INFO(logger.Get(), "after");
   logger->GetLogManager()->Flush();

   std::string old = ReadFile(options.path + ".old");
   std::string current = ReadFile(options.path);
   EXPECT_NE(old.find("before\n"), std::string::npos);
   EXPECT_NE(old.find("still old\n"), std::string::npos);
   EXPECT_EQ(current.find("before"), std::string::npos);
   EXPECT_NE(current.find("after\n"), std::string::npos);
}

TEST(LogFileWriterTest, UnopenableFileIsRefused) {
   LogFileOptions options;
   options.path = "/nonexistent-dir-for-pelmora/x.log";
   Ref<LogWriter> writer;
   EXPECT_THROW(CreateFileLogWriter("file", options, writer), SystemException);
   options.path = "/tmp/x.log";
   options.level = "loud";
   EXPECT_THROW(CreateFileLogWriter("file", options, writer), InvalidArgumentException);
}

namespace {

// A syslog receiver on a socket in a temporary directory.
class SyslogReceiver {
public:
   explicit SyslogReceiver(const std::string& path) : _path(path) { Bind(); }
   ~SyslogReceiver() { Unbind(); }

   void Bind() {
      _fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      strncpy(address.sun_path, _path.c_str(), sizeof(address.sun_path) - 1);
      EXPECT_EQ(bind(_fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
      timeval wait{2, 0};
      setsockopt(_fd, SOL_SOCKET, SO_RCVTIMEO, &wait, sizeof(wait));
   }
   void Unbind() {
      if (_fd >= 0) close(_fd);
      _fd = -1;
      unlink(_path.c_str());
   }
   std::string Receive() {
      char buffer[16384];
      ssize_t n = recv(_fd, buffer, sizeof(buffer), 0);
      return n < 0 ? std::string("<nothing>") : std::string(buffer, static_cast<size_t>(n));
   }

private:
   std::string _path;
   int _fd = -1;
};

}  // namespace

TEST(LogSyslogWriterTest, LinesArriveWithTheirPriorityAndSurviveTheSocketGoingAway) {
   TempDir dir;
   LogSyslogOptions options;
   options.socketPath = dir.path + "/log";
   options.ident = "logtest";
   options.level = "trivia";
   options.reconnectIntervalMs = 0;
   SyslogReceiver receiver(options.socketPath);
   Ref<SyslogLogWriter> writer;
   CreateSyslogLogWriter("syslog", options, writer);
   Ref<Logger> logger = MakeLogger();
   logger->GetLogOutput()->AddWriter("syslog", writer.Get());

   PELMORA_LOG_ERROR(logger.Get(), "disk failed");
   std::string message = receiver.Receive();
   std::regex rule("<27>[A-Z][a-z]{2} [ 123]\\d \\d{2}:\\d{2}:\\d{2} logtest\\[\\d+\\]: .* "
                   "\\[0x[0-9a-f]+ error 'files'\\] disk failed");
   EXPECT_TRUE(std::regex_match(message, rule)) << message;
   PELMORA_LOG_INFO(logger.Get(), "fine");
   EXPECT_EQ(receiver.Receive().substr(0, 4), "<30>");
   PELMORA_LOG_TRIVIA(logger.Get(), "detail");
   EXPECT_EQ(receiver.Receive().substr(0, 4), "<31>");

   receiver.Unbind();
   PELMORA_LOG_ERROR(logger.Get(), "nobody listens");
   EXPECT_EQ(writer->GetLostCount(), 1u);
   receiver.Bind();
   PELMORA_LOG_WARNING(logger.Get(), "back again");
   message = receiver.Receive();
   EXPECT_EQ(message.substr(0, 4), "<28>");
   EXPECT_NE(message.find("back again"), std::string::npos);
   EXPECT_EQ(writer->GetLostCount(), 1u);
}

TEST(LogSyslogWriterTest, AbsentSocketDropsLinesWithoutWaitingAndLongLinesAreCut) {
   TempDir dir;
   LogSyslogOptions options;
   options.socketPath = dir.path + "/none";
   options.reconnectIntervalMs = 0;
   options.maxMessageSize = 200;
   Ref<SyslogLogWriter> writer;
   CreateSyslogLogWriter("syslog", options, writer);
   Ref<Logger> logger = MakeLogger();
   logger->GetLogOutput()->AddWriter("syslog", writer.Get());
   for (int i = 0; i < 3; ++i) PELMORA_LOG_ERROR(logger.Get(), "lost %1", i);
   EXPECT_EQ(writer->GetLostCount(), 3u);

   SyslogReceiver receiver(options.socketPath);
   PELMORA_LOG_ERROR(logger.Get(), "%1", std::string(500, 'z'));
   EXPECT_EQ(receiver.Receive().size(), 200u);
   EXPECT_EQ(writer->GetTruncatedCount(), 1u);
}

TEST(LogSyslogWriterTest, SeverityMapping) {
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_QUIET), 5);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_PANIC), 2);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_ERROR), 3);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_WARNING), 4);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_INFO), 6);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_VERBOSE), 7);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_TRIVIA), 7);
}
