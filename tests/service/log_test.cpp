// Loggers, lines and their prefix, levels, nesting, the log context and the memory ring.

#include <gtest/gtest.h>

#include <atomic>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/writers.h"
#include "pelmora/object/ref.h"
#include "pelmora/service.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

// Keeps every piece an output hands to it, in order.
class PieceWriter : public virtual Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override { pieces.emplace_back(data, length); }
   void Close() override {}
   std::string Text() const {
      std::string text;
      for (const std::string& piece : pieces) text += piece;
      return text;
   }
   std::vector<std::string> pieces;
};

// Counts how often it is formatted; may log while being formatted.
class CountingObject : public ObjectImpl {
public:
   std::string ToString() const override {
      ++calls;
      if (nested) PELMORA_LOG_ERROR(nested, "inner %1", 7);
      return "counted";
   }
   mutable std::atomic<int> calls{0};
   Logger* nested = nullptr;
};

struct TestLogger {
   explicit TestLogger(const std::string& level = "info") {
      target = new PieceWriter();
      CreateLogger(target.Get(), "sub", level, nullptr, logger);
   }
   std::vector<std::string> Lines() const {
      std::vector<std::string> lines;
      std::string text = target->Text();
      size_t start = 0;
      for (size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1) {
         lines.push_back(text.substr(start, end - start));
      }
      return lines;
   }
   Ref<PieceWriter> target;
   Ref<Logger> logger;
};

const char kPrefix[] =
    "\\d{4}-\\d{2}-\\d{2}T\\d{2}:\\d{2}:\\d{2}\\.\\d{3}[+-]\\d{2}:\\d{2} \\[0x[0-9a-f]+ ";

}  // namespace

TEST(LogLineTest, PrefixHasDateTimeBiasThreadLevelSubsystemAndContextInKeyOrder) {
   TestLogger t;
   SetLogContext("user", "ann");
   SetLogContext("request", "12");
   PELMORA_LOG_WARNING(t.logger.Get(), "disk at %1%%", 93);
   SetLogContext("user", "");
   SetLogContext("request", "");
   PELMORA_LOG_INFO(t.logger.Get(), "plain");

   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 2u);
   EXPECT_TRUE(std::regex_match(lines[0], std::regex(std::string(kPrefix) +
                                                     "warning 'sub' request=12 user=ann\\] "
                                                     "disk at 93%")))
       << lines[0];
   EXPECT_TRUE(std::regex_match(lines[1], std::regex(std::string(kPrefix) + "info 'sub'\\] plain")))
       << lines[1];
   // A short line reaches the output in one piece.
   EXPECT_EQ(t.target->pieces.size(), 2u);
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
   EXPECT_EQ(evaluated, 1);
   ASSERT_EQ(t.Lines().size(), 1u);
   EXPECT_NE(t.Lines()[0].find("] counted 1"), std::string::npos);
}

TEST(LogLineTest, BadFormatEndsTheLineAndDoesNotThrow) {
   TestLogger t;
   PELMORA_LOG_ERROR(t.logger.Get(), "before %3 after", 1);
   PELMORA_LOG_ERROR(t.logger.Get(), "next");
   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 2u);
   EXPECT_EQ(lines[0].substr(lines[0].size() - 7), "before ");
   EXPECT_EQ(lines[1].substr(lines[1].size() - 4), "next");
}

TEST(LogLineTest, NestedLogCallIsASeparateLineMarkedWithItsDepth) {
   TestLogger t;
   CountingObject counted;
   counted.nested = t.logger.Get();
   PELMORA_LOG_ERROR(t.logger.Get(), "outer %1 end", counted);
   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 2u);
   EXPECT_TRUE(std::regex_match(
       lines[0], std::regex(std::string(kPrefix) + "error 'sub'\\] \\(Log recursion level 1\\) inner 7")))
       << lines[0];
   EXPECT_TRUE(std::regex_match(lines[1], std::regex(std::string(kPrefix) + "error 'sub'\\] outer counted end")))
       << lines[1];
}

