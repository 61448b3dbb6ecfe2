// The file-operations journal: what it writes, Abort and Recover, and a crash test in which
// a child making journaled changes is SIGKILLed at random moments.

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <filesystem>
#include <map>
#include <random>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/journal.h"
#include "tests/support/journalBytes.h"

namespace Pelmora::Service {
namespace {

using namespace Pelmora::TestSupport;

// A tree as a map from relative path to content; directories map to "/".
using Tree = std::map<std::string, std::string>;

// Everything under `root`, hidden files included: a leftover temporary or kept copy counts.
Tree Snapshot(const std::string& root) {
   Tree tree;
   std::error_code error;
   for (const auto& entry : std::filesystem::recursive_directory_iterator(root, error)) {
      const bool directory = std::filesystem::is_directory(entry.symlink_status());
      tree[entry.path().string().substr(root.size())] = directory ? "/" : ReadAll(entry.path());
   }
   return tree;
}

class FileOpsJournalTest : public testing::Test {
protected:
   void SetUp() override {
      char name[] = "/tmp/jrnlopsXXXXXX";
      _dir = ::mkdtemp(name);
      _root = _dir + "/tree";
      _journal = _dir + "/journal";
      ::mkdir(_root.c_str(), 0755);
   }
   void TearDown() override { std::filesystem::remove_all(_dir); }

   Ref<BasicFileOpsJournal> Open(bool create) {
      Ref<BasicFileOpsJournal> journal;
      CreateBasicFileOpsJournal(_journal, create, "test", journal);
      return journal;
   }

