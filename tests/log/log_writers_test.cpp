// The file writer's rollover, buffering, reopening and failed opens; the syslog writer on
// a socket of the test's own.

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

using namespace Pelmora;
using namespace Pelmora::Service;
namespace fs = std::filesystem;

namespace {

std::string ReadFile(const std::string& path) {
   std::ifstream in(path, std::ios::binary);
   std::stringstream text;
   text << in.rdbuf();
   return text.str();
}

// A temporary directory and a logger at "trivia", on a fresh manager, with one writer.
struct Files {
   Files() {
      char pattern[] = "/tmp/pelmora-log-XXXXXX";
      dir = mkdtemp(pattern);
      CreateLogger(nullptr, "files", "trivia", nullptr, logger);
   }
   ~Files() { fs::remove_all(dir); }
   void AddFile(LogFileOptions& options, const std::string& name) {
      options.path = dir + "/" + name;
      Ref<LogWriter> writer;
      CreateFileLogWriter("file", options, writer);
      logger->GetLogOutput()->AddWriter("file", writer.Get());
   }
   Ref<FileLogWriter> AddFile(LogFileOptions& options, const std::string& name,
                              const LogFileOps& ops) {
      options.path = dir + "/" + name;
      Ref<FileLogWriter> writer;
      CreateFileLogWriter("file", options, ops, writer);
      logger->GetLogOutput()->AddWriter("file", writer.Get());
      return writer;
   }
   std::string dir;
   Ref<Logger> logger;
};

// A syslog receiver on a socket in a temporary directory.
struct SyslogReceiver {
   explicit SyslogReceiver(const std::string& path) : path(path) { Bind(); }
   ~SyslogReceiver() { Unbind(); }
   void Bind() {
      fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
      EXPECT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
      timeval wait{2, 0};
      setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &wait, sizeof(wait));
   }
   void Unbind() {
      if (fd >= 0) close(fd);
      fd = -1;
      unlink(path.c_str());
   }
   std::string Receive(int flags = 0) {
      char buffer[16384];
      ssize_t n = recv(fd, buffer, sizeof(buffer), flags);
      return n < 0 ? std::string("<nothing>") : std::string(buffer, static_cast<size_t>(n));
   }
   // Fills the receive queue from sockets of the test's own until a fresh one cannot
   // send either (each sender's own buffer may fill before the queue does).
   void Fill() {
      for (int senders = 0; senders < 1000; ++senders) {
         int sender = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
         sockaddr_un address{};
         address.sun_family = AF_UNIX;
         strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
         ASSERT_EQ(connect(sender, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
         fillers.push_back(sender);
         int sent = 0;
         while (send(sender, "f", 1, MSG_DONTWAIT) == 1) ++sent;
         if (sent == 0) return;
      }
      FAIL() << "the receive queue never filled";
   }
   // Reads what is queued without waiting.
   int Drain() {
      int n = 0;
      while (Receive(MSG_DONTWAIT) != "<nothing>") ++n;
      for (int filler : fillers) close(filler);
      fillers.clear();
      return n;
   }
   std::string path;
   int fd = -1;
   std::vector<int> fillers;
};

// The text of a syslog datagram after its header.
std::string SyslogLine(const std::string& message) {
   size_t end = message.find("]: ");
   return end == std::string::npos ? message : message.substr(end + 3);
}

// The open, write and rename steps of file writers made with Ops(): a test makes opens
// fail, counts renames, or holds writes until it lets them go.
struct FileOps {
   static inline std::atomic<bool> failOpen{false};
   static inline std::atomic<int> renames{0};
   static inline std::mutex mutex;
   static inline std::condition_variable changed;
   static inline bool holdWrites = false;
   static inline bool writeHeld = false;

   static int Open(const char* path, int flags, mode_t mode) {
      if (failOpen) return errno = EMFILE, -1;
      return ::open(path, flags, mode);
   }
   static ssize_t Write(int fd, const void* data, size_t length) {
      std::unique_lock<std::mutex> lock(mutex);
      if (holdWrites) {
         writeHeld = true;
         changed.notify_all();
         changed.wait(lock, [] { return !holdWrites; });
      }
      return ::write(fd, data, length);
   }
   static int Rename(const char* from, const char* to) {
      ++renames;
      return ::rename(from, to);
   }
   static const LogFileOps& Ops() {
      static const LogFileOps ops{Open, Write, Rename};
      return ops;
   }
};

bool IsValidUtf8(const std::string& text) {
   for (size_t i = 0; i < text.size();) {
      auto byte = static_cast<unsigned char>(text[i]);
      size_t length = byte < 0x80 ? 1 : byte >= 0xF0 ? 4 : byte >= 0xE0 ? 3 : byte >= 0xC0 ? 2 : 0;
      if (length == 0 || i + length > text.size()) return false;
      for (size_t k = 1; k < length; ++k) {
         if ((static_cast<unsigned char>(text[i + k]) & 0xC0) != 0x80) return false;
      }
      i += length;
   }
   return true;
}

size_t HeapInUse() {
   struct mallinfo2 info = mallinfo2();
   return info.uordblks + info.hblkhd;
}

}  // namespace

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

TEST(LogFileWriterTest, RollRenamesOnlyTheRolledFilesThereAre) {
   Files f;
   LogFileOptions options;
   options.maxFileSize = 1;
   options.maxFileNum = 100000;
   options.bufferSize = 0;
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

TEST(LogSyslogWriterTest, LinesArriveWithTheirPriorityAndSurviveTheSocketGoingAway) {
   Files f;
   LogSyslogOptions options;
   options.socketPath = f.dir + "/log";
   options.ident = "logtest";
   options.level = "trivia";
   options.reconnectIntervalMs = 0;
   options.maxMessageSize = 200;
   Ref<SyslogLogWriter> writer;
   CreateSyslogLogWriter("syslog", options, writer);
   f.logger->GetLogOutput()->AddWriter("syslog", writer.Get());
   // No socket yet: lines are dropped without waiting.
   for (int i = 0; i < 3; ++i) PELMORA_LOG_ERROR(f.logger.Get(), "lost %1", i);
   EXPECT_EQ(writer->GetLostCount(), 3u);

   SyslogReceiver receiver(options.socketPath);
   PELMORA_LOG_ERROR(f.logger.Get(), "disk failed");
   std::string message = receiver.Receive();
   std::regex rule("<27>[A-Z][a-z]{2} [ 123]\\d \\d{2}:\\d{2}:\\d{2} logtest\\[\\d+\\]: .* "
                   "\\[0x[0-9a-f]+ error 'files'\\] disk failed");
   EXPECT_TRUE(std::regex_match(message, rule)) << message;
   PELMORA_LOG_INFO(f.logger.Get(), "fine");
   EXPECT_EQ(receiver.Receive().substr(0, 4), "<30>");
   PELMORA_LOG_TRIVIA(f.logger.Get(), "%1", std::string(500, 'z'));
   message = receiver.Receive();
   EXPECT_EQ(message.substr(0, 4), "<31>");
   EXPECT_EQ(SyslogLine(message).size(), 200u);
   EXPECT_EQ(writer->GetTruncatedCount(), 1u);

   receiver.Unbind();
   PELMORA_LOG_ERROR(f.logger.Get(), "nobody listens");
   EXPECT_EQ(writer->GetLostCount(), 4u);
   receiver.Bind();
   PELMORA_LOG_WARNING(f.logger.Get(), "back again");
   message = receiver.Receive();
   EXPECT_EQ(message.substr(0, 4), "<28>");
   EXPECT_NE(message.find("back again"), std::string::npos);
   EXPECT_EQ(writer->GetLostCount(), 4u);
   // The levels the lines above do not show.
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_QUIET), 5);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_PANIC), 2);
   EXPECT_EQ(GetSyslogSeverity(Logger::LOG_VERBOSE), 7);
}