TEST(LogLineTest, LargePiecesGoStraightThroughAndOtherPiecesStayWithinTheChunk) {
   TestLogger t;
   std::string big(1500, 'b');
   std::string medium(1000, 'm');
   PELMORA_LOG_INFO(t.logger.Get(), "%1|%2|%3|%4", medium, medium, big, medium);
   bool sawBig = false;
   for (const std::string& piece : t.target->pieces) {
      if (piece == big) sawBig = true;
      else EXPECT_LE(piece.size(), 2048u);
   }
   EXPECT_TRUE(sawBig);
   ASSERT_EQ(t.Lines().size(), 1u);
   EXPECT_NE(t.Lines()[0].find(medium + "|" + medium + "|" + big + "|" + medium),
             std::string::npos);
}

// Run with the fast path on and off: a long line holds the output from its first flush to
// its end either way.
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
   while (shortLines.load() == 0) std::this_thread::yield();
   std::string chunk(300, 'x');
   for (int i = 0; i < 300; ++i) {
      // Ten pieces, each small enough for the chunk: the line crosses several flushes.
      PELMORA_LOG_INFO(t.logger.Get(), "long %1%2%3%4%5%6%7%8%9", chunk, chunk, chunk, chunk,
                       chunk, chunk, chunk, chunk, chunk + std::string(300, 'y'));
   }
   stop = true;
   other.join();
   SetUsingLogFastPath(saved);

   int longLines = 0;
   std::string body = "long ";
   for (int i = 0; i < 9; ++i) body += chunk;
   body += std::string(300, 'y');
   for (const std::string& line : t.Lines()) {
      if (line.find("] short") != std::string::npos) {
         ASSERT_EQ(line.substr(line.find("] ")), "] short 1");
         continue;
      }
      ++longLines;
      ASSERT_EQ(line.size() - line.find("] ") - 2, body.size());
      ASSERT_NE(line.find(body), std::string::npos);
   }
   EXPECT_EQ(longLines, 300);
}

INSTANTIATE_TEST_SUITE_P(FastPath, LongLineTest, testing::Bool());

TEST(LogLevelTest, NamesInstallCumulativeMasksAndUnknownNamesAreRefused) {
   TestLogger t;
   const char* names[] = {"none", "quiet", "panic", "error", "warning", "info", "verbose", "trivia"};
   Logger::CombinedLevel expected = 0;
   for (int i = 0; i < 8; ++i) {
      ASSERT_TRUE(t.logger->SetLevelByName(names[i]));
      ASSERT_TRUE(t.logger->SetMemLevelByName(names[i]));
      EXPECT_EQ(t.logger->GetCombinedMask(), expected | (expected << 16)) << names[i];
      EXPECT_EQ(t.logger->GetLevelByName(), names[i]);
      EXPECT_EQ(t.logger->GetMemLevelByName(), names[i]);
      expected = expected * 2 + 1;
   }
   t.logger->SetLevelByName("warning");
   t.logger->SetMemLevelByName("verbose");
   EXPECT_FALSE(t.logger->SetLevelByName("Info"));
   EXPECT_FALSE(t.logger->SetMemLevelByName("debug"));
   EXPECT_EQ(t.logger->GetLevelByName(), "warning");
   EXPECT_EQ(t.logger->GetMemLevelByName(), "verbose");
   EXPECT_TRUE(t.logger->IsLevelWanted(Logger::LOG_VERBOSE));  // for the memory half
   EXPECT_FALSE(t.logger->IsLevelWanted(Logger::LOG_TRIVIA));
}

TEST(LogLevelTest, UnknownLevelAtCreationFallsBackToInfoWithAWarning) {
   TestLogger t("loud");
   EXPECT_EQ(t.logger->GetLevelByName(), "info");
   std::vector<std::string> lines = t.Lines();
   ASSERT_EQ(lines.size(), 1u);
   EXPECT_NE(lines[0].find("warning 'sub'] Unrecognized log/level 'loud' using 'info'"),
             std::string::npos)
       << lines[0];
}

