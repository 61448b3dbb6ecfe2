// Per-thread batches of whole lines: order, nothing lost, and when they are handed on.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/io.h"
#include "pelmora/service.h"
#include "src/log/logImpl.h"
#include "tests/support/logWriters.h"
#include "tests/support/watchdog.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;

namespace {

std::vector<std::string> Lines(const std::string& text) {
   std::vector<std::string> lines;
   std::stringstream in(text);
   for (std::string line; std::getline(in, line);) lines.push_back(line);
   return lines;
}

// A flush interval far beyond any test: kept lines reach the file only when something
// hands them on.
LogFileOptions Unhurried() {
   LogFileOptions options;
   options.flushIntervalMs = 60 * 1000;
   return options;
}

bool WaitFor(const std::string& path, const std::string& text) {
   auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
   while (ReadFile(path).find(text) == std::string::npos) {
      if (std::chrono::steady_clock::now() >= deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
   }
   return true;
}

// A thread that logs what it is told and then waits, alive, for the next order.
class Logging {
public:
   Logging() : _thread([this] { Run(); }) {}
   ~Logging() {
      Do([] {});
      {
         std::lock_guard<std::mutex> lock(_mutex);
         _stop = true;
      }
      _changed.notify_all();
      Testing::Join(_thread, "the logging thread");
   }
   // Runs `work` on the thread and waits for it.
   void Do(std::function<void()> work) {
      std::unique_lock<std::mutex> lock(_mutex);
      _work = std::move(work);
      _changed.notify_all();
      _changed.wait(lock, [this] { return !_work; });
   }

private:
   void Run() {
      std::unique_lock<std::mutex> lock(_mutex);
      for (;;) {
         _changed.wait(lock, [this] { return _stop || _work; });
         if (_work) {
            _work();
            _work = nullptr;
            _changed.notify_all();
         } else if (_stop) {
            return;
         }
      }
   }

   std::mutex _mutex;
   std::condition_variable _changed;
   std::function<void()> _work;
   bool _stop = false;
   std::thread _thread;
};

}  // namespace

TEST(LogBatchTest, EachThreadsLinesArriveAllAndInOrderAcrossLevelsAndLongLines) {
   Files f;
   LogFileOptions options;
   options.level = "trivia";
   options.maxFileSize = 64 * 1024;  // rolls fall inside batches
   options.maxFileNum = 50;
   f.AddFile(options, "threads.log");
   constexpr int kThreads = 4, kLines = 1500;
   const std::string longText(3000, 'x');  // several pieces: goes around the batch
   std::vector<std::thread> threads;
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&, t] {
         for (int i = 0; i < kLines; ++i) {
            if (i % 300 == 299) {
               PELMORA_LOG_INFO(f.logger.Get(), "thread %1 line %2 %3", t, i, longText);
            } else if (i % 7 == 0) {
               PELMORA_LOG_VERBOSE(f.logger.Get(), "thread %1 line %2", t, i);
            } else {
               PELMORA_LOG_INFO(f.logger.Get(), "thread %1 line %2", t, i);
            }
         }
      });
   }
   Testing::JoinAll(threads, "the logging threads");
   f.logger->GetLogManager()->Flush();

   std::string text;
   for (int i = options.maxFileNum - 1; i >= 1; --i) {
      text += ReadFile(options.path + "." + std::to_string(i));
   }
   text += ReadFile(options.path);
   std::map<int, int> next;
   std::regex rule(".*\\] thread (\\d+) line (\\d+)( x+)?");
   for (const std::string& line : Lines(text)) {
      std::smatch match;
      ASSERT_TRUE(std::regex_match(line, match, rule)) << line.substr(0, 200);
      int t = std::stoi(match[1]), i = std::stoi(match[2]);
      ASSERT_EQ(i, next[t]) << "thread " << t;
      EXPECT_EQ(match[3].length() > 0, i % 300 == 299) << line.substr(0, 200);
      next[t] = i + 1;
   }
   for (int t = 0; t < kThreads; ++t) EXPECT_EQ(next[t], kLines) << "thread " << t;
}