TEST(LogSyslogWriterTest, FullSocketIsWaitedForWithinTheBoundsAndThenDropped) {
   Files f;
   LogSyslogOptions options;
   options.socketPath = f.dir + "/log";
   options.level = "trivia";
   SyslogReceiver receiver(options.socketPath);
   auto elapsedMs = [](std::chrono::steady_clock::time_point start) {
      return std::chrono::duration_cast<std::chrono::milliseconds>(
                 std::chrono::steady_clock::now() - start).count();
   };
   auto makeWriter = [&](int timeoutMs, int budgetMs) {
      options.sendTimeoutMs = timeoutMs;
      options.sendWaitBudgetMs = budgetMs;
      Ref<SyslogLogWriter> writer;
      CreateSyslogLogWriter("syslog", options, writer);
      Ref<LogWriter> removed;
      f.logger->GetLogOutput()->RemoveWriter("syslog", removed);
      f.logger->GetLogOutput()->AddWriter("syslog", writer.Get());
      return writer;
   };

   // A receiver slower than the burst: nothing lost, in order. The bounds are far off.
   Ref<SyslogLogWriter> writer = makeWriter(10000, 10000);
   constexpr int kBurst = 1000;
   std::vector<std::string> received;
   std::thread reader([&] {
      for (int i = 0; i < kBurst; ++i) {
         std::string message = receiver.Receive();
         if (message == "<nothing>") break;  // two seconds without a line: some were lost
         received.push_back(SyslogLine(message));
         if (i % 10 == 0) std::this_thread::sleep_for(std::chrono::microseconds(200));
      }
   });
   for (int i = 0; i < kBurst; ++i) PELMORA_LOG_INFO(f.logger.Get(), "burst %1", i);
   Pelmora::Testing::Join(reader, "the slow reader");
   EXPECT_EQ(writer->GetLostCount(), 0u);
   ASSERT_EQ(received.size(), size_t(kBurst));
   for (int i = 0; i < kBurst; ++i) {
      ASSERT_NE(received[i].find("] burst " + std::to_string(i)), std::string::npos) << received[i];
   }

   // A receiver that never reads costs one bound, not one per line.
   writer = makeWriter(50, 10000);
   receiver.Fill();
   auto start = std::chrono::steady_clock::now();
   for (int i = 0; i < 40; ++i) PELMORA_LOG_INFO(f.logger.Get(), "unread %1", i);
   EXPECT_LT(elapsedMs(start), 1000);  // 40 bounds would be 2000
   EXPECT_EQ(writer->GetLostCount(), 40u);
   // Once it reads again, lines get through (and are waited for) again.
   receiver.Drain();
   PELMORA_LOG_INFO(f.logger.Get(), "read again");
   EXPECT_NE(receiver.Receive().find("] read again"), std::string::npos);
   EXPECT_EQ(writer->GetLostCount(), 40u);

   // A receiver that trickles costs at most the budget per second.
   writer = makeWriter(1000, 100);
   receiver.Fill();
   std::atomic<bool> stop{false};
   std::thread trickle([&] {
      while (!stop) {
         std::this_thread::sleep_for(std::chrono::milliseconds(50));
         receiver.Receive(MSG_DONTWAIT);
      }
   });
   start = std::chrono::steady_clock::now();
   for (int i = 0; i < 20; ++i) PELMORA_LOG_INFO(f.logger.Get(), "trickle %1", i);
   EXPECT_LT(elapsedMs(start), 600);  // a slot per 50 ms for each line would be 1000
   EXPECT_GT(writer->GetLostCount(), 0u);
   stop = true;
   Pelmora::Testing::Join(trickle, "the trickling reader");
   receiver.Drain();
}

