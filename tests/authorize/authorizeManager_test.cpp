#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include "pelmora/authorize/entityTree.h"
#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/perfCounter/registry.h"
#include "src/authorize/authorizeManager.h"
#include "tests/support/authProviders.h"
#include "tests/support/watchdog.h"

namespace Pelmora::Authorize {
namespace {

using TestSupport::AuthLogLines;
using TestSupport::FakeDirectory;
using TestSupport::MemoryStorage;
using TestSupport::TestSession;

// root - dc - host - vm, and root - lab.
class ManagerTest : public ::testing::Test {
protected:
   void SetUp() override {
      CreateEntityTree("root", tree);
      tree->AddEntity("dc", "root");
      tree->AddEntity("host", "dc");
      tree->AddEntity("vm", "host");
      tree->AddEntity("lab", "root");
      directory = new FakeDirectory();
      for (const char* user : {"root", "alice", "bob"}) directory->AddUser(user);
      directory->AddMember("ops", "alice");
      directory->AddMember("ops", "bob");
      storage = new MemoryStorage();
   }
   void TearDown() override {
      if (manager) manager->Shutdown();
   }

   void Start() {
      Ref<AuthorizeManager> made;
      CreateAuthorizeManager(made);
      manager = made.Cast<AuthorizeManagerImpl>();
      manager->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get(), nullptr);
   }
   AuthEntity* E(const std::string& id) {
      Ref<AuthEntity> entity;
      EXPECT_TRUE(tree->FindEntity(id, entity)) << id;
      kept.push_back(entity);
      return entity.Get();
   }
   Ref<Session> Connect(const std::string& user, bool privileged = false) {
      Ref<Session> session(new TestSession());
      manager->AddConnection(session.Get(), user, nullptr, privileged);
      return session;
   }
   bool Can(Session* session, const std::string& entity, const std::string& privilege = kPrivilegeRead) {
      return manager->HasEntityPrivilege(session, E(entity), privilege);
   }
   std::vector<int> RolesOn(Session* session, const std::string& entity) {
      std::vector<int> ids;
      manager->GetEntityRoles(session, E(entity), ids);
      return ids;
   }

   AuthLogLines log;
   Ref<EntityTree> tree;
   Ref<FakeDirectory> directory;
   Ref<MemoryStorage> storage;
   Ref<AuthorizeManagerImpl> manager;
   std::vector<Ref<AuthEntity>> kept;
};

TEST_F(ManagerTest, AnEmptyStoreGetsAdminOnTheRootForTheDefaultUser) {
   Start();
   EXPECT_EQ(std::vector<ACEData>{(ACEData{"root", "root", false, kRoleAdmin, true})}, storage->Snapshot().aces);
   Ref<Session> root = Connect("root");
   EXPECT_TRUE(manager->HasRootAccess(root.Get()));
   EXPECT_TRUE(Can(root.Get(), "vm"));
   Ref<Session> alice = Connect("alice");
   EXPECT_FALSE(manager->HasRootAccess(alice.Get()));
   EXPECT_FALSE(Can(alice.Get(), "vm", kPrivilegeAnonymous));
   EXPECT_TRUE(RolesOn(alice.Get(), "vm").empty());
}

TEST_F(ManagerTest, StartUpFailsWhenNoDefaultPermissionCanBeMadeOrStored) {
   directory->RemoveUser("root");
   Ref<AuthorizeManager> made;
   CreateAuthorizeManager(made);
   try {
      made->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get());
      FAIL() << "started without access rules";
   } catch (const AuthException& e) {
      EXPECT_STREQ("Cannot start authorize - system has no access rules", e.what());
   }
   EXPECT_TRUE(log.Has("Failed to add default permission: user root not found"));
   EXPECT_TRUE(log.Has("Failed to generate default permission id - system has no access rules"));
   EXPECT_TRUE(log.Has("[Auth] Failed to initialize: <Cannot start authorize - system has no access rules>"));

