#include <gtest/gtest.h>

#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <random>
#include <thread>

#include "pelmora/authorize/entityTree.h"
#include "pelmora/authorize/exceptions.h"
#include "pelmora/authorize/sqliteStorage.h"
#include "src/authorize/authorizeManager.h"
#include "tests/support/authProviders.h"

namespace Pelmora::Authorize {
namespace {

class SqliteStorageTest : public ::testing::Test {
protected:
   void SetUp() override {
      std::string pattern = (std::filesystem::temp_directory_path() / "pelmora-auth-XXXXXX").string();
      ASSERT_NE(nullptr, mkdtemp(pattern.data()));
      dir = pattern;
      path = dir + "/auth.db";
   }
   void TearDown() override { std::filesystem::remove_all(dir); }

   Ref<StorageProvider> Open(int busyMs = 1000) {
      Ref<StorageProvider> storage;
      CreateSqliteStorageProvider(path, busyMs, storage);
      return storage;
   }
   static void Write(StorageProvider* storage, const std::function<void(AuthTransaction*)>& writes) {
      Ref<AuthTransaction> tx;
      storage->BeginTransaction(tx);
      writes(tx.Get());
      tx->Commit();
   }
   // Runs `sql` on its own connection; the first column of its first row, if any.
   std::string Sql(const std::string& sql) {
      sqlite3* db = nullptr;
      std::string first;
      EXPECT_EQ(SQLITE_OK, sqlite3_open(path.c_str(), &db));
      auto keep = [](void* out, int, char** values, char**) {
         if (static_cast<std::string*>(out)->empty() && values[0]) *static_cast<std::string*>(out) = values[0];
         return 0;
      };
      EXPECT_EQ(SQLITE_OK, sqlite3_exec(db, sql.c_str(), keep, &first, nullptr)) << sqlite3_errmsg(db);
      sqlite3_close(db);
      return first;
   }

   std::string dir;
   std::string path;
};

TEST_F(SqliteStorageTest, WhatIsCommittedIsLoadedAfterReopening) {
   {
      Ref<StorageProvider> storage = Open();
      Write(storage.Get(), [&](AuthTransaction* tx) {
         storage->StorePrivilege(tx, {"VM.Power", "VM"});
         storage->StorePrivilege(tx, {"VM.Delete", "VM"});
         storage->StoreRole(tx, {3, "ops", {"VM.Power", "System.View"}});
         storage->StoreRole(tx, {4, "gone", {}});
         storage->StoreACE(tx, {"vm", "alice", false, 3, true});
         storage->StoreACE(tx, {"vm", "ops", true, 3, false});
         storage->StoreACE(tx, {"dc", "alice", false, -1, true});
      });
      Write(storage.Get(), [&](AuthTransaction* tx) {
         storage->RemovePrivilege(tx, "VM.Delete");
         storage->RemoveRole(tx, 4);
         storage->StoreRole(tx, {3, "operators", {"VM.Power"}});
         storage->StoreACE(tx, {"vm", "alice", false, -2, false});  // replaces, keeps its place
         storage->RemoveACE(tx, "vm", "ops", true);
      });
   }
   Ref<StorageProvider> storage = Open();
   std::vector<PrivilegeDef> privileges;
   std::vector<RoleData> roles;
   std::vector<ACEData> aces;
   storage->LoadPrivileges(privileges);
   storage->LoadRoles(roles);
   storage->LoadACEs(aces);
   ASSERT_EQ(1u, privileges.size());
   EXPECT_EQ("VM.Power", privileges[0].id);
   EXPECT_EQ("VM", privileges[0].groupId);
   ASSERT_EQ(1u, roles.size());
   EXPECT_EQ(3, roles[0].id);
   EXPECT_EQ("operators", roles[0].name);
   EXPECT_EQ(std::vector<std::string>{"VM.Power"}, roles[0].privilegeIds);
   EXPECT_EQ((std::vector<ACEData>{{"vm", "alice", false, -2, false}, {"dc", "alice", false, -1, true}}), aces);
}

TEST_F(SqliteStorageTest, UncommittedWritesAreRolledBack) {
   Ref<StorageProvider> storage = Open();
   {
      Ref<AuthTransaction> tx;
      storage->BeginTransaction(tx);
      storage->StoreACE(tx.Get(), {"vm", "alice", false, 3, true});
      tx->Rollback();
      EXPECT_THROW(storage->StoreACE(tx.Get(), {"vm", "bob", false, 3, true}), AuthStorageException);
   }
   {
      Ref<AuthTransaction> tx;
      storage->BeginTransaction(tx);
      storage->StoreACE(tx.Get(), {"vm", "carol", false, 3, true});
      // Dropped without Commit.
   }
   std::vector<ACEData> aces;
   storage->LoadACEs(aces);
   EXPECT_TRUE(aces.empty());
   EXPECT_THROW(storage->StoreACE(nullptr, {"vm", "alice", false, 3, true}), AuthStorageException);
}

TEST_F(SqliteStorageTest, TheSchemaIsVersionedAndANewerOneIsRefused) {
   Open();
   EXPECT_EQ(std::to_string(kSqliteSchemaVersion), Sql("SELECT version FROM schema_version"));
   EXPECT_EQ("1", Sql("SELECT count(*) FROM schema_version"));
   EXPECT_EQ("wal", Sql("PRAGMA journal_mode"));

   Sql("UPDATE schema_version SET version = " + std::to_string(kSqliteSchemaVersion + 1));
   EXPECT_THROW(Open(), AuthStorageException);
   Ref<StorageProvider> storage;
   EXPECT_THROW(CreateSqliteStorageProvider(dir + "/missing/auth.db", 10, storage), AuthStorageException);
}

TEST_F(SqliteStorageTest, ABusyDatabaseFailsTheTransactionAfterTheTimeOut) {
   Ref<StorageProvider> storage = Open(50);
   sqlite3* other = nullptr;
   ASSERT_EQ(SQLITE_OK, sqlite3_open(path.c_str(), &other));
   ASSERT_EQ(SQLITE_OK, sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr));
   Ref<AuthTransaction> tx;
   auto start = std::chrono::steady_clock::now();
   EXPECT_THROW(storage->BeginTransaction(tx), AuthStorageException);
   EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(40));
   sqlite3_exec(other, "ROLLBACK", nullptr, nullptr, nullptr);
   sqlite3_close(other);
   Write(storage.Get(), [&](AuthTransaction* tx) { storage->StoreACE(tx, {"vm", "alice", false, 3, true}); });
}

