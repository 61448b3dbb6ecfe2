// Loggers, lines and their prefix, levels, nesting, the log context and the memory ring.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
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

using namespace Pelmora;
using namespace Pelmora::Service;

extern "C" void __cxa_finalize(void* dso);

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

std::vector<std::string> SplitLines(const std::string& text) {
   std::vector<std::string> lines;
   for (size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos; start = end + 1)
      lines.push_back(text.substr(start, end - start));
   return lines;
}

struct TestLogger {
   explicit TestLogger(const std::string& level = "info") : target(new PieceWriter()) {
      CreateLogger(target.Get(), "sub", level, nullptr, logger);
   }
   std::vector<std::string> Lines() const { return SplitLines(target->Text()); }
   // Adds a memory ring of `size` to the logger's output (under `name`) and the memory output.
   void AddRing(int size, const std::string& name) {
      Ref<LogWriter> ring;
      CreateMemLogWriter("memory", size, "trivia", ring);
      Ref<LogOutput> memory;
      logger->GetLogManager()->GetOrCreateLogOutput("memory", memory);
      memory->AddWriter("memory", ring.Get());
      logger->GetLogOutput()->AddWriter(name, ring.Get());
   }
   Ref<PieceWriter> target;
   Ref<Logger> logger;
};

const std::string kPrefix =
    "\\d{4}-\\d{2}-\\d{2}T\\d{2}:\\d{2}:\\d{2}\\.\\d{3}[+-]\\d{2}:\\d{2} \\[0x[0-9a-f]+ ";

bool Matches(const std::string& line, const std::string& rest) {
   return std::regex_match(line, std::regex(kPrefix + rest));
}