   directory->AddUser("root");
   storage->FailCommits(1);
   EXPECT_THROW(made->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get()), AuthException);
   EXPECT_TRUE(log.Has("Failed to store default permission - system has no access rules"));
   // A failed start leaves the manager uninitialised, so it can be started again.
   made->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get());
   made->Shutdown();
}

TEST_F(ManagerTest, DefaultPermissionGoesToTheConfiguredUser) {
   Ref<Service::Config> config;
   Service::CreateScratchConfig(config);
   Ref<Service::Config::View> view;
   config->GetMainView(view);
   view->Set(kConfigDefaultAdmin, "alice");
   view->Set(kConfigMaxEntityCache, 3u);
   Ref<AuthorizeManager> made;
   CreateAuthorizeManager(made);
   made->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get(), view.Get());
   EXPECT_EQ("alice", storage->Snapshot().aces.at(0).principal);
   EXPECT_EQ(3u, made.Cast<AuthorizeManagerImpl>()->GetMaxUserCacheEntries());
   made->Shutdown();
}

TEST_F(ManagerTest, StartUpDropsInvalidStoredPermissionsAndKeepsUnresolvedOnes) {
   MemoryStorage::State state;
   state.privileges["VM.Power"] = PrivilegeDef{"VM.Power", "VM"};
   state.roles[1] = RoleData{1, "operator", {"VM.Power", "VM.Gone"}};
   state.aces = {
      {"root", "root", false, kRoleAdmin, true},  {"", "alice", false, kRoleView, false},
      {"vm", "nobody", false, kRoleView, false},  {"nowhere", "alice", false, kRoleView, false},
      {"vm", "alice", false, 42, false},          {"vm", "alice", false, 1, false},
      {"vm", "alice", false, kRoleView, false},   {"lab", "ghosts", true, kRoleView, true},
   };
   storage->Seed(state);
   directory->AddGroup("ghosts");
   directory->SetUnresolved("ghosts", true);
   Start();
   EXPECT_TRUE(log.Has("Role referred to invalid privilege VM.Gone, ignoring"));
   EXPECT_TRUE(log.Has("Removing invalid permission :user:alice: unknown entity"));
   EXPECT_TRUE(log.Has("Removing invalid permission vm:user:nobody: user nobody not found"));
   EXPECT_TRUE(log.Has("Removing invalid permission nowhere:user:alice: entity nowhere not found"));
   EXPECT_TRUE(log.Has("Removing invalid permission vm:user:alice: role with id 42 not found"));
   EXPECT_TRUE(log.Has("Removing invalid permission vm:user:alice: permission already exists"));
   EXPECT_TRUE(log.Has("Warning, existence of group \"ghosts\" unknown, permission may not be effective until it is resolved."));
   std::vector<ACEData> expected{{"lab", "ghosts", true, kRoleView, true},
                                 {"root", "root", false, kRoleAdmin, true},
                                 {"vm", "alice", false, 1, false}};
   std::vector<ACEData> stored = storage->Snapshot().aces;
   std::sort(stored.begin(), stored.end(), [](const ACEData& a, const ACEData& b) { return a.entityId < b.entityId; });
   EXPECT_EQ(expected, stored);
   ACEResult loaded;
   manager->GetACEs(loaded);
   EXPECT_EQ(3u, loaded.size());
   std::vector<std::string> privileges;
   manager->GetRolePrivList(1, privileges);
   EXPECT_EQ(std::vector<std::string>{"VM.Power"}, privileges);
   Ref<Session> alice = Connect("alice");
   EXPECT_TRUE(Can(alice.Get(), "vm", "VM.Power"));
}

TEST_F(ManagerTest, ChangesSurviveARestartFromTheStore) {
   Start();
   manager->AddPrivileges({{"VM.Power", "VM"}});
   int id = 0;
   PrivSet set;
   set.Set(3);
   manager->CreateRole("operator", set, id);
   manager->CreateACE(E("dc"), "ops", true, id, true);
   manager->Shutdown();
   Start();
   Ref<Session> bob = Connect("bob");
   EXPECT_TRUE(Can(bob.Get(), "vm", "VM.Power"));
   EXPECT_FALSE(Can(bob.Get(), "lab", "VM.Power"));
   Ref<Role> role;
   manager->GetRole(id, role);
   EXPECT_EQ("operator", role->GetName());
}