TEST_F(SqliteStorageTest, TheManagerStartsFromAndWritesToTheDatabase) {
   Ref<EntityTree> tree;
   CreateEntityTree("root", tree);
   tree->AddEntity("vm", "root");
   Ref<TestSupport::FakeDirectory> directory(new TestSupport::FakeDirectory());
   directory->AddUser("root");
   directory->AddUser("alice");
   TestSupport::AuthLogLines log;
   Ref<AuthEntity> vm;
   tree->FindEntity("vm", vm);
   {
      Ref<StorageProvider> storage = Open();
      Ref<AuthorizeManager> manager;
      CreateAuthorizeManager(manager);
      manager->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get());
      manager->AddPrivileges({{"VM.Power", "VM"}});
      int id = 0;
      PrivSet set;
      set.Set(3);
      manager->CreateRole("power", set, id);
      manager->CreateACE(vm.Get(), "alice", false, id, false);
      manager->Shutdown();
   }
   Ref<StorageProvider> storage = Open();
   Ref<AuthorizeManager> manager;
   CreateAuthorizeManager(manager);
   manager->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get());
   Ref<Session> alice(new TestSupport::TestSession());
   manager->AddConnection(alice.Get(), "alice", nullptr, false);
   EXPECT_TRUE(manager->HasEntityPrivilege(alice.Get(), vm.Get(), "VM.Power"));
   ACEResult all;
   manager->GetACEs(all);
   EXPECT_EQ(2u, all.size());
   manager->Shutdown();
}

// A child process rewrites every permission of a batch in each transaction and is
// killed at a random point: the database must always hold one whole batch.
TEST_F(SqliteStorageTest, AKilledWriterLeavesTheOldOrTheNewPermissionsNeverAMix) {
   constexpr int kBatch = 20;
   Open();
   std::mt19937 random(12345);
   int lastSeen = 0;
   for (int round = 0; round < 5; ++round) {
      int pipeFds[2];
      ASSERT_EQ(0, pipe(pipeFds));
      pid_t child = fork();
      ASSERT_GE(child, 0);
      if (child == 0) {
         close(pipeFds[0]);
         try {
            Ref<StorageProvider> storage = Open();
            std::vector<ACEData> aces;
            storage->LoadACEs(aces);
            int next = aces.empty() ? 1 : aces[0].roleId + 1;
            for (;; ++next) {
               Write(storage.Get(), [&](AuthTransaction* tx) {
                  for (int k = 0; k < kBatch; ++k) {
                     storage->StoreACE(tx, {"e" + std::to_string(k), "user", false, next, k % 2 == 0});
                  }
               });
               if (write(pipeFds[1], &next, sizeof(next)) != sizeof(next)) _exit(3);
            }
         } catch (...) {
            _exit(2);
         }
      }
      close(pipeFds[1]);
      // Let a few transactions commit, then kill somewhere in the middle of the next ones.
      int committed = 0;
      for (int i = 0; i < 3; ++i) ASSERT_EQ(static_cast<ssize_t>(sizeof(committed)), read(pipeFds[0], &committed, sizeof(committed)));
      std::this_thread::sleep_for(std::chrono::microseconds(random() % 3000));
      kill(child, SIGKILL);
      int status = 0;
      ASSERT_EQ(child, waitpid(child, &status, 0));
      ASSERT_TRUE(WIFSIGNALED(status)) << "the writer ended by itself with status " << status;
      // Commits the child reported before it died.
      int reported = committed;
      while (read(pipeFds[0], &committed, sizeof(committed)) == sizeof(committed)) reported = committed;
      close(pipeFds[0]);

      Ref<StorageProvider> storage = Open();
      std::vector<ACEData> aces;
      storage->LoadACEs(aces);
      ASSERT_EQ(static_cast<size_t>(kBatch), aces.size()) << "round " << round;
      for (const ACEData& ace : aces) EXPECT_EQ(aces[0].roleId, ace.roleId) << "round " << round;
      EXPECT_GE(aces[0].roleId, reported);
      EXPECT_GT(aces[0].roleId, lastSeen);
      lastSeen = aces[0].roleId;
   }
}

}  // namespace
}  // namespace Pelmora::Authorize
