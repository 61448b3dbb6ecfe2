#include <gtest/gtest.h>

#include <tuple>

#include "src/authorize/authLog.h"
#include "tests/support/authProviders.h"

namespace Pelmora::Authorize {
namespace {

using TestSupport::AuthLogLines;
using TestSupport::FakeDirectory;

class AclTest : public ::testing::Test {
protected:
   void SetUp() override {
      roles.SetupDefaultRoles(PrivSet());
      directory = new FakeDirectory();
      for (const char* user : {"alice", "bob", "carol"}) directory->AddUser(user);
      directory->AddUser("alice2", "alice");  // another name of the same account
      directory->AddMember("ops", "alice");
      directory->AddMember("ops", "bob");
      directory->AddMember("admins", "alice");
      directory->CreateAuthToken("alice", alice);
      SetAuthLog(log.logger.Get());
   }
   void TearDown() override { SetAuthLog(nullptr); }

   void Add(const std::string& name, bool isGroup, int roleId, bool propagate) {
      Ref<ACE> ace;
      ACE::CreateACE(roleId, name, isGroup, roles.Find(roleId), propagate, ace);
      acl.AddACE(ace.Get());
   }
   // Own and propagated role ids for alice; -99 marks "nothing".
   std::pair<std::vector<int>, std::vector<int>> Alice() {
      Ref<EntityAccess> own, propagated;
      acl.GetAccessForUser("alice", alice.Get(), own, propagated);
      return {own ? own->GetRoleIds() : std::vector<int>{-99}, propagated ? propagated->GetRoleIds() : std::vector<int>{-99}};
   }