TEST(LogBatchTest, SevereLinesFlushesAndTheFlushIntervalHandOnEveryThreadsLines) {
   Files f;
   LogFileOptions options = Unhurried();
   f.AddFile(options, "severe.log");
   Logging other;

   other.Do([&] { PELMORA_LOG_INFO(f.logger.Get(), "kept by the other thread"); });
   PELMORA_LOG_INFO(f.logger.Get(), "kept by this one");
   PELMORA_LOG_ERROR(f.logger.Get(), "an error");
   std::vector<std::string> lines = Lines(ReadFile(options.path));
   ASSERT_EQ(lines.size(), 3u) << ReadFile(options.path);
   EXPECT_NE(lines[0].find("kept by the other thread"), std::string::npos);
   EXPECT_NE(lines[1].find("kept by this one"), std::string::npos);
   EXPECT_NE(lines[2].find("an error"), std::string::npos);

   // The writer's own Flush brings what threads keep for it, the output's as well.
   other.Do([&] { PELMORA_LOG_INFO(f.logger.Get(), "before the writer's flush"); });
   Ref<LogWriter> writer;
   f.logger->GetLogOutput()->GetWriter("file", writer);
   writer->Flush();
   EXPECT_NE(ReadFile(options.path).find("before the writer's flush\n"), std::string::npos);
   other.Do([&] { PELMORA_LOG_INFO(f.logger.Get(), "before the output's flush"); });
   f.logger->GetLogOutput()->Flush();
   EXPECT_NE(ReadFile(options.path).find("before the output's flush\n"), std::string::npos);

   // Nothing asked for: the interval brings the lines of a thread that logs no more, and
   // of one that has ended.
   Files g;
   LogFileOptions quick;
   quick.flushIntervalMs = 20;
   g.AddFile(quick, "interval.log");
   Logging idle;
   idle.Do([&] { PELMORA_LOG_INFO(g.logger.Get(), "from an idle thread"); });
   EXPECT_TRUE(WaitFor(quick.path, "from an idle thread\n"));
   std::thread ended([&] { PELMORA_LOG_INFO(g.logger.Get(), "from an ended thread"); });
   Testing::Join(ended, "the short thread");
   EXPECT_TRUE(WaitFor(quick.path, "from an ended thread\n"));
}

TEST(LogBatchTest, AnotherKindOfWriterTakesEveryLineAtOnceAndBatchesGoToTheirOwnWriters) {
   Files f;
   LogFileOptions options = Unhurried();
   f.AddFile(options, "mixed.log");
   LogOutput* output = f.logger->GetLogOutput();
   PELMORA_LOG_INFO(f.logger.Get(), "before the plain writer");

   // A writer of another kind joins: the kept line goes to the file alone, and every
   // later line to both at once.
   Ref<StringWriter> text;
   CreateStringWriter(text);
   Ref<LogWriter> plain;
   CreateLogWriter("plain", text.Get(), "trivia", plain);
   output->AddWriter("plain", plain.Get());
   PELMORA_LOG_INFO(f.logger.Get(), "with the plain writer");
   EXPECT_EQ(text->GetString().find("before the plain writer"), std::string::npos);
   EXPECT_NE(text->GetString().find("with the plain writer\n"), std::string::npos);

   // It leaves: lines are kept again, and go to the file alone.
   Ref<LogWriter> removed;
   output->RemoveWriter("plain", removed);
   PELMORA_LOG_INFO(f.logger.Get(), "after the plain writer");
   EXPECT_EQ(ReadFile(options.path).find("after the plain writer"), std::string::npos);
   output->Flush();
   std::vector<std::string> lines = Lines(ReadFile(options.path));
   ASSERT_EQ(lines.size(), 3u);
   EXPECT_NE(lines[0].find("before the plain writer"), std::string::npos);
   EXPECT_NE(lines[1].find("with the plain writer"), std::string::npos);
   EXPECT_NE(lines[2].find("after the plain writer"), std::string::npos);
   EXPECT_EQ(text->GetString().find("after the plain writer"), std::string::npos);

   // A thread's batch outlives its output: the output's end writes it out, and a new
   // output (perhaps at the same address) gets a batch of its own.
   std::string path;
   {
      Files gone;
      LogFileOptions goneOptions = Unhurried();
      gone.AddFile(goneOptions, "gone.log");
      path = goneOptions.path;
      PELMORA_LOG_INFO(gone.logger.Get(), "kept when the output went");
      gone.logger.Reset();
      EXPECT_NE(ReadFile(path).find("kept when the output went\n"), std::string::npos);
   }
   for (int i = 0; i < 3; ++i) {
      Files next;
      LogFileOptions nextOptions;
      next.AddFile(nextOptions, "next.log");
      PELMORA_LOG_INFO(next.logger.Get(), "to output %1", i);
      next.logger->GetLogManager()->Flush();
      EXPECT_NE(ReadFile(nextOptions.path).find("to output " + std::to_string(i) + "\n"),
                std::string::npos);
   }
}