TEST_F(ManagerTest, APropagatingEntryReachesEveryDescendantWithoutOneOfItsOwn) {
   Start();
   manager->CreateACE(E("dc"), "alice", false, kRoleReadOnly, true);
   manager->CreateACE(E("host"), "ops", true, kRoleView, false);
   Ref<Session> alice = Connect("alice");
   EXPECT_TRUE(Can(alice.Get(), "dc"));
   EXPECT_TRUE(Can(alice.Get(), "vm"));
   // host has an entry for alice's group: its own access is View, yet below it the
   // propagated ReadOnly from dc still reaches vm.
   EXPECT_EQ(std::vector<int>{kRoleView}, RolesOn(alice.Get(), "host"));
   EXPECT_FALSE(Can(alice.Get(), "host"));
   EXPECT_EQ(std::vector<int>{kRoleReadOnly}, RolesOn(alice.Get(), "vm"));
   EXPECT_FALSE(Can(alice.Get(), "lab", kPrivilegeAnonymous));
   EXPECT_FALSE(Can(alice.Get(), "root", kPrivilegeAnonymous));
}

TEST_F(ManagerTest, ChecksRefuseUnknownSessionsAndUnknownPrivileges) {
   Start();
   Ref<Session> stranger(new TestSession());
   EXPECT_FALSE(Can(stranger.Get(), "vm"));
   EXPECT_TRUE(log.Has("Failed to retrieve user data! User: []"));
   Ref<Session> root = Connect("root");
   EXPECT_THROW(Can(root.Get(), "vm", "VM.Nothing"), AuthPrivilegeNotFoundException);
   EXPECT_FALSE(manager->HasEntityPrivilege(root.Get(), nullptr, kPrivilegeRead));
   EXPECT_TRUE(manager->HasPrivilege(root.Get(), kPrivilegeRead));
   EXPECT_TRUE(manager->HasRootAccess(nullptr));
   EXPECT_EQ("root", manager->GetUser(root.Get()));
   manager->RemoveConnection(root.Get());
   EXPECT_EQ("", manager->GetUser(root.Get()));
   EXPECT_FALSE(manager->HasRootAccess(root.Get()));
}

TEST_F(ManagerTest, PrivilegedSessionsAndUsersWithoutSessionsAreAnswered) {
   Start();
   Ref<Session> service = Connect("bob", true);
   EXPECT_TRUE(manager->HasRootAccess(service.Get()));
   EXPECT_TRUE(Can(service.Get(), "vm"));
   manager->CreateACE(E("vm"), "alice", false, kRoleView, false);
   EXPECT_TRUE(manager->HasEntityPrivilege("alice", E("vm"), kPrivilegeView));
   EXPECT_FALSE(manager->HasEntityPrivilege("alice", E("vm"), kPrivilegeRead));
   EXPECT_FALSE(manager->HasEntityPrivilege("nobody", E("vm"), kPrivilegeView));
}

TEST_F(ManagerTest, TheAnonymousPrincipalHasItsOwnEntries) {
   Start();
   manager->CreateACE(E("lab"), kAnonymousUser, false, kRoleAnonymous, true);
   Ref<Session> anonymous = Connect(kAnonymousUser);
   EXPECT_TRUE(Can(anonymous.Get(), "lab", kPrivilegeAnonymous));
   EXPECT_FALSE(Can(anonymous.Get(), "lab", kPrivilegeView));
   EXPECT_FALSE(Can(anonymous.Get(), "vm", kPrivilegeAnonymous));
}