TEST(LogSyslogWriterTest, LongLinesAreCutToTheLineLimitAtACharacterBoundaryAndNotKept) {
   Files f;
   LogSyslogOptions options;
   options.socketPath = f.dir + "/log";
   SyslogReceiver receiver(options.socketPath);
   auto send = [&](int maxMessageSize, auto&& log) {
      options.maxMessageSize = maxMessageSize;
      Ref<SyslogLogWriter> writer;
      CreateSyslogLogWriter("syslog", options, writer);
      f.logger->GetLogOutput()->AddWriter("syslog", writer.Get());
      log();
      Ref<LogWriter> removed;
      f.logger->GetLogOutput()->RemoveWriter("syslog", removed);
      return std::make_pair(SyslogLine(receiver.Receive()), writer->GetTruncatedCount());
   };
   std::string full = send(8192, [&] { PELMORA_LOG_INFO(f.logger.Get(), "%1", "x"); }).first;
   size_t prefix = full.size() - 1;

   // Two-, three- and four-byte characters, cut at every offset of each (64 is the least
   // limit taken; a prefix is about 50 bytes).
   std::string text;
   for (int i = 0; i < 10; ++i) text += "a\xC3\xA9\xE2\x82\xAC\xF0\x9D\x84\x9E";
   ASSERT_LT(prefix, 64u);
   for (size_t size = 64; size < 84; ++size) {
      auto [line, cuts] = send(static_cast<int>(size),
                               [&] { PELMORA_LOG_INFO(f.logger.Get(), "%1", text); });
      EXPECT_TRUE(IsValidUtf8(line)) << size;
      EXPECT_LE(line.size(), size);
      EXPECT_GT(line.size() + 4, size);
      size_t body = std::min(prefix, line.size());
      EXPECT_EQ(line.substr(body), text.substr(0, line.size() - body));
      EXPECT_EQ(cuts, 1u);
   }

   // A character split between two pieces of a line, with the limit right between them.
   std::string first = std::string(1499, 'p') + "\xE2";
   std::string second = "\x82\xAC" + std::string(1500, 'q');
   auto [line, cuts] = send(static_cast<int>(prefix + first.size()), [&] {
      f.logger->Begin(Logger::LOG_INFO);
      f.logger->Write(first);
      f.logger->Write(second);
      f.logger->End();
   });
   EXPECT_EQ(line.substr(std::min(prefix, line.size())), std::string(1499, 'p'));
   EXPECT_EQ(cuts, 1u);

   // A huge line is cut while it arrives, and its size is not kept afterwards.
   options.maxMessageSize = 8192;
   Ref<SyslogLogWriter> writer;
   CreateSyslogLogWriter("syslog", options, writer);
   f.logger->GetLogOutput()->AddWriter("syslog", writer.Get());
   size_t before = HeapInUse();
   PELMORA_LOG_INFO(f.logger.Get(), "%1", std::string(8 << 20, 'h'));
   EXPECT_LT(HeapInUse(), before + (1 << 20));
   EXPECT_EQ(SyslogLine(receiver.Receive()).size(), 8192u);
   EXPECT_EQ(writer->GetTruncatedCount(), 1u);
   // With a large limit, the room one long line needed is given back after it.
   Ref<LogWriter> removed;
   f.logger->GetLogOutput()->RemoveWriter("syslog", removed);
   options.maxMessageSize = 200000;
   CreateSyslogLogWriter("syslog", options, writer);
   f.logger->GetLogOutput()->AddWriter("syslog", writer.Get());
   before = HeapInUse();
   PELMORA_LOG_INFO(f.logger.Get(), "%1", std::string(150000, 'l'));
   EXPECT_LT(HeapInUse(), before + 65536);
   EXPECT_NE(receiver.Receive().find("] lll"), std::string::npos);
   EXPECT_EQ(writer->GetTruncatedCount() + writer->GetLostCount(), 0u);
}