TEST(LogBatchTest, ABatchThatFindsTheFileClosedIsHeldAndDroppedLineByLine) {
   Files f;
   LogFileOptions options = Unhurried();
   options.maxHeldBytes = 1000;
   options.reopenRetryMs = 0;
   Ref<FileLogWriter> writer = f.AddFile(options, "closed.log", FileOps::Ops());
   FileOps::failOpen = true;
   f.logger->GetLogManager()->Reopen();
   for (int i = 0; i < 20; ++i) PELMORA_LOG_INFO(f.logger.Get(), "held %1", i);
   f.logger->GetLogOutput()->Flush();
   FileOps::failOpen = false;
   f.logger->GetLogManager()->Flush();
   std::vector<std::string> lines = Lines(ReadFile(options.path));
   ASSERT_FALSE(lines.empty());
   for (size_t i = 0; i < lines.size(); ++i) {
      EXPECT_NE(lines[i].find("] held " + std::to_string(i)), std::string::npos) << lines[i];
   }
   EXPECT_EQ(lines.size() + writer->GetLostCount(), 20u);
   EXPECT_GT(writer->GetLostCount(), 0u);
}

TEST(LogBatchTest, TheRingTakesBatchesAndReadingItHandsEveryThreadsLinesOn) {
   Files f;
   LogFileOptions options = Unhurried();
   f.AddFile(options, "ring.log");
   LogOutput* output = f.logger->GetLogOutput();
   Ref<LogWriter> ring;
   CreateMemLogWriter("ring", 64, "trivia", ring);
   ring->SetMask(Logger::LOG_INFO);  // its file half, so that every info line reaches it
   output->AddWriter("ring", ring.Get());
   Logging other;
   other.Do([&] { PELMORA_LOG_INFO(f.logger.Get(), "from the other thread"); });
   PELMORA_LOG_INFO(f.logger.Get(), "from this one");
   // Kept, not written yet: the ring alone does not stop the batching.
   EXPECT_EQ(ReadFile(options.path), "");
   std::string text = dynamic_cast<MemLogWriterImpl*>(ring.Get())->GetText();
   std::vector<std::string> lines = Lines(text);
   ASSERT_EQ(lines.size(), 2u) << text;
   EXPECT_NE(lines[0].find("from the other thread"), std::string::npos);
   EXPECT_NE(lines[1].find("from this one"), std::string::npos);
   output->Flush();
   EXPECT_EQ(Lines(ReadFile(options.path)).size(), 2u);
}

// The default output with a file and the ring alone batches its lines; a panic's report
// still carries another thread's kept line, in the file and in the ring's dump.
TEST(LogBatchDeathTest, APanicReportCarriesTheLinesOtherThreadsKept) {
   // The child (a new run of this binary) names the file after its parent, this process.
   std::string path = "/tmp/pelmora-batch-panic-" + std::to_string(getpid()) + ".log";
   EXPECT_DEATH(
       {
          LogOutput* output = GetDefaultLogger()->GetLogOutput();
          Ref<LogWriter> console;
          output->RemoveWriter("console", console);
          LogFileOptions options = Unhurried();
          options.path = "/tmp/pelmora-batch-panic-" + std::to_string(getppid()) + ".log";
          options.level = "trivia";
          Ref<LogWriter> file;
          CreateFileLogWriter("file", options, file);
          output->AddWriter("file", file.Get());
          std::atomic<bool> logged{false};
          std::thread([&] {
             PELMORA_LOG_WARNING(GetDefaultLogger(), "kept by another thread");
             logged.store(true);
             for (;;) pause();
          }).detach();
          while (!logged.load()) std::this_thread::yield();
          PELMORA_VERIFY(1 + 1 == 3);
       },
       "");
   std::string text = ReadFile(path);
   unlink(path.c_str());
   EXPECT_TRUE(std::regex_search(
       text, std::regex("kept by another thread\n(.|\n)*Panic: Assert Failed(.|\n)*"
                        "Recent log lines(.|\n)*kept by another thread")))
       << text;
}

// ---- handing batches on from a thread that is in the middle of a long line