TEST_F(ManagerTest, ListChecksAnswerEachPairCachedOrNot) {
   Start();
   manager->CreateACE(E("dc"), "alice", false, kRoleView, true);
   Ref<Session> alice = Connect("alice");
   EntityPrivilegeList list{{E("vm"), kPrivilegeView}, {E("vm"), kPrivilegeRead}, {E("lab"), kPrivilegeView},
                            {nullptr, kPrivilegeView}};
   std::vector<bool> cached, uncached;
   manager->HasEntityPrivilegeList(alice.Get(), list, cached);
   manager->HasEntityPrivilegeListUncached(alice.Get(), list, uncached);
   EXPECT_EQ((std::vector<bool>{true, false, false, false}), cached);
   EXPECT_EQ(cached, uncached);
   list.push_back({E("vm"), "VM.Nothing"});
   EXPECT_THROW(manager->HasEntityPrivilegeList(alice.Get(), list, cached), AuthPrivilegeNotFoundException);
}

TEST_F(ManagerTest, CachesFollowPermissionChangesAndEntityMoves) {
   Start();
   manager->CreateACE(E("dc"), "alice", false, kRoleReadOnly, true);
   Ref<Session> alice = Connect("alice");
   EXPECT_TRUE(Can(alice.Get(), "vm"));
   EXPECT_GT(manager->CachedEntryCount(alice.Get()), 0u);
   manager->ModifyACE(E("dc"), "alice", false, kRoleView, true);
   EXPECT_FALSE(Can(alice.Get(), "vm"));
   EXPECT_TRUE(Can(alice.Get(), "vm", kPrivilegeView));

   // vm moves out from under dc: once told, the cache forgets what dc gave it.
   tree->MoveEntity("vm", "lab");
   manager->NotifyEntityMove({"vm"});
   EXPECT_FALSE(Can(alice.Get(), "vm", kPrivilegeView));
   tree->MoveEntity("vm", "host");
   manager->NotifyEntityMove({"vm"});
   EXPECT_TRUE(Can(alice.Get(), "vm", kPrivilegeView));

   manager->RemoveACE(E("dc"), "alice", false);
   EXPECT_FALSE(Can(alice.Get(), "vm", kPrivilegeView));
}

// The process registry's value of `name`, or -1 when it is not registered.
long long Counter(const std::string& name) {
   PerfCounter::QueryResults results;
   PerfCounter::GetCounterRegistry()->CollectAll(results);
   for (const PerfCounter::QueryResult& result : results) {
      if (result.metadata->GetName() == name) return result.value.Get();
   }
   return -1;
}

TEST_F(ManagerTest, ChecksAndSessionsAreCountedWhileTheManagerRuns) {
   Start();
   Ref<Session> root = Connect("root");
   Ref<Session> alice = Connect("alice");
   EXPECT_EQ(2, Counter(kCounterSessions));
   long long checks = Counter(kCounterChecks);
   long long hits = Counter(kCounterCacheHits);
   long long misses = Counter(kCounterCacheMisses);
   Can(alice.Get(), "vm");
   Can(alice.Get(), "vm");
   EXPECT_EQ(checks + 2, Counter(kCounterChecks));
   EXPECT_EQ(misses + 1, Counter(kCounterCacheMisses));
   EXPECT_EQ(hits + 1, Counter(kCounterCacheHits));
   manager->RemoveConnection(root.Get());
   EXPECT_EQ(1, Counter(kCounterSessions));
   manager->Shutdown();
   EXPECT_EQ(-1, Counter(kCounterChecks));
   manager.Reset();
}

TEST_F(ManagerTest, TheCacheStaysWithinItsBound) {
   Start();
   manager->CreateACE(E("root"), "alice", false, kRoleView, true);
   Ref<Session> alice = Connect("alice");
   manager->UpdateMaxUserCacheEntries(2);
   for (const char* id : {"vm", "lab", "host", "dc"}) EXPECT_TRUE(Can(alice.Get(), id, kPrivilegeView));
   EXPECT_LE(manager->CachedEntryCount(alice.Get()), 2u);
   manager->ClearUserCaches();
   EXPECT_EQ(0u, manager->CachedEntryCount(alice.Get()));
   manager->UpdateMaxUserCacheEntries(0);
   EXPECT_TRUE(Can(alice.Get(), "vm", kPrivilegeView));
   EXPECT_EQ(0u, manager->CachedEntryCount(alice.Get()));
}

