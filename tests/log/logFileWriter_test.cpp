// The file writer: rollover, buffering, reopening and failed opens.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service.h"
#include "src/log/logImpl.h"
#include "tests/support/watchdog.h"
#include "tests/support/logWriters.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;
namespace fs = std::filesystem;

TEST(LogFileWriterTest, RolloverKeepsMaxFileNumFilesOfWholeLinesNewestInTheCurrentOne) {
   struct Case { int maxSize, maxNum, lines, bufferSize; };
   // 50 bytes: every line overfills the single file, which starts again each time.
   for (Case c : {Case{300, 3, 200, 65536}, Case{50, 1, 10, 0}}) {
      Files f;
      LogFileOptions options;
      options.maxFileSize = c.maxSize;
      options.maxFileNum = c.maxNum;
      options.bufferSize = c.bufferSize;
      f.AddFile(options, "service.log");
      for (int i = 0; i < c.lines; ++i) PELMORA_LOG_INFO(f.logger.Get(), "line %1 of the test", i);
      f.logger->GetLogManager()->Flush();

      EXPECT_EQ(std::distance(fs::directory_iterator(f.dir), fs::directory_iterator()), c.maxNum);
      std::vector<std::string> names;
      for (int i = c.maxNum - 1; i >= 1; --i)
         names.push_back(options.path + "." + std::to_string(i));
      names.push_back(options.path);
      // Oldest to newest, the lines run on without a gap and end with the last one; a file
      // is rolled over at the first line start once full.
      std::regex lineRule(".* \\[0x[0-9a-f]+ info 'files'\\] line (\\d+) of the test");
      int expected = -1;
      for (const std::string& name : names) {
         std::string text = ReadFile(name);
         ASSERT_FALSE(text.empty()) << name;
         EXPECT_EQ(text.back(), '\n') << name;
         EXPECT_TRUE(name == options.path || text.size() >= size_t(c.maxSize)) << name;
         EXPECT_LT(text.rfind('\n', text.size() - 2) + 1, size_t(c.maxSize)) << name;
         std::stringstream in(text);
         for (std::string line; std::getline(in, line);) {
            std::smatch match;
            ASSERT_TRUE(std::regex_match(line, match, lineRule)) << name << ": " << line;
            EXPECT_TRUE(expected < 0 || std::stoi(match[1]) == expected) << name << ": " << line;
            expected = std::stoi(match[1]) + 1;
         }
      }
      EXPECT_EQ(expected, c.lines);
   }
}

TEST(LogFileWriterTest, BufferedLinesReachTheFileBySeverityOrInterval) {
   Files f;
   LogFileOptions options;
   options.flushIntervalMs = 20;
   f.AddFile(options, "buffered.log");
   PELMORA_LOG_ERROR(f.logger.Get(), "at once");
   EXPECT_NE(ReadFile(options.path).find("at once\n"), std::string::npos);

   PELMORA_LOG_INFO(f.logger.Get(), "later");
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
          Ref<Logger> logger;
          CreateLogger(nullptr, "files", "trivia", nullptr, logger);
          logger->GetLogOutput()->AddWriter("file", writer.Get());
          PELMORA_LOG_INFO(logger.Get(), "left in the buffer");
          exit(0);
       },
       testing::ExitedWithCode(0), "");
   std::string text = ReadFile(path);
   unlink(path.c_str());
   EXPECT_NE(text.find("left in the buffer\n"), std::string::npos) << text;
}