   AuthLogLines log;
   Roles roles;
   Ref<FakeDirectory> directory;
   Ref<AuthTokenHelper> alice;
   ACL acl;
};

// The walk in entry order for alice (in ops and admins): her own entry ends it, and only
// propagating entries reach the propagated access.
TEST_F(AclTest, TheWalkStopsAtTheUserEntryAndPropagatesSeparately) {
   using Entry = std::tuple<const char*, bool, int, bool>;  // name, group, role, propagate
   const struct {
      const char* why;
      std::vector<Entry> entries;
      std::vector<int> own, propagated;
   } cases[] = {
       {"a user entry outranks later group entries",
        {{"alice", false, kRoleReadOnly, false}, {"admins", true, kRoleAdmin, false}}, {kRoleReadOnly}, {-99}},
       {"group entries before the user entry add up",
        {{"ops", true, kRoleView, true}, {"admins", true, kRoleAnonymous, false},
         {"alice", false, kRoleReadOnly, false}, {"bob", false, kRoleAdmin, true}},
        {kRoleView, kRoleAnonymous, kRoleReadOnly}, {kRoleView}},
       {"a propagating user entry ends the walk",
        {{"alice", false, kRoleView, true}, {"ops", true, kRoleAdmin, true}}, {kRoleView}, {kRoleView}},
       {"a non-propagating user entry still lets groups propagate",
        {{"alice", false, kRoleView, false}, {"ops", true, kRoleAdmin, true}}, {kRoleView}, {kRoleAdmin}},
   };
   for (const auto& c : cases) {
      SCOPED_TRACE(c.why);
      acl = ACL();
      for (const auto& [name, isGroup, roleId, propagate] : c.entries) Add(name, isGroup, roleId, propagate);
      EXPECT_EQ(std::make_pair(c.own, c.propagated), Alice());
   }
}

TEST_F(AclTest, UsersMatchByIdentityAndNoEntryMeansNoAnswer) {
   Add("alice2", false, kRoleAdmin, false);
   EXPECT_EQ(std::vector<int>{kRoleAdmin}, Alice().first);
   Ref<AuthTokenHelper> carol;
   directory->CreateAuthToken("carol", carol);
   Ref<EntityAccess> own, propagated;
   EXPECT_FALSE(acl.GetAccessForUser("carol", carol.Get(), own, propagated));
   EXPECT_TRUE(own.IsNull());
   EXPECT_TRUE(propagated.IsNull());
   // Without a token a user entry matches by name only.
   acl = ACL();
   Add("alice", false, kRoleView, false);
   EXPECT_TRUE(acl.GetAccessForUser("alice", nullptr, own, propagated));
   EXPECT_FALSE(acl.GetAccessForUser("alice2", nullptr, own, propagated));
}

TEST_F(AclTest, GroupResolutionIsLoggedAndAnUndecidableGroupDoesNotApply) {
   Add("ops", true, kRoleView, false);
   Add("admins", true, kRoleAdmin, false);
   directory->SetUnresolved("admins", true);
   std::vector<std::string> resolved;
   Ref<EntityAccess> own, propagated;
   EXPECT_TRUE(acl.GetAccessForUser("alice", alice.Get(), own, propagated, &resolved));
   EXPECT_EQ(std::vector<int>{kRoleView}, own->GetRoleIds());
   EXPECT_EQ(std::vector<std::string>{"ops"}, resolved);
   EXPECT_TRUE(log.Has("[ACL] Resolved group ops"));
   EXPECT_TRUE(log.Has("[ACL] Failed to determine group membership for admins"));
}

TEST_F(AclTest, EntriesAreUniquePerPrincipalAndKind) {
   Add("ops", true, kRoleView, false);
   Add("ops", false, kRoleView, false);
   EXPECT_THROW(Add("ops", true, kRoleAdmin, false), AuthAlreadyExistsException);
   acl.ChangeACE("ops", true, roles.Find(kRoleAdmin), true);
   EXPECT_EQ(kRoleAdmin, acl.FindEntry("ops", true)->GetRole()->GetId());
   EXPECT_TRUE(acl.FindEntry("ops", true)->GetPropagate());
   EXPECT_EQ(kRoleView, acl.FindEntry("ops", false)->GetRole()->GetId());
   std::vector<Ref<ACE>> found;
   acl.FindEntries(kRoleAdmin, found);
   ASSERT_EQ(1u, found.size());
   EXPECT_FALSE(found[0]->IsUser());
   EXPECT_TRUE(acl.DeleteACE("ops", true));
   EXPECT_FALSE(acl.DeleteACE("ops", true));
   EXPECT_THROW(acl.ChangeACE("ops", true, roles.Find(kRoleAdmin), true), AuthPermissionNotFoundException);
}

TEST_F(AclTest, CreateACERefusesAMismatchedRoleOrAnEmptyName) {
   Ref<ACE> ace;
   EXPECT_THROW(ACE::CreateACE(kRoleView, "x", false, roles.Find(kRoleAdmin), false, ace), AuthRoleNotFoundException);
   EXPECT_THROW(ACE::CreateACE(kRoleView, "x", false, nullptr, false, ace), AuthRoleNotFoundException);
   EXPECT_THROW(ACE::CreateACE(kRoleView, "", true, roles.Find(kRoleView), false, ace), AuthUserNotFoundException);
   UserValidationResult unresolved = USER_UNRESOLVED;
   ACE::CreateACE(kRoleView, "g", true, roles.Find(kRoleView), true, ace, &unresolved);
   EXPECT_FALSE(ace->IsUser());
   EXPECT_EQ(USER_UNRESOLVED, ace->GetValidation());
   EXPECT_EQ((ACEData{"e1", "g", true, kRoleView, true}), ace->ToData("e1"));
}

TEST_F(AclTest, AGroupEntryWithoutATokenPanics) {
   Add("ops", true, kRoleView, false);
   Ref<EntityAccess> own, propagated;
   EXPECT_DEATH(acl.GetAccessForUser("alice", nullptr, own, propagated), "Assert Failed: \"token != __null\"");
}

}  // namespace
}  // namespace Pelmora::Authorize