TEST_F(ManagerTest, RoleNamesAreUniqueAndSystemRolesNeverChange) {
   Start();
   int id = 0;
   EXPECT_THROW(manager->CreateRole("Admin", PrivSet(), id), AuthAlreadyExistsException);
   EXPECT_TRUE(log.Has("Role with name 'Admin' already exists"));
   EXPECT_THROW(manager->CreateRole("", PrivSet(), id), AuthInvalidRoleNameException);
   PrivSet set;
   EXPECT_THROW(manager->ModifyRole(kRoleView, "View", set, true), AuthSystemRoleException);
   EXPECT_THROW(manager->RemoveRole(kRoleReadOnly, true, true), AuthSystemRoleException);
   EXPECT_THROW(manager->CreateRoleWithId("mine", set, -7, true), AuthSystemRoleException);
   EXPECT_THROW(manager->ModifyRole(99, "x", set, true), AuthRoleNotFoundException);

   manager->CreateRole("a", set, id);
   EXPECT_EQ(1, id);
   manager->CreateRoleWithId("b", set, 5, true);
   EXPECT_THROW(manager->CreateRoleWithId("c", set, 5, true), AuthAlreadyExistsException);
   manager->CreateRoleWithId("local", set, 6, false);
   manager->CreateRole("c", set, id);
   EXPECT_EQ(2, id);
   EXPECT_THROW(manager->ModifyRole(2, "b", set, true), AuthAlreadyExistsException);
   // Unknown bits are dropped and the caller sees what was kept.
   set.Set(kPrivilegeIndexView);
   set.Set(700);
   manager->ModifyRole(2, "c2", set, true);
   EXPECT_FALSE(set.Test(700));
   RoleResult roles;
   manager->GetRoles(roles);
   ASSERT_EQ(9u, roles.size());
   EXPECT_EQ(kRoleNoAccess, roles.front()->GetId());
   EXPECT_EQ(6, roles.back()->GetId());
   auto stored = storage->Snapshot().roles;
   EXPECT_EQ(3u, stored.size());
   EXPECT_EQ("c2", stored.at(2).name);
   EXPECT_EQ(std::vector<std::string>{kPrivilegeView}, stored.at(2).privilegeIds);
   EXPECT_EQ(0u, stored.count(6));
}

TEST_F(ManagerTest, ARoleInUseGoesOnlyWithItsPermissionsOrAfterThemMoving) {
   Start();
   int from = 0;
   int to = 0;
   PrivSet view;
   view.Set(kPrivilegeIndexView);
   manager->CreateRole("from", view, from);
   manager->CreateRole("to", PrivSet(), to);
   manager->CreateACE(E("vm"), "alice", false, from, false);
   manager->CreateACE(E("lab"), "ops", true, from, true);
   EXPECT_THROW(manager->RemoveRole(from, false, true), AuthRolePermissionsExistException);
   EXPECT_THROW(manager->MoveRolePermissions(from, from), AuthSameRoleException);
   EXPECT_THROW(manager->MoveRolePermissions(from, 77), AuthRoleNotFoundException);
   EXPECT_THROW(manager->MoveRolePermissions(kRoleAdmin, to), AuthMinimumAdminPermissionException);
   Ref<Session> alice = Connect("alice");
   EXPECT_TRUE(Can(alice.Get(), "vm", kPrivilegeView));
   manager->MoveRolePermissions(from, to);
   EXPECT_FALSE(Can(alice.Get(), "vm", kPrivilegeView));
   ACEResult moved;
   manager->GetACEsByRole(to, moved);
   EXPECT_EQ(2u, moved.size());
   manager->RemoveRole(from, false, true);
   manager->RemoveRole(to, true, true);
   ACEResult left;
   manager->GetACEs(left);
   EXPECT_EQ(1u, left.size());
   EXPECT_EQ(1u, storage->Snapshot().aces.size());
   EXPECT_TRUE(storage->Snapshot().roles.empty());
}

