// Lines and their prefix, nesting, long lines and the log context.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <fstream>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/writers.h"
#include "pelmora/object/ref.h"
#include "pelmora/service.h"
#include "tests/support/watchdog.h"
#include "tests/support/logLines.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;

TEST(LogLineTest, PrefixHasDateTimeBiasThreadLevelSubsystemAndThisThreadsContextInKeyOrder) {
   TestLogger t;
   std::vector<std::string> seen;
   AddLogContextUpdateCallback("test", [&seen](const std::string& key, const std::string& value) {
      seen.push_back(key + "=" + value);
   });
   SetLogContext("user", "ann");
   RemoveLogContextUpdateCallback("test");
   SetLogContext("request", "12");
   PELMORA_LOG_WARNING(t.logger.Get(), "disk at %1%%", 93);
   std::thread([&t] { PELMORA_LOG_INFO(t.logger.Get(), "theirs"); }).join();
   SetLogContext("user", "");
   SetLogContext("request", "");
   EXPECT_EQ(GetLogContext("request"), "");
   PELMORA_LOG_INFO(t.logger.Get(), "plain");
   EXPECT_EQ(seen, std::vector<std::string>{"user=ann"});

   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 3u);
   EXPECT_TRUE(Matches(lines[0], "warning 'sub' request=12 user=ann\\] disk at 93%")) << lines[0];
   EXPECT_TRUE(Matches(lines[1], "info 'sub'\\] theirs")) << lines[1];
   EXPECT_TRUE(Matches(lines[2], "info 'sub'\\] plain")) << lines[2];
   EXPECT_EQ(t.target->pieces.size(), 3u);  // a short line reaches the output in one piece
}

// One thread alternating between loggers of names of one length, between levels, and a
// name too long for the prefix kept per thread: each line names its own logger and level.
TEST(LogLineTest, EachLineNamesItsOwnLoggerAndLevelWhateverCameBefore) {
   TestLogger t("trivia");
   Ref<Logger> same, other, longName;
   t.logger->CreateLogger("abc", same);
   t.logger->CreateLogger("abd", other);
   t.logger->CreateLogger(std::string(90, 'n'), longName);
   for (Logger* logger : {same.Get(), other.Get(), longName.Get()}) {
      ASSERT_TRUE(logger->SetLevelByName("trivia"));
   }
   ASSERT_EQ(same->GetSubsystemName().size(), other->GetSubsystemName().size());
   ASSERT_EQ(same->GetLogOutput(), t.logger->GetLogOutput());
   Logger* order[] = {same.Get(), other.Get(), longName.Get(), same.Get(), same.Get()};
   const char* levels[] = {"info", "info", "warning", "warning", "trivia"};
   PELMORA_LOG_INFO(order[0], "n=%1", 0);
   PELMORA_LOG_INFO(order[1], "n=%1", 1);
   PELMORA_LOG_WARNING(order[2], "n=%1", 2);
   PELMORA_LOG_WARNING(order[3], "n=%1", 3);
   PELMORA_LOG_TRIVIA(order[4], "n=%1", 4);
   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 5u);
   for (size_t i = 0; i < lines.size(); ++i) {
      std::string rest = std::string(levels[i]) + " '" + order[i]->GetSubsystemName() +
                         "'\\] n=" + std::to_string(i);
      EXPECT_TRUE(Matches(lines[i], rest)) << lines[i];
   }
}

// A call site keeps its format parsed only when the format is a literal: a format in a
// buffer that changes between calls through one site gives each line its own text, and
// threads racing to a literal site's first line all get theirs whole.
TEST(LogLineTest, ACallSiteKeepsOnlyALiteralFormatParsed) {
   TestLogger t;
   char format[32];
   for (const char* text : {"first %1 line", "second %1 row"}) {
      strcpy(format, text);
      PELMORA_LOG_INFO(t.logger.Get(), format, 7);
   }
   std::vector<std::thread> threads;
   for (int i = 0; i < 4; ++i) {
      threads.emplace_back([&t, i] {
         for (int k = 0; k < 50; ++k) PELMORA_LOG_INFO(t.logger.Get(), "%% thread %1 line %2 %x", i, k);
      });
   }
   for (std::thread& thread : threads) thread.join();

   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 202u);
   EXPECT_TRUE(Matches(lines[0], "info 'sub'\\] first 7 line")) << lines[0];
   EXPECT_TRUE(Matches(lines[1], "info 'sub'\\] second 7 row")) << lines[1];
   std::vector<int> next(4, 0);
   for (size_t i = 2; i < lines.size(); ++i) {
      std::smatch match;
      ASSERT_TRUE(std::regex_search(lines[i], match, std::regex("\\] % thread (\\d) line (\\d+) %x$")))
          << lines[i];
      int thread = std::stoi(match[1]);
      EXPECT_EQ(std::stoi(match[2]), next[thread]++) << lines[i];
   }
}

TEST(LogLineTest, UnwantedLevelFormatsAndEvaluatesNothing) {
   TestLogger t("info");
   t.logger->SetMemLevelByName("info");  // verbose is wanted nowhere
   CountingObject counted;
   int evaluated = 0;
   auto next = [&evaluated] { return ++evaluated; };
   PELMORA_LOG_VERBOSE(t.logger.Get(), "%1 %2", counted, next());
   EXPECT_EQ(counted.calls, 0);
   EXPECT_EQ(evaluated, 0);
   EXPECT_TRUE(t.target->pieces.empty());

   PELMORA_LOG_INFO(t.logger.Get(), "%1 %2", counted, next());
   EXPECT_EQ(counted.calls, 1);
   ASSERT_EQ(t.Lines().size(), 1u);
   EXPECT_NE(t.Lines()[0].find("] counted 1"), std::string::npos);
}