namespace {

// Formats as "hook" after running `work`: lets a test act while its thread is inside a
// line that already spans pieces, and so holds its output's write lock.
class Hook : public ObjectImpl {
public:
   explicit Hook(std::function<void()> work) : _work(std::move(work)) {}
   std::string ToString() const override {
      _work();
      return "hook";
   }

private:
   std::function<void()> _work;
};

// A flag one thread raises and another waits on, for at most `limit`.
class Flag {
public:
   void Raise() {
      std::lock_guard<std::mutex> lock(_mutex);
      _up = true;
      _changed.notify_all();
   }
   bool Wait(std::chrono::milliseconds limit) {
      std::unique_lock<std::mutex> lock(_mutex);
      return _changed.wait_for(lock, limit, [this] { return _up; });
   }

private:
   std::mutex _mutex;
   std::condition_variable _changed;
   bool _up = false;
};

// Runs in a death test's child: exits 0 when `work` ends within two seconds, 1 when it
// hangs (its threads cannot be freed, so the child is the one to go).
void ExitWhenDone(std::function<void()> work) {
   auto done = std::make_shared<Flag>();
   std::thread([work, done] {
      work();
      done->Raise();
   }).detach();
   _exit(done->Wait(std::chrono::seconds(2)) ? 0 : 1);
}

// A second output with a batching file writer, at "trivia", on a manager of its own.
struct BatchedOutput {
   explicit BatchedOutput(const std::string& name) {
      LogFileOptions options = Unhurried();
      files.AddFile(options, name);
      files.logger->GetLogOutput()->GetWriter("file", writer);
      // A kept line registers the output among those that have batches.
      PELMORA_LOG_INFO(files.logger.Get(), "first");
   }
   Files files;
   Ref<LogWriter> writer;
};

const std::string kLong(3000, 'x');  // past one piece: the line takes the write lock

}  // namespace

// Flushing a file writer hands on every output's batches. It may come from inside a
// long line (a formatter argument), which holds that line's output, or under an output's
// read lock; none of these may wait for ever.
TEST(LogBatchDeathTest, DrainsNeverWaitForAnOutputsLock) {
   // Two threads, each in a long line of its own output, each flushing.
   EXPECT_EXIT(ExitWhenDone([] {
                  BatchedOutput a("a.log"), b("b.log");
                  Flag aHolds, bHolds;
                  Hook hookA([&] {
                     aHolds.Raise();
                     bHolds.Wait(std::chrono::seconds(1));
                     a.writer->Flush();
                  });
                  Hook hookB([&] {
                     bHolds.Raise();
                     aHolds.Wait(std::chrono::seconds(1));
                     b.writer->Flush();
                  });
                  std::thread other([&] {
                     PELMORA_LOG_INFO(b.files.logger.Get(), "%1 %2", kLong,
                                      static_cast<const Object*>(&hookB));
                  });
                  PELMORA_LOG_INFO(a.files.logger.Get(), "%1 %2", kLong,
                                   static_cast<const Object*>(&hookA));
                  other.join();
               }),
               ::testing::ExitedWithCode(0), "");
   // A thread in a long line of output A drops the last reference to output B while a
   // drain that counted itself into B meets A's lock: B's end waits for that drain.
   EXPECT_EXIT(ExitWhenDone([] {
                  auto a = std::make_unique<BatchedOutput>("a.log");
                  auto b = std::make_unique<BatchedOutput>("b.log");
                  Flag aHolds, draining;
                  std::thread drainer([&] {
                     aHolds.Wait(std::chrono::seconds(1));
                     draining.Raise();
                     a->writer->Flush();
                  });
                  Hook hook([&] {
                     aHolds.Raise();
                     draining.Wait(std::chrono::seconds(1));
                     // Long enough for the drain to reach A's lock.
                     std::this_thread::sleep_for(std::chrono::milliseconds(100));
                     b.reset();
                  });
                  PELMORA_LOG_INFO(a->files.logger.Get(), "%1 %2", kLong,
                                   static_cast<const Object*>(&hook));
                  drainer.join();
               }),
               ::testing::ExitedWithCode(0), "");
   // A flush under the output's own read lock (looking at its writers, say).
   EXPECT_EXIT(ExitWhenDone([] {
                  BatchedOutput a("a.log");
                  LogOutput* output = a.files.logger->GetLogOutput();
                  output->RecursiveReadLock();
                  a.writer->Flush();
                  output->ReadUnlock();
               }),
               ::testing::ExitedWithCode(0), "");
}