TEST_F(ManagerTest, TheLastAdministratorCannotBeRemovedOrDemoted) {
   Start();
   EXPECT_THROW(manager->RemoveACE(E("root"), "root", false), AuthMinimumAdminPermissionException);
   EXPECT_TRUE(log.Has("Failed to remove permission: would remove minimum administrator access"));
   EXPECT_THROW(manager->ModifyACE(E("root"), "root", false, kRoleReadOnly, true), AuthMinimumAdminPermissionException);
   EXPECT_THROW(manager->RemoveAssociatedACL("root"), AuthMinimumAdminPermissionException);
   // A group with Admin does not count: it may be empty.
   manager->CreateACE(E("root"), "ops", true, kRoleAdmin, true);
   EXPECT_THROW(manager->RemoveACE(E("root"), "root", false), AuthMinimumAdminPermissionException);
   manager->CreateACE(E("root"), "alice", false, kRoleAdmin, true);
   manager->RemoveACE(E("root"), "root", false);
   EXPECT_THROW(manager->RemoveACE(E("root"), "alice", false), AuthMinimumAdminPermissionException);
   EXPECT_THROW(manager->RemoveACE(E("root"), "root", false), AuthPermissionNotFoundException);
   EXPECT_TRUE(log.Has("Failed to remove permission: not found"));
}

TEST_F(ManagerTest, StorageFailuresLeaveMemoryUnchanged) {
   Start();
   manager->CreateACE(E("vm"), "alice", false, kRoleView, false);
   Ref<Session> alice = Connect("alice");
   auto before = storage->Snapshot().aces;

   storage->FailCommits(1);
   EXPECT_THROW(manager->CreateACE(E("lab"), "alice", false, kRoleView, false), AuthStorageException);
   storage->FailCommits(1);
   EXPECT_THROW(manager->ModifyACE(E("vm"), "alice", false, kRoleReadOnly, false), AuthStorageException);
   storage->FailCommits(1);
   EXPECT_THROW(manager->RemoveACE(E("vm"), "alice", false), AuthStorageException);
   EXPECT_TRUE(log.Has("Failed to remove permission: could not persist to storage"));
   int id = 0;
   storage->FailCommits(1);
   EXPECT_THROW(manager->CreateRole("r", PrivSet(), id), AuthStorageException);
   storage->FailCommits(1);
   EXPECT_THROW(manager->AddPrivileges({{"VM.Power", "VM"}}), AuthStorageException);

   EXPECT_EQ(before, storage->Snapshot().aces);
   EXPECT_FALSE(Can(alice.Get(), "lab", kPrivilegeView));
   EXPECT_TRUE(Can(alice.Get(), "vm", kPrivilegeView));
   EXPECT_FALSE(Can(alice.Get(), "vm", kPrivilegeRead));
   Ref<Privilege> privilege;
   EXPECT_THROW(manager->GetPrivilege("VM.Power", privilege), AuthPrivilegeNotFoundException);
   RoleResult roles;
   manager->GetRoles(roles);
   EXPECT_EQ(5u, roles.size());
}

TEST_F(ManagerTest, PrivilegesComeAndGoButTheBuiltInOnesStay) {
   Start();
   manager->AddPrivileges({{"VM.Power", "VM"}, {"VM.Delete", "VM"}});
   Ref<Privilege> power;
   manager->GetPrivilege("VM.Power", power);
   int id = 0;
   PrivSet set;
   set.Set(power->GetIndex());
   manager->CreateRole("power", set, id);
   manager->CreateACE(E("vm"), "alice", false, id, false);
   Ref<Session> alice = Connect("alice");
   Ref<Session> root = Connect("root");
   EXPECT_TRUE(Can(alice.Get(), "vm", "VM.Power"));
   EXPECT_TRUE(Can(root.Get(), "vm", "VM.Delete"));
   EXPECT_THROW(manager->RemovePrivileges({kPrivilegeView}), AuthSystemPrivilegeException);
   EXPECT_THROW(manager->RemovePrivileges({"VM.Gone"}), AuthPrivilegeNotFoundException);
   manager->RemovePrivileges({"VM.Power"});
   EXPECT_THROW(Can(alice.Get(), "vm", "VM.Power"), AuthPrivilegeNotFoundException);
   std::vector<std::string> ids;
   manager->GetRolePrivList(id, ids);
   EXPECT_TRUE(ids.empty());
   EXPECT_TRUE(storage->Snapshot().roles.at(id).privilegeIds.empty());
   EXPECT_EQ(1u, storage->Snapshot().privileges.count("VM.Delete"));
   EXPECT_EQ(0u, storage->Snapshot().privileges.count("VM.Power"));
   PrivilegeResult all;
   manager->GetPrivileges(all);
   EXPECT_EQ(4u, all.size());
}