TEST(LogLineTest, BadFormatEndsTheLineAndNestedCallIsASeparateLineMarkedWithItsDepth) {
   TestLogger t;
   CountingObject counted;
   counted.nested = t.logger.Get();
   PELMORA_LOG_ERROR(t.logger.Get(), "before %3 after", 1);
   PELMORA_LOG_ERROR(t.logger.Get(), "outer %1 end", counted);
   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 3u);
   EXPECT_TRUE(Matches(lines[0], "error 'sub'\\] before ")) << lines[0];
   EXPECT_TRUE(Matches(lines[1], "error 'sub'\\] \\(Log recursion level 1\\) inner 7")) << lines[1];
   EXPECT_TRUE(Matches(lines[2], "error 'sub'\\] outer counted end")) << lines[2];
}

TEST(LogLineTest, LargePiecesGoStraightThroughAndOtherPiecesStayWithinTheChunk) {
   TestLogger t;
   std::string big(1500, 'b'), medium(1000, 'm');
   PELMORA_LOG_INFO(t.logger.Get(), "%1|%2|%3|%4", medium, medium, big, medium);
   ASSERT_EQ(t.Lines().size(), 1u);
   EXPECT_NE(t.Lines()[0].find(medium + "|" + medium + "|" + big + "|" + medium),
             std::string::npos);
   int bigPieces = 0;
   for (const std::string& piece : t.target->pieces) {
      bigPieces += piece == big;
      EXPECT_TRUE(piece == big || piece.size() <= 2048u) << piece.size();
   }
   EXPECT_EQ(bigPieces, 1);
}

// Around the chunk's size one of these lines ends exactly at its edge, so that the newline
// starts the next chunk; every line must still arrive whole, with one newline at its end.
TEST(LogLineTest, LinesEndingAtTheChunksEdgeKeepTheirNewline) {
   TestLogger t;
   for (size_t length = 1900; length <= 2100; ++length) {
      PELMORA_LOG_INFO(t.logger.Get(), "%1", std::string(length, 'e'));
   }
   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 201u);
   for (size_t i = 0; i < lines.size(); ++i) {
      std::string text = "] " + std::string(1900 + i, 'e');
      ASSERT_GE(lines[i].size(), text.size());
      EXPECT_EQ(lines[i].substr(lines[i].size() - text.size()), text) << i;
   }
   EXPECT_EQ(t.target->Text().back(), '\n');
}

// A long line holds the output from its first flush to its end, fast path on or off.
class LongLineTest : public testing::TestWithParam<bool> {};

TEST_P(LongLineTest, LongLineArrivesWholeWhileAnotherThreadLogs) {
   bool saved = IsUsingLogFastPath();
   SetUsingLogFastPath(GetParam());
   TestLogger t;
   std::atomic<bool> stop{false};
   std::atomic<int> shortLines{0};
   std::thread other([&] {
      while (!stop.load()) {
         PELMORA_LOG_INFO(t.logger.Get(), "short %1", 1);
         ++shortLines;
      }
   });
   {
      Pelmora::Testing::Watchdog watchdog("the other thread's first line");
      while (shortLines.load() == 0) std::this_thread::yield();
   }
   std::string chunk(300, 'x'), tail = chunk + std::string(300, 'y');
   for (int i = 0; i < 300; ++i) {  // ten pieces that fit the chunk: several flushes per line
      PELMORA_LOG_INFO(t.logger.Get(), "long %1%2%3%4%5%6%7%8%9", chunk, chunk, chunk, chunk,
                       chunk, chunk, chunk, chunk, tail);
   }
   stop = true;
   Pelmora::Testing::Join(other, "other to finish");
   SetUsingLogFastPath(saved);

   std::string body = "long " + std::string(2700, 'x') + std::string(300, 'y');
   int longLines = 0;
   for (const std::string& line : t.Lines()) {
      std::string rest = line.substr(line.find("] ") + 2);
      if (rest != "short 1") {
         ASSERT_EQ(rest, body);
         ++longLines;
      }
   }
   EXPECT_EQ(longLines, 300);
}

INSTANTIATE_TEST_SUITE_P(FastPath, LongLineTest, testing::Bool());

TEST(LogContextDeathTest, CallbacksOutliveStaticDestruction) {
   // Static destruction runs as exit runs it; then this thread does what a detached
   // thread still running at that moment may do.
   EXPECT_EXIT(
       {
          // Callbacks with state on the heap, so that a destroyed registry shows.
          std::string state(200, 's');
          for (int i = 0; i < 100; ++i) {
             AddLogContextUpdateCallback("exit " + std::to_string(i),
                                         [state](const std::string&, const std::string&) {
                                            if (state.size() != 200) abort();
                                         });
          }
          SetLogContext("phase", "running");
          __cxa_finalize(nullptr);
          SetLogContext("phase", "exiting");
          AddLogContextUpdateCallback("late", [](const std::string&, const std::string&) {});
          RemoveLogContextUpdateCallback("late");
          SetLogContext("phase", "");
          _exit(0);
       },
       testing::ExitedWithCode(0), "");
}
