// The syslog writer on a socket of the test's own.

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