TEST_F(ManagerTest, PermissionsAreListedOwnInheritedAndByRole) {
   Start();
   manager->CreateACE(E("dc"), "ops", true, kRoleView, true);
   manager->CreateACE(E("host"), "bob", false, kRoleReadOnly, false);
   manager->CreateACE(E("vm"), "alice", false, kRoleReadOnly, false);
   EXPECT_THROW(manager->CreateACE(E("vm"), "alice", false, kRoleView, false), AuthAlreadyExistsException);
   EXPECT_THROW(manager->CreateACE(E("vm"), "nobody", false, kRoleView, false), AuthUserNotFoundException);
   EXPECT_THROW(manager->CreateACE(E("vm"), "carol", false, 55, false), AuthRoleNotFoundException);
   ACEResult own, inherited, byRole;
   manager->GetACEs(E("vm"), false, own);
   manager->GetACEs(E("vm"), true, inherited);
   manager->GetACEsByRole(kRoleReadOnly, byRole);
   EXPECT_EQ(std::vector<ACEData>{(ACEData{"vm", "alice", false, kRoleReadOnly, false})}, own);
   std::vector<ACEData> expected{{"vm", "alice", false, kRoleReadOnly, false},
                                 {"dc", "ops", true, kRoleView, true},
                                 {"root", "root", false, kRoleAdmin, true}};
   EXPECT_EQ(expected, inherited);
   EXPECT_EQ(2u, byRole.size());
}

TEST_F(ManagerTest, RemovedEntitiesAndVanishedUsersLoseTheirPermissions) {
   Start();
   manager->CreateACE(E("vm"), "alice", false, kRoleView, false);
   manager->CreateACE(E("host"), "bob", false, kRoleView, false);
   manager->CreateACE(E("lab"), "bob", false, kRoleView, false);
   std::vector<std::string> removed;
   tree->RemoveEntity("host", removed);
   manager->RemoveAssociatedACL("vm");
   EXPECT_EQ(3u, storage->Snapshot().aces.size());
   directory->RemoveUser("bob");
   ACEResult dropped;
   manager->ValidateACEs(dropped);
   EXPECT_TRUE(log.Has("Unknown entity host while validating permissions"));
   EXPECT_EQ(2u, dropped.size());
   ACEResult left;
   manager->GetACEs(left);
   EXPECT_EQ(std::vector<ACEData>{(ACEData{"root", "root", false, kRoleAdmin, true})}, left);
   EXPECT_EQ(left, storage->Snapshot().aces);
}

TEST_F(ManagerTest, ValidationStopsWhenTheDirectoryCannotAnswer) {
   Start();
   manager->CreateACE(E("vm"), "alice", false, kRoleView, false);
   directory->SetUnresolved("alice", true);
   directory->RemoveUser("root");
   ACEResult dropped;
   manager->ValidateACEs(dropped);
   EXPECT_TRUE(dropped.empty());
   EXPECT_TRUE(log.Has("Failed to conclusively determine user alice while validating permissions, aborting validation"));
   EXPECT_EQ(2u, storage->Snapshot().aces.size());
}

TEST_F(ManagerTest, StorageFailureWhileDeletingAnEntitysPermissionsIsLogged) {
   Start();
   manager->CreateACE(E("vm"), "alice", false, kRoleView, false);
   storage->FailCommits(1);
   manager->RemoveAssociatedACL("vm");
   EXPECT_TRUE(log.Has("Failed to delete permission vm:user:alice from removed entity"));
   ACEResult own;
   manager->GetACEs(E("vm"), false, own);
   EXPECT_EQ(1u, own.size());
}