   std::string _dir, _root, _journal;
};

std::string Str(const std::string& s) { return U32(uint32_t(s.size() + 1)) + s + std::string(1, '\0'); }
std::string Record(const std::string& body) { return U32(uint32_t(body.size())) + body; }

TEST_F(FileOpsJournalTest, JournalFileHoldsEachStepBeforeItsEnd) {
   WriteAll(_root + "/old", "before");
   auto journal = Open(true);
   journal->Begin();
   journal->CreateDirectory(_root + "/d");
   journal->WriteFile(_root + "/old", "after");
   journal->RemoveDirectory(_root + "/d");
   journal->End();
   std::string bytes = ReadAll(_journal);
   ASSERT_GT(bytes.size(), 23u + 4u + 20u);
   uint32_t headerLength = static_cast<uint8_t>(bytes[23]);
   std::string expected = "NORVEX.JOURNAL.VER.1.0." + bytes.substr(23, 4 + headerLength) +
                          Record(U32(1)) + Record(U32(4) + "\1" + Str(_root + "/d")) +
                          Record(U32(7) + Str("backup") + Str(_journal + ".bak-3")) +
                          Record(U32(5) + std::string(1, '\0') + U32(1) + Str(_root + "/old")) +
                          Record(U32(5) + "\1" + U32(1) + Str(_root + "/old")) +
                          Record(U32(4) + std::string(1, '\0') + Str(_root + "/d")) + Record(U32(2) + "\1");
   EXPECT_EQ(bytes.substr(27 + headerLength), expected.substr(27 + headerLength));
   EXPECT_EQ(bytes.substr(27, 8), std::string("JRNL") + U32(kJrnlKindFileOps));
   EXPECT_EQ(bytes.substr(27 + headerLength - 9, 9), U32(5) + std::string("test\0", 5));
   // The kept old content is gone once the change stands.
   EXPECT_EQ(Snapshot(_root), (Tree{{"/old", "after"}}));
   std::vector<Ref<BaseJrnlEntry>> entries;
   journal->GetLogEntries(entries);
   ASSERT_EQ(entries.size(), 7u);
   EXPECT_EQ(entries[2]->PrintEntry(), "StringField \"backup\" = \"" + _journal + ".bak-3\"");
}

TEST_F(FileOpsJournalTest, AbortAndRecoverPutTheTreeBack) {
   WriteAll(_root + "/keep", "k");
   WriteAll(_root + "/gone", "g");
   ::mkdir((_root + "/empty").c_str(), 0755);
   const Tree before = Snapshot(_root);
   {
      auto journal = Open(true);
      journal->Begin();
      journal->CreateDirectoryHierarchy(_root + "/a/b/c");
      journal->WriteFile(_root + "/a/b/c/new", "n");
      journal->WriteFile(_root + "/keep", "changed");
      journal->WriteFile(_root + "/keep", "changed twice");
      journal->RemoveFile(_root + "/gone");
      journal->WriteFile(_root + "/gone", "reborn");
      journal->RemoveDirectory(_root + "/empty");
      journal->Abort();
      EXPECT_FALSE(journal->InChange());
      EXPECT_EQ(Snapshot(_root), before);
      // A finished change stands.
      journal->Begin();
      journal->WriteFile(_root + "/keep", "done");
      journal->End();
      // One left open, as a crash would leave it.
      journal->Begin();
      journal->RemoveFile(_root + "/keep");
      journal->CreateDirectory(_root + "/x");
   }
   Tree done = before;
   done["/keep"] = "done";
   auto journal = Open(false);
   EXPECT_TRUE(journal->Recover());
   EXPECT_EQ(Snapshot(_root), done);
   EXPECT_FALSE(journal->Recover());
   EXPECT_EQ(Snapshot(_root), done);
}

// An undo that is itself cut short is run again from the start: every step must be safe to
// repeat, including after the old content was already put back.
TEST_F(FileOpsJournalTest, RecoveryRunTwiceAfterAnInterruptedUndoKeepsTheOldContent) {
   WriteAll(_root + "/f", "old");
   {
      auto journal = Open(true);
      journal->Begin();
      journal->WriteFile(_root + "/f", "new");
   }
   // The undo got as far as putting the old file back, then died before its End.
   ASSERT_EQ(::rename((_journal + ".bak-2").c_str(), (_root + "/f").c_str()), 0);
   auto journal = Open(false);
   EXPECT_TRUE(journal->Recover());
   EXPECT_EQ(Snapshot(_root), (Tree{{"/f", "old"}}));
}

// Power loss in the middle of a record: the torn bytes are neither read nor kept.
TEST_F(FileOpsJournalTest, RecoveryIgnoresATornLastRecord) {
   {
      auto journal = Open(true);
      journal->Begin();
      journal->CreateDirectory(_root + "/d");
   }
   const std::string whole = ReadAll(_journal);
   WriteAll(_journal, whole + U32(40) + std::string("\5\0\0\0\1", 5));
   auto journal = Open(false);
   EXPECT_TRUE(journal->Recover());
   EXPECT_EQ(Snapshot(_root), Tree{});
   EXPECT_EQ(ReadAll(_journal).substr(0, whole.size() + 4), whole + U32(8));  // UndoFormer follows
   std::vector<Ref<BaseJrnlEntry>> entries;
   journal->GetLogEntries(entries);
   ASSERT_EQ(entries.size(), 4u);
   EXPECT_EQ(entries[2]->PrintEntry(), "UndoFormer record 1");
   EXPECT_EQ(entries[3]->PrintEntry(), "End undone");
}

// Kept copies of removed files must not sit in the directory being emptied.
TEST_F(FileOpsJournalTest, ADirectoryEmptiedInTheSameChangeCanBeRemoved) {
   ::mkdir((_root + "/d").c_str(), 0755);
   WriteAll(_root + "/d/f", "x");
   auto journal = Open(true);
   journal->Begin();
   journal->RemoveFile(_root + "/d/f");
   journal->RemoveDirectory(_root + "/d");
   journal->Abort();
   EXPECT_EQ(Snapshot(_root), (Tree{{"/d", "/"}, {"/d/f", "x"}}));
   journal->Begin();
   journal->RemoveFile(_root + "/d/f");
   journal->RemoveDirectory(_root + "/d");
   journal->End();
   EXPECT_EQ(Snapshot(_root), Tree{});
}

TEST_F(FileOpsJournalTest, MisuseIsRefused) {
   auto journal = Open(true);
   EXPECT_THROW(journal->WriteFile(_root + "/f", "x"), InvalidStateException);
   journal->Begin();
   EXPECT_THROW(journal->Begin(), InvalidStateException);
   EXPECT_THROW(journal->CreateDirectory(_root), AlreadyExistsException);
   EXPECT_THROW(journal->RemoveFile(_root + "/none"), NotFoundException);
   EXPECT_THROW(Open(true), JrnlException);  // its text is the file provider's
   WriteAll(_dir + "/other", "NORVEX.JOURNAL.VER.1.0." + Record(U32(1) + U32(1) + U32(0) + U32(0) + Str("x")));
   Ref<BasicFileOpsJournal> other;
   EXPECT_THROW(CreateBasicFileOpsJournal(_dir + "/other", false, "", other), JrnlException);
}

// The changes the crash test makes: chosen from the tree as it stands, so that parent and
// child, both holding the model, agree on every one.
struct Op {
   enum Kind { kMkdir, kWrite, kRemove, kRmdir } kind;
   std::string path;
   std::string content;
};

std::vector<Op> PlanChange(int k, const Tree& tree) {
   std::mt19937 rng(static_cast<unsigned>(k) * 7919u + 1u);
   Tree model = tree;
   std::vector<Op> ops;
   int count = 2 + static_cast<int>(rng() % 5);
   for (int i = 0; i < count; ++i) {
      std::vector<std::string> dirs{""}, files, emptyDirs;
      for (auto& [path, content] : model) {
         if (content == "/") {
            dirs.push_back(path);
            bool empty = true;
            for (auto it = model.upper_bound(path); it != model.end() && it->first.rfind(path + "/", 0) == 0; ++it)
               empty = false;
            if (empty) emptyDirs.push_back(path);
         } else {
            files.push_back(path);
         }
      }
      unsigned pick = rng() % 10;
      std::string name = "/n" + std::to_string(k) + "_" + std::to_string(i);
      if (pick < 2 && dirs.size() < 8) {
         ops.push_back({Op::kMkdir, dirs[rng() % dirs.size()] + name, ""});
         model[ops.back().path] = "/";
      } else if (pick < 7 || files.empty()) {
         bool overwrite = !files.empty() && rng() % 2;
         std::string path = overwrite ? files[rng() % files.size()] : dirs[rng() % dirs.size()] + name;
         ops.push_back({Op::kWrite, path, "c" + std::to_string(k) + "." + std::to_string(i)});
         model[path] = ops.back().content;
      } else if (pick < 9 || emptyDirs.empty()) {
         ops.push_back({Op::kRemove, files[rng() % files.size()], ""});
         model.erase(ops.back().path);
      } else {
         ops.push_back({Op::kRmdir, emptyDirs[rng() % emptyDirs.size()], ""});
         model.erase(ops.back().path);
      }
   }
   return ops;
}

void Apply(const std::vector<Op>& ops, Tree& model) {
   for (const Op& op : ops) {
      if (op.kind == Op::kMkdir) model[op.path] = "/";
      else if (op.kind == Op::kWrite) model[op.path] = op.content;
      else model.erase(op.path);
   }
}

// `stopAfterEnd`: dies right after the first change completes, the moment its End is on
// disk and its kept copies are gone, so that recovery meets a finished change too.
[[noreturn]] void RunChanges(const std::string& journalPath, const std::string& root, int first, Tree model,
                             int ready, bool stopAfterEnd) {
   Ref<BasicFileOpsJournal> journal;
   CreateBasicFileOpsJournal(journalPath, true, "crash", journal);
   (void)!::write(ready, "r", 1);
   for (int k = first; k < first + 1000; ++k) {
      std::vector<Op> ops = PlanChange(k, model);
      journal->Begin();
      for (const Op& op : ops) {
         std::string path = root + op.path;
         switch (op.kind) {
            case Op::kMkdir: journal->CreateDirectory(path); break;
            case Op::kWrite: journal->WriteFile(path, op.content); break;
            case Op::kRemove: journal->RemoveFile(path); break;
            case Op::kRmdir: journal->RemoveDirectory(path); break;
         }
      }
      journal->End();
      if (stopAfterEnd) ::raise(SIGKILL);
      Apply(ops, model);
   }
   ::_exit(0);
}

// Long enough for a few changes with their syncs, short enough for many trials.
constexpr unsigned kMaxKillDelayUs = 15000;

TEST_F(FileOpsJournalTest, CrashAtAnyMomentLeavesNoChangeHalfDone) {
   using Clock = std::chrono::steady_clock;
   const auto deadline = Clock::now() + std::chrono::seconds(3);
   std::mt19937 rng(12345);
   int next = 0;  // the first change not yet known to be done
   Tree model;
   int trials = 0, undone = 0, completed = 0;
   for (; trials < 150 && Clock::now() < deadline; ++trials) {
      int ready[2];
      ASSERT_EQ(::pipe(ready), 0);
      pid_t child = ::fork();
      ASSERT_GE(child, 0);
      if (child == 0) {
         // Nothing may unwind into the test framework in the child.
         try {
            RunChanges(_journal, _root, next, model, ready[1], trials % 4 == 3);
         } catch (const std::exception& e) {
            std::fprintf(stderr, "child failed: %s\n", e.what());
         }
         ::_exit(3);
      }
      ::close(ready[1]);
      // Some kills land while the journal itself is being created, most in the changes.
      char byte;
      if (trials % 8 != 0) (void)!::read(ready[0], &byte, 1);
      ::close(ready[0]);
      if (trials % 4 != 3) {
         ::usleep(rng() % kMaxKillDelayUs);
         ::kill(child, SIGKILL);
      }
      int status = 0;
      ASSERT_EQ(::waitpid(child, &status, 0), child);
      ASSERT_FALSE(WIFEXITED(status)) << "the child failed before it was killed";
      int finished = 0;
      if (GetJrnlFileHeader(_journal).size() == kJrnlFileHeaderLength) {
         Ref<BasicFileOpsJournal> journal;
         try {
            CreateBasicFileOpsJournal(_journal, false, "", journal);
         } catch (const JrnlException&) {
            journal = nullptr;  // killed before the header record was written: nothing began
         }
         if (journal) {
            if (journal->Recover()) ++undone;
            std::vector<Ref<BaseJrnlEntry>> entries;
            journal->GetLogEntries(entries);
            for (auto& entry : entries)
               if (entry->GetOp() == kJrnlOpEnd && static_cast<JrnlEndEntry*>(entry.Get())->IsCompleted())
                  ++finished;
         }
      }
      ::unlink(_journal.c_str());
      for (int i = 0; i < finished; ++i, ++next) Apply(PlanChange(next, model), model);
      completed += finished;
      ASSERT_EQ(Snapshot(_root), model) << "trial " << trials << " after change " << next;
      // No kept copy outlives recovery.
      EXPECT_EQ(Snapshot(_dir).size(), model.size() + 1) << "trial " << trials;
   }
   std::printf("crash trials: %d (%d unfinished changes undone, %d changes completed)\n", trials, undone,
               completed);
   RecordProperty("crash_trials", trials);
   EXPECT_GE(trials, 20);
   EXPECT_GT(undone, 0);
   EXPECT_GT(completed, 0);
}

}  // namespace
}  // namespace Pelmora::Service
