// Levels and masks, the manager, outputs and their lock, the memory ring.

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
#include "tests/support/logLines.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;

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

// Writers exclude everyone, readers only writers; every hand-over wakes whoever waits
// (a lost wake-up hangs the joins), and a count kept under the write lock loses nothing.
TEST(LogOutputTest, ReadAndWriteHoldsExcludeAsTheyShouldUnderContention) {
   TestLogger t;
   LogOutput* output = t.logger->GetLogOutput();
   constexpr int kRounds = 20000;
   std::atomic<int> writersIn{0}, readersIn{0}, faults{0};
   long long guarded = 0;  // written under the write lock only
   std::vector<std::thread> threads;
   for (int w = 0; w < 2; ++w) {
      threads.emplace_back([&] {
         for (int i = 0; i < kRounds; ++i) {
            output->RecursiveWriteLock();
            if (writersIn.fetch_add(1) != 0 || readersIn.load() != 0) faults.fetch_add(1);
            ++guarded;
            if (i % 16 == 0) std::this_thread::yield();  // holds that overlap, if they can
            writersIn.fetch_sub(1);
            output->WriteUnlock();
         }
      });
   }
   for (int r = 0; r < 2; ++r) {
      threads.emplace_back([&] {
         long long seen = 0;
         for (int i = 0; i < kRounds; ++i) {
            output->RecursiveReadLock();
            readersIn.fetch_add(1);
            if (writersIn.load() != 0 || guarded < seen) faults.fetch_add(1);
            seen = guarded;
            if (i % 16 == 0) std::this_thread::yield();
            readersIn.fetch_sub(1);
            output->ReadUnlock();
         }
      });
   }
   Pelmora::Testing::JoinAll(threads, "readers and writers of one output");
   EXPECT_EQ(0, faults.load());
   EXPECT_EQ(2LL * kRounds, guarded);
}

// Notes when two threads are inside Write at once.
class OverlapWriter : public virtual Writer, public ObjectImpl {
public:
   void Write(const char*, int) override {
      if (_inside.exchange(true)) overlaps.fetch_add(1);
      for (int i = 0; i < 200; ++i) asm volatile("");  // a window for an overlap
      ++pieces;
      _inside.store(false);
   }
   void Close() override {}
   std::atomic<int> overlaps{0};
   long pieces = 0;

private:
   std::atomic<bool> _inside{false};
};

// A writer's own lock serialises its target between threads that write to it without
// the output's lock, as the flusher and direct callers do; a hand-over wakes the waiter.
TEST(LogWriterTest, ConcurrentWritesReachTheTargetOneAtATime) {
   Ref<OverlapWriter> target = new OverlapWriter();
   Ref<LogWriter> writer;
   CreateLogWriter("pieces", target.Get(), "trivia", writer);
   constexpr int kRounds = 20000;
   std::vector<std::thread> threads;
   for (int t = 0; t < 3; ++t) {
      threads.emplace_back([&] {
         for (int i = 0; i < kRounds; ++i) writer->Write(Logger::LOG_INFO, "piece", 5);
      });
   }
   Pelmora::Testing::JoinAll(threads, "writers of one log writer");
   EXPECT_EQ(0, target->overlaps.load());
   EXPECT_EQ(3L * kRounds, target->pieces);
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

// The manager's lock is the library's mutex: misuse panics with the mutex's own texts.
TEST(LogManagerDeathTest, RelockingAndForeignUnlockPanicWithTheMutexTexts) {
   Ref<LogManager> manager;
   CreateLogManager(manager);
   EXPECT_DEATH(
       {
          manager->Lock();
          manager->Lock();
       },
       "Assert Failed: \"!_mutex.IsLocked\\(\\)\"");
   EXPECT_DEATH(manager->Unlock(), "Assert Failed: \"_mutex.IsLocked\\(\\)\"");
}