// Whether thread `tid` of this process is asleep in the kernel (waiting on a lock).
bool IsAsleep(pid_t tid) {
   std::ifstream in("/proc/self/task/" + std::to_string(tid) + "/stat");
   std::string stat((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
   size_t end = stat.rfind(')');  // the state follows the command name
   return end != std::string::npos && end + 2 < stat.size() && stat[end + 2] == 'S';
}

}  // namespace

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

TEST(LogLevelTest, NamesInstallCumulativeMasksAndUnknownNamesAreRefused) {
   TestLogger t;
   const char* names[] = {"none", "quiet", "panic", "error", "warning", "info", "verbose", "trivia"};
   Logger::CombinedLevel expected = 0;
   for (const char* name : names) {
      ASSERT_TRUE(t.logger->SetLevelByName(name));
      ASSERT_TRUE(t.logger->SetMemLevelByName(name));
      EXPECT_EQ(t.logger->GetCombinedMask(), expected | (expected << 16)) << name;
      EXPECT_EQ(t.logger->GetLevelByName(), name);
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

   TestLogger loud("loud");  // unknown at creation: info, with a warning
   EXPECT_EQ(loud.logger->GetLevelByName(), "info");
   ASSERT_EQ(loud.Lines().size(), 1u);
   EXPECT_NE(loud.Lines()[0].find("warning 'sub'] Unrecognized log/level 'loud' using 'info'"),
             std::string::npos);
}

TEST(LogLevelTest, ChangingBothHalvesFromTwoThreadsLosesNoChange) {
   TestLogger t;
   // Runs until each thread has seen the other's half change often enough (the threads
   // ran side by side), or for at most three seconds on a machine too busy for that.
   constexpr int kChangesSeen = 2000;
   std::atomic<bool> stop{false};
   std::atomic<int> lost{0};
   std::atomic<int> seen[2] = {0, 0};
   // Each thread owns one half: it must still hold what the thread set last.
   auto flip = [&](int half) {
      const char* names[] = {"error", "verbose"};
      const Logger::CombinedLevel masks[] = {7, 63};
      Logger::CombinedLevel mine = t.logger->GetCombinedMask() >> (half * 16) & 0xFFFF;
      Logger::CombinedLevel theirs = t.logger->GetCombinedMask() >> (16 - half * 16) & 0xFFFF;
      for (int i = 0; !stop.load(std::memory_order_relaxed); ++i) {
         Logger::CombinedLevel mask = t.logger->GetCombinedMask();
         if ((mask >> (half * 16) & 0xFFFF) != mine) ++lost;
         if ((mask >> (16 - half * 16) & 0xFFFF) != theirs) {
            theirs = mask >> (16 - half * 16) & 0xFFFF;
            seen[half].fetch_add(1, std::memory_order_relaxed);
         }
         if (half == 1) {
            t.logger->SetMemLevelByName(names[i % 2]);
         } else {
            t.logger->SetLevelByName(names[i % 2]);
         }
         mine = masks[i % 2];
      }
   };
   std::vector<std::thread> threads;
   threads.emplace_back(flip, 0);
   threads.emplace_back(flip, 1);
   auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(3);
   while ((seen[0] < kChangesSeen || seen[1] < kChangesSeen) &&
          std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
   }
   stop = true;
   Pelmora::Testing::JoinAll(threads, "the level setters");
   EXPECT_EQ(lost, 0) << "changes seen: " << seen[0] << " and " << seen[1];
}

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

TEST(LogManagerTest, SubsystemLevelsReachLivingAndLaterLoggers) {
   TestLogger t;
   LogManager* manager = t.logger->GetLogManager();
   Ref<Logger> child, later;
   t.logger->CreateLogger("http", child);
   EXPECT_EQ(child->GetLevelByName(), "info");  // the parent's
   EXPECT_TRUE(manager->SetLevel("http", "error", "warning"));
   EXPECT_FALSE(manager->SetLogLevel("http", "bogus"));
   EXPECT_EQ(child->GetMemLevelByName(), "warning");
   t.logger->CreateLogger("http", later);
   EXPECT_EQ(child->GetLevelByName(), "error");
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
   Ref<LogWriter> writer, removed;
   CreateLogWriter("errors", errors.Get(), "error", writer);
   LogOutput* output = t.logger->GetLogOutput();
   output->AddWriter("errors", writer.Get());
   EXPECT_THROW(output->AddWriter("errors", writer.Get()), AlreadyExistsException);
   PELMORA_LOG_ERROR(t.logger.Get(), "bad");
   PELMORA_LOG_INFO(t.logger.Get(), "fine");
   EXPECT_EQ(errors->pieces.size(), 1u);
   EXPECT_EQ(t.Lines().size(), 2u);
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
   PELMORA_LOG_INFO(t.logger.Get(), "mine");  // this thread's line goes out, another's waits
   std::atomic<pid_t> tid{0};
   std::atomic<bool> done{false};
   std::thread other([&] {
      tid = gettid();
      PELMORA_LOG_INFO(t.logger.Get(), "theirs");
      done = true;
   });
   // The other thread has reached the lock and sleeps on it, or (a broken lock) got through.
   auto waitForOther = [&](const char* what) {
      Pelmora::Testing::Watchdog watchdog(what);
      while (!done && (tid == 0 || !IsAsleep(tid))) std::this_thread::yield();
   };
   waitForOther("the other thread to wait for the held lock");
   EXPECT_FALSE(done.load());
   output->ReadUnlock();
   output->WriteUnlock();
   waitForOther("the other thread to wait for the lock still held once");
   EXPECT_FALSE(done.load());
   output->WriteUnlock();
   Pelmora::Testing::Join(other, "other to finish");
   EXPECT_EQ(t.Lines().size(), 2u);
}

TEST(LogMemoryTest, RingKeepsWholeRecentLinesAtMemoryLevelsAndIsWrittenOutOnRequest) {
   TestLogger t("warning");
   t.logger->SetMemLevelByName("verbose");
   t.AddRing(1, "a-memory");  // comes before the test's writer in the output

   PELMORA_LOG_ERROR(t.logger.Get(), "huge %1", std::string(3000, 'h'));  // reaches the others
   ASSERT_EQ(t.Lines().size(), 1u);
   EXPECT_EQ(t.Lines()[0].size() - t.Lines()[0].find("] huge ") - 7, 3000u);
   for (int i = 0; i < 100; ++i) PELMORA_LOG_VERBOSE(t.logger.Get(), "entry %1", i);
   PELMORA_LOG_TRIVIA(t.logger.Get(), "too fine");
   WriteFaultToMemoryBuffer(t.logger.Get(), std::string("fault text"));
   size_t before = t.target->Text().size();
   EXPECT_EQ(t.Lines().size(), 1u);  // nothing more at the output levels

   LogMemoryBuffer(t.logger.Get(), Logger::LOG_ERROR, "full");
   std::vector<std::string> lines = SplitLines(t.target->Text().substr(before));
   ASSERT_GE(lines.size(), 5u);
   EXPECT_EQ(lines.front(), "----- Recent log lines (full) -----");
   EXPECT_EQ(lines.back(), "----- End of recent log lines -----");
   for (size_t i = 1; i + 2 < lines.size(); ++i)
      EXPECT_TRUE(Matches(lines[i], "verbose 'sub'\\] entry \\d+")) << lines[i];
   EXPECT_NE(lines[lines.size() - 3].find("entry 99"), std::string::npos);
   EXPECT_TRUE(Matches(lines[lines.size() - 2], "error 'sub'\\] fault text"));
   size_t after = t.target->Text().size();
   LogMemoryBuffer(t.logger.Get(), Logger::LOG_ERROR, "again");  // writing out does not feed it
   EXPECT_EQ(t.target->Text().find("Recent log lines (full)", after), std::string::npos);
}

TEST(LogMemoryDeathTest, PanicAndExceptionDumpReportTheRecentLines) {
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "recent line %1", 42);
          PELMORA_VERIFY(1 + 1 == 3);
       },
       "Panic: Assert Failed: \"1 \\+ 1 == 3\".*Recent log lines.*recent line 42");
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "before the dump");
          InvalidStateException().Dump();
          abort();
       },
       "error 'default'\\] \n\nException: Invalid state\nType: .*Recent log lines.*before the dump");
}