TEST_F(ManagerTest, ConcurrentChecksSeeEitherTheOldOrTheNewPermission) {
   Start();
   manager->CreateACE(E("dc"), "alice", false, kRoleReadOnly, true);
   Ref<Session> alice = Connect("alice");
   std::atomic<bool> stop{false};
   std::atomic<int> wrong{0};
   // Resolved up front: the threads touch nothing but the manager.
   AuthEntity* vm = E("vm");
   AuthEntity* host = E("host");
   AuthEntity* dc = E("dc");
   std::vector<std::thread> threads;
   for (int t = 0; t < 2; ++t) {
      threads.emplace_back([&] {
         while (!stop.load()) {
            // View holds under both roles; Read flips with them.
            if (!manager->HasEntityPrivilege(alice.Get(), vm, kPrivilegeView)) ++wrong;
            manager->HasEntityPrivilege(alice.Get(), host, kPrivilegeRead);
            std::vector<int> roles;
            manager->GetEntityRoles(alice.Get(), vm, roles);
            if (roles.size() != 1) ++wrong;
         }
      });
   }
   for (int i = 0; i < 200; ++i) {
      manager->ModifyACE(dc, "alice", false, i % 2 ? kRoleReadOnly : kRoleView, true);
      if (i % 50 == 0) manager->NotifyEntityMove({"vm"});
   }
   stop = true;
   Testing::JoinAll(threads, "checking threads");
   EXPECT_EQ(0, wrong.load());
}

using ManagerDeathTest = ManagerTest;

TEST_F(ManagerDeathTest, InitWithoutAProviderPanics) {
   Ref<AuthorizeManager> made;
   CreateAuthorizeManager(made);
   EXPECT_DEATH(made->Init(nullptr, storage.Get(), tree.Get(), nullptr), "Assert Failed: \"userDirectory != __null\"");
   EXPECT_DEATH(made->Init(directory.Get(), nullptr, tree.Get(), nullptr), "Assert Failed: \"storageProvider != __null\"");
   EXPECT_DEATH(made->Init(directory.Get(), storage.Get(), nullptr, nullptr), "Assert Failed: \"appModelProvider != __null\"");
}

TEST_F(ManagerDeathTest, InheritedAccessOutsideTheLockPanics) {
   Start();
   EXPECT_DEATH(manager->FindParentAccess("alice", nullptr, "vm", nullptr),
                "Assert Failed: \"IsReadLocked\\(\\) \\|\\| IsWriteLocked\\(\\)\"");
}

TEST(ManagerLockTest, TracksTheCallingThreadsHoldAndRefusesToNest) {
   ManagerLock a, b;
   EXPECT_FALSE(a.IsReadLocked() || a.IsWriteLocked());
   a.ReadLock();
   b.WriteLock();
   EXPECT_TRUE(a.IsReadLocked());
   EXPECT_FALSE(a.IsWriteLocked());
   EXPECT_TRUE(b.IsWriteLocked());
   bool seenByOther = true;
   std::thread other([&] { seenByOther = a.IsReadLocked() || b.IsWriteLocked(); });
   Testing::Join(other, "the other thread");
   EXPECT_FALSE(seenByOther);
   // Released out of order.
   a.Unlock();
   EXPECT_FALSE(a.IsReadLocked());
   EXPECT_TRUE(b.IsWriteLocked());
   b.Unlock();
   EXPECT_FALSE(b.IsWriteLocked());
   EXPECT_DEATH(
      {
         a.ReadLock();
         a.ReadLock();
      },
      "Assert Failed: \"FindHeld\\(this\\) == nullptr\"");
}

TEST(ManagerInstanceTest, TheProcessHasOneManagerUntilInitIsCalledItRefusesWork) {
   Ref<AuthorizeManager> a, b;
   GetInstance(a);
   GetInstance(b);
   EXPECT_EQ(a.Get(), b.Get());
   int id = 0;
   EXPECT_THROW(a->CreateRole("r", PrivSet(), id), NotInitializedException);
}

}  // namespace
}  // namespace Pelmora::Authorize