TEST(LogManagerTest, SubsystemLevelsReachLivingAndLaterLoggers) {
   TestLogger t;
   LogManager* manager = t.logger->GetLogManager();
   Ref<Logger> child;
   t.logger->CreateLogger("http", child);
   EXPECT_EQ(child->GetLevelByName(), "info");  // the parent's
   EXPECT_EQ(child->GetParent(), t.logger.Get());
   EXPECT_EQ(child->GetLogOutput(), t.logger->GetLogOutput());

   EXPECT_TRUE(manager->SetLevel("http", "error", "warning"));
   EXPECT_FALSE(manager->SetLogLevel("http", "bogus"));
   EXPECT_EQ(child->GetLevelByName(), "error");
   EXPECT_EQ(child->GetMemLevelByName(), "warning");
   EXPECT_EQ(t.logger->GetLevelByName(), "info");
   Ref<Logger> later;
   t.logger->CreateLogger("http", later);
   EXPECT_EQ(later->GetLevelByName(), "error");
   EXPECT_EQ(manager->FindLogLevelForName("http"), 7u);
   EXPECT_EQ(manager->FindLogLevelForName("other"), 31u);

   std::map<std::string, std::string> levels, memLevels;
   manager->GetLoggers(levels);
   manager->GetMemLoggers(memLevels);
   EXPECT_EQ(levels, (std::map<std::string, std::string>{{"http", "error"}, {"sub", "info"}}));
   EXPECT_EQ(memLevels["http"], "warning");
   later.Reset();
   child.Reset();
   levels.clear();
   manager->GetLoggers(levels);
   EXPECT_EQ(levels.size(), 1u);  // destroyed loggers unregistered
}

TEST(LogOutputTest, WritersAreNamedAndFilteredByTheirOwnLevels) {
   TestLogger t("trivia");
   Ref<PieceWriter> errors = new PieceWriter();
   Ref<LogWriter> writer;
   CreateLogWriter("errors", errors.Get(), "error", writer);
   LogOutput* output = t.logger->GetLogOutput();
   output->AddWriter("errors", writer.Get());
   EXPECT_THROW(output->AddWriter("errors", writer.Get()), AlreadyExistsException);
   PELMORA_LOG_ERROR(t.logger.Get(), "bad");
   PELMORA_LOG_INFO(t.logger.Get(), "fine");
   EXPECT_EQ(errors->pieces.size(), 1u);
   EXPECT_EQ(t.Lines().size(), 2u);
   Ref<LogWriter> removed;
   output->RemoveWriter("errors", removed);
   EXPECT_EQ(removed, writer);
   output->RemoveWriter("errors", removed);
   EXPECT_TRUE(removed.IsNull());
   PELMORA_LOG_ERROR(t.logger.Get(), "bad again");
   EXPECT_EQ(errors->pieces.size(), 1u);
}

TEST(LogOutputTest, WriteLockIsRecursivePerThreadAndExcludesOtherThreads) {
   TestLogger t;
   LogOutput* output = t.logger->GetLogOutput();
   output->RecursiveWriteLock();
   output->RecursiveWriteLock();
   output->RecursiveReadLock();
   // A line of this thread still goes out (recursively), another thread's waits.
   PELMORA_LOG_INFO(t.logger.Get(), "mine");
   std::atomic<bool> done{false};
   std::thread other([&] {
      PELMORA_LOG_INFO(t.logger.Get(), "theirs");
      done = true;
   });
   std::this_thread::sleep_for(std::chrono::milliseconds(20));
   EXPECT_FALSE(done.load());
   output->ReadUnlock();
   output->WriteUnlock();
   std::this_thread::sleep_for(std::chrono::milliseconds(5));
   EXPECT_FALSE(done.load());
   output->WriteUnlock();
   other.join();
   EXPECT_EQ(t.Lines().size(), 2u);
}

TEST(LogContextTest, CallbacksSeeEverySetUntilRemoved) {
   std::vector<std::string> seen;
   AddLogContextUpdateCallback("test", [&seen](const std::string& key, const std::string& value) {
      seen.push_back(key + "=" + value);
   });
   SetLogContext("session", "s1");
   EXPECT_EQ(GetLogContext("session"), "s1");
   RemoveLogContextUpdateCallback("test");
   SetLogContext("session", "");
   EXPECT_EQ(GetLogContext("session"), "");
   EXPECT_EQ(seen, std::vector<std::string>{"session=s1"});
   // Each thread has its own context.
   SetLogContext("k", "main");
   std::string inThread = "unset";
   std::thread([&inThread] { inThread = GetLogContext("k"); }).join();
   EXPECT_EQ(inThread, "");
   SetLogContext("k", "");
}