TEST(LogFileWriterTest, ReopenFollowsAnOutsideRotationAndUnopenableFilesAreRefused) {
   Files f;
   LogFileOptions options;
   f.AddFile(options, "rotated.log");
   PELMORA_LOG_INFO(f.logger.Get(), "before");
   fs::rename(options.path, options.path + ".old");
   PELMORA_LOG_INFO(f.logger.Get(), "still old");
   f.logger->GetLogManager()->Reopen();
   PELMORA_LOG_INFO(f.logger.Get(), "after");
   f.logger->GetLogManager()->Flush();
   std::string old = ReadFile(options.path + ".old");
   EXPECT_NE(old.find("before\n"), std::string::npos);
   EXPECT_NE(old.find("still old\n"), std::string::npos);
   EXPECT_TRUE(std::regex_match(ReadFile(options.path), std::regex("[^\n]*after\n")));

   Ref<LogWriter> writer;
   options.path = "/nonexistent-dir-for-pelmora/x.log";
   EXPECT_THROW(CreateFileLogWriter("file", options, writer), SystemException);
   options.path = f.dir + "/x.log";
   options.level = "loud";
   EXPECT_THROW(CreateFileLogWriter("file", options, writer), InvalidArgumentException);
}

TEST(LogFileWriterTest, FailedOpenAfterARollKeepsTheFilesAndHoldsLinesUntilAnOpenSucceeds) {
   Files f;
   LogFileOptions options;
   options.maxFileSize = 1;  // every line rolls the one before it over
   options.maxFileNum = 4;
   options.bufferSize = 0;
   options.maxHeldBytes = 1000;
   options.reopenRetryMs = 0;
   Ref<FileLogWriter> writer = f.AddFile(options, "held.log", FileOps::Ops());
   for (int i = 0; i < 4; ++i) PELMORA_LOG_INFO(f.logger.Get(), "line %1", i);
   FileOps::renames = 0;
   FileOps::failOpen = true;
   for (int i = 0; i < 20; ++i) PELMORA_LOG_INFO(f.logger.Get(), "held %1", i);
   f.logger->GetLogManager()->Flush();
   // One roll, then nothing is renamed while the file cannot be opened.
   EXPECT_EQ(FileOps::renames, 3);
   EXPECT_FALSE(fs::exists(options.path));
   for (int i = 1; i <= 3; ++i) {
      std::string rolled = ReadFile(options.path + "." + std::to_string(i));
      EXPECT_NE(rolled.find("] line " + std::to_string(4 - i) + "\n"), std::string::npos) << i;
   }

   FileOps::failOpen = false;
   PELMORA_LOG_INFO(f.logger.Get(), "after");
   EXPECT_NE(ReadFile(options.path).find("] after\n"), std::string::npos);
   // The held lines went to the reopened file first, whole and in order, up to the limit;
   // the rest were counted.
   std::string held = ReadFile(options.path + ".1");
   EXPECT_LE(held.size(), 1000u);
   std::vector<std::string> lines;
   std::stringstream in(held);
   for (std::string line; std::getline(in, line);) lines.push_back(line);
   ASSERT_FALSE(lines.empty());
   for (size_t i = 0; i < lines.size(); ++i) {
      EXPECT_NE(lines[i].find("] held " + std::to_string(i)), std::string::npos) << lines[i];
   }
   EXPECT_EQ(lines.size() + writer->GetLostCount(), 20u);
   EXPECT_GT(writer->GetLostCount(), 0u);

   // A line dropped for want of room stays dropped to its end, even when the file opens
   // again in its middle.
   uint64_t lost = writer->GetLostCount();
   FileOps::failOpen = true;
   f.logger->Begin(Logger::LOG_INFO);
   f.logger->Write(std::string(1500, 'd'));  // rolls, cannot open, does not fit: dropped
   FileOps::failOpen = false;
   f.logger->GetLogManager()->Reopen();
   f.logger->Write(std::string(1500, 't'));
   f.logger->End();
   PELMORA_LOG_INFO(f.logger.Get(), "last");
   EXPECT_EQ(writer->GetLostCount(), lost + 1);
   EXPECT_EQ(ReadFile(options.path + ".1").find("tttt"), std::string::npos);
   EXPECT_TRUE(std::regex_match(ReadFile(options.path), std::regex("[^\\n]*\\] last\\n")));
}

// Unbuffered, rolling over at every line.
LogFileOptions RollingEveryLine(int maxFileNum) {
   LogFileOptions options;
   options.maxFileSize = 1;
   options.maxFileNum = maxFileNum;
   options.bufferSize = 0;
   return options;
}