// One file writer on two outputs (two managers' loggers writing one file): a thread's
// lines to the two reach it in the order they were written.
TEST(LogBatchTest, AThreadsLinesToTwoOutputsSharingAWriterStayInOrder) {
   Files f;
   LogFileOptions options = Unhurried();
   f.AddFile(options, "shared.log");
   Ref<LogWriter> writer;
   f.logger->GetLogOutput()->GetWriter("file", writer);
   Ref<Logger> second;
   CreateLogger(nullptr, "second", "trivia", nullptr, second);
   second->GetLogOutput()->AddWriter("file", writer.Get());

   // The second output is the first to keep lines, so drains visit it first.
   PELMORA_LOG_INFO(second.Get(), "zero");
   writer->Flush();
   PELMORA_LOG_INFO(f.logger.Get(), "one");
   PELMORA_LOG_INFO(second.Get(), "two");
   PELMORA_LOG_ERROR(second.Get(), "three");
   writer->Flush();
   std::vector<std::string> lines = Lines(ReadFile(options.path));
   ASSERT_EQ(lines.size(), 4u) << ReadFile(options.path);
   EXPECT_NE(lines[1].find("] one"), std::string::npos) << lines[1];
   EXPECT_NE(lines[2].find("] two"), std::string::npos) << lines[2];
   EXPECT_NE(lines[3].find("] three"), std::string::npos) << lines[3];
}

// A file writer with a smaller thread buffer joins after a thread's batch was made: the
// thread keeps no more than the new, smaller size.
TEST(LogBatchTest, AThreadKeepsNoMoreThanTheSmallestThreadBufferOfItsFiles) {
   Files f;
   LogFileOptions large = Unhurried();
   f.AddFile(large, "large.log");
   PELMORA_LOG_INFO(f.logger.Get(), "made the batch");
   LogFileOptions small = Unhurried();
   small.bufferSize = 1;  // what reaches this writer is in its file at once
   small.threadBufferSize = 300;
   small.path = f.dir + "/small.log";
   Ref<LogWriter> writer;
   CreateFileLogWriter("small", small, writer);
   f.logger->GetLogOutput()->AddWriter("small", writer.Get());
   const std::string text(60, 'y');
   for (int i = 0; i < 20; ++i) PELMORA_LOG_INFO(f.logger.Get(), "line %1 %2", i, text);
   // 20 lines of about 120 bytes: all but the last two or three have been handed on.
   EXPECT_GE(Lines(ReadFile(small.path)).size(), 15u);
}

// exit() while another thread is inside a long line (its formatter argument waits for
// something the exiting thread will never give): flushing the files at exit must not wait
// for that line's output lock. The alarm ends a hung child.
TEST(LogBatchDeathTest, ExitDoesNotWaitForAnotherThreadsLongLine) {
   EXPECT_EXIT(
       {
          alarm(2);
          auto* a = new BatchedOutput("a.log");  // left for the exit-time flush
          // Runs before that flush (registered later), which still has the file open.
          static std::string* const dir = new std::string(a->files.dir);
          atexit([] { std::filesystem::remove_all(*dir); });
          auto* inside = new Flag;
          auto* never = new Flag;
          auto* hook = new Hook([=] {
             inside->Raise();
             never->Wait(std::chrono::hours(1));
          });
          std::thread([=] {
             PELMORA_LOG_INFO(a->files.logger.Get(), "%1 %2", kLong,
                              static_cast<const Object*>(hook));
          }).detach();
          inside->Wait(std::chrono::seconds(1));
          exit(0);
       },
       ::testing::ExitedWithCode(0), "");
}

// One output's slow line (a formatter argument that takes its time while the line holds
// the output's lock) must not hold up the flush interval of another output's file.
TEST(LogBatchTest, ALongLineOfOneOutputDoesNotHoldUpAnotherOutputsInterval) {
   BatchedOutput slow("slow.log");  // first to keep lines: drains visit it first
   Files quick;
   LogFileOptions options;
   options.flushIntervalMs = 20;
   quick.AddFile(options, "quick.log");
   Flag inside, release;
   Hook hook([&] {
      inside.Raise();
      release.Wait(std::chrono::seconds(2));
   });
   std::thread slowLine([&] {
      PELMORA_LOG_INFO(slow.files.logger.Get(), "%1 %2", kLong, static_cast<const Object*>(&hook));
   });
   ASSERT_TRUE(inside.Wait(std::chrono::seconds(2)));
   PELMORA_LOG_INFO(quick.logger.Get(), "due within the interval");
   // Twenty-five intervals.
   auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(500);
   bool written = false;
   while (!written && std::chrono::steady_clock::now() < deadline) {
      written = ReadFile(options.path).find("due within the interval\n") != std::string::npos;
      if (!written) std::this_thread::sleep_for(std::chrono::milliseconds(5));
   }
   release.Raise();
   Testing::Join(slowLine, "the slow line");
   EXPECT_TRUE(written);
}