TEST(LogMemoryTest, RingKeepsMemoryLevelsAndIsWrittenOutOnRequest) {
   TestLogger t("warning");
   t.logger->SetMemLevelByName("verbose");
   Ref<LogWriter> ring;
   CreateMemLogWriter("memory", 4, "trivia", ring);
   Ref<LogOutput> memory;
   t.logger->GetLogManager()->GetOrCreateLogOutput("memory", memory);
   memory->AddWriter("memory", ring.Get());
   t.logger->GetLogOutput()->AddWriter("memory", ring.Get());

   PELMORA_LOG_VERBOSE(t.logger.Get(), "quiet detail %1", 1);
   PELMORA_LOG_TRIVIA(t.logger.Get(), "too fine");
   WriteFaultToMemoryBuffer(t.logger.Get(), std::string("fault text"));
   EXPECT_TRUE(t.target->pieces.empty());  // nothing at the output levels yet

   LogMemoryBuffer(t.logger.Get(), Logger::LOG_ERROR, "why");
   std::string text = t.target->Text();
   EXPECT_NE(text.find("Recent log lines (why)"), std::string::npos) << text;
   EXPECT_TRUE(std::regex_search(text, std::regex(std::string(kPrefix) +
                                                  "verbose 'sub'\\] quiet detail 1\n")))
       << text;
   EXPECT_NE(text.find("error 'sub'] fault text\n"), std::string::npos) << text;
   EXPECT_EQ(text.find("too fine"), std::string::npos);
   // Writing the ring out does not feed it.
   LogMemoryBuffer(t.logger.Get(), Logger::LOG_ERROR, "again");
   std::string second = t.target->Text().substr(text.size());
   EXPECT_EQ(second.find("Recent log lines (why)"), std::string::npos);
}

TEST(LogMemoryTest, FullRingGivesWholeRecentLinesAndLargeLinesReachOtherWriters) {
   TestLogger t("info");
   t.logger->SetMemLevelByName("info");
   Ref<LogWriter> ring;
   CreateMemLogWriter("memory", 1, "trivia", ring);
   Ref<LogOutput> memory;
   t.logger->GetLogManager()->GetOrCreateLogOutput("memory", memory);
   memory->AddWriter("memory", ring.Get());
   // Named so that it comes before the test's writer in the output.
   t.logger->GetLogOutput()->AddWriter("a-memory", ring.Get());

   PELMORA_LOG_INFO(t.logger.Get(), "huge %1", std::string(3000, 'h'));
   ASSERT_EQ(t.Lines().size(), 1u);
   EXPECT_EQ(t.Lines()[0].size() - t.Lines()[0].find("] huge ") - 7, 3000u);
   for (int i = 0; i < 100; ++i) PELMORA_LOG_INFO(t.logger.Get(), "entry %1", i);
   size_t before = t.target->Text().size();
   LogMemoryBuffer(t.logger.Get(), Logger::LOG_ERROR, "full");
   std::string text = t.target->Text().substr(before);
   std::vector<std::string> lines;
   for (size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos; start = end + 1) {
      lines.push_back(text.substr(start, end - start));
   }
   ASSERT_GE(lines.size(), 5u);
   EXPECT_EQ(lines.front(), "----- Recent log lines (full) -----");
   EXPECT_EQ(lines.back(), "----- End of recent log lines -----");
   for (size_t i = 1; i + 1 < lines.size(); ++i) {
      EXPECT_TRUE(std::regex_match(lines[i], std::regex(std::string(kPrefix) +
                                                        "info 'sub'\\] entry \\d+")))
          << lines[i];
   }
   EXPECT_NE(lines[lines.size() - 2].find("entry 99"), std::string::npos);
}

TEST(LogMemoryDeathTest, PanicReportHoldsTheRecentLines) {
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "recent line %1", 42);
          PELMORA_VERIFY(1 + 1 == 3);
       },
       "Panic: Assert Failed: \"1 \\+ 1 == 3\".*Recent log lines.*recent line 42");
}

TEST(LogMemoryDeathTest, ExceptionDumpGoesThroughTheDefaultLogger) {
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "before the dump");
          InvalidStateException().Dump();
          abort();
       },
       "error 'default'\\] \n\nException: Invalid state\nType: .*Recent log lines.*before the dump");
}