TEST(LogFileWriterTest, RollRenamesOnlyTheRolledFilesThereAre) {
   Files f;
   LogFileOptions options = RollingEveryLine(100000);
   std::ofstream(f.dir + "/many.log.1") << "old 1\n";
   std::ofstream(f.dir + "/many.log.2") << "old 2\n";
   std::ofstream(f.dir + "/many.log.x") << "not a rolled file\n";
   f.AddFile(options, "many.log", FileOps::Ops());
   FileOps::renames = 0;
   for (int i = 0; i < 4; ++i) PELMORA_LOG_INFO(f.logger.Get(), "line %1", i);
   // Three rolls over 2, 3 and 4 rolled files: one rename per file.
   EXPECT_EQ(FileOps::renames, 3 + 4 + 5);
   EXPECT_EQ(ReadFile(options.path + ".4"), "old 1\n");
   EXPECT_EQ(ReadFile(options.path + ".5"), "old 2\n");
   for (int i = 0; i < 3; ++i) {
      std::string rolled = ReadFile(options.path + "." + std::to_string(3 - i));
      EXPECT_NE(rolled.find("] line " + std::to_string(i)), std::string::npos) << i;
   }
   EXPECT_FALSE(fs::exists(options.path + ".6"));
}

TEST(LogFileWriterTest, RollDropsTheOldestFileBeforeRenamingNoneOverAnother) {
   Files f;
   LogFileOptions options = RollingEveryLine(3);
   f.AddFile(options, "full.log", FileOps::Ops());
   FileOps::renamesOverFiles = 0;
   for (int i = 0; i < 6; ++i) PELMORA_LOG_INFO(f.logger.Get(), "line %1", i);
   EXPECT_EQ(FileOps::renamesOverFiles, 0);
   for (int i = 0; i < 3; ++i) {
      std::string name = options.path + (i == 0 ? "" : "." + std::to_string(i));
      EXPECT_NE(ReadFile(name).find("] line " + std::to_string(5 - i) + "\n"), std::string::npos)
          << name;
   }
   EXPECT_FALSE(fs::exists(options.path + ".3"));
}

TEST(LogFileWriterTest, SlowDiskUnderTheFlusherHoldsUpOnlyItsOwnWriter) {
   Files f;
   LogFileOptions options;
   options.flushIntervalMs = 10;
   f.AddFile(options, "slow.log", FileOps::Ops());
   {
      std::lock_guard<std::mutex> lock(FileOps::mutex);
      FileOps::holdWrites = true;
      FileOps::writeHeld = false;
   }
   PELMORA_LOG_INFO(f.logger.Get(), "buffered");  // the flusher writes it, and is held
   {
      Pelmora::Testing::Watchdog watchdog("the flusher to write");
      std::unique_lock<std::mutex> lock(FileOps::mutex);
      FileOps::changed.wait(lock, [] { return FileOps::writeHeld; });
   }
   // Making and destroying another file writer does not wait for that write.
   std::mutex mutex;
   std::condition_variable doneChanged;
   bool done = false;
   std::thread other([&] {
      LogFileOptions otherOptions;
      otherOptions.path = f.dir + "/other.log";
      Ref<LogWriter> writer;
      CreateFileLogWriter("other", otherOptions, writer);
      writer.Reset();
      std::lock_guard<std::mutex> lock(mutex);
      done = true;
      doneChanged.notify_all();
   });
   bool finished;
   {
      std::unique_lock<std::mutex> lock(mutex);
      finished = doneChanged.wait_for(lock, std::chrono::seconds(2), [&] { return done; });
   }
   EXPECT_TRUE(finished);
   {
      std::lock_guard<std::mutex> lock(FileOps::mutex);
      FileOps::holdWrites = false;
   }
   FileOps::changed.notify_all();
   Pelmora::Testing::Join(other, "the other writer to come and go");
   f.logger->GetLogManager()->Flush();
   EXPECT_NE(ReadFile(options.path).find("] buffered\n"), std::string::npos);
}
