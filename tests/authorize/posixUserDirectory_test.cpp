#include <gtest/gtest.h>

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <vector>

#include "pelmora/authorize/entityTree.h"
#include "pelmora/authorize/posixUserDirectory.h"
#include "src/authorize/authorizeManager.h"
#include "tests/support/authProviders.h"

namespace Pelmora::Authorize {
namespace {

std::string UserName(uid_t uid) {
   struct passwd entry;
   struct passwd* result = nullptr;
   std::vector<char> buffer(16384);
   getpwuid_r(uid, &entry, buffer.data(), buffer.size(), &result);
   return result ? result->pw_name : std::string();
}

std::string GroupName(gid_t gid) {
   struct group entry;
   struct group* result = nullptr;
   std::vector<char> buffer(65536);
   getgrgid_r(gid, &entry, buffer.data(), buffer.size(), &result);
   return result ? result->gr_name : std::string();
}

// A name no system database holds.
const char* const kNobody = "pelmora-no-such-principal";

class PosixDirectoryTest : public ::testing::Test {
protected:
   void SetUp() override {
      CreatePosixUserDirectory(directory);
      self = UserName(geteuid());
      ASSERT_FALSE(self.empty()) << "the test's own user is not in the user database";
   }
   Ref<UserDirectory> directory;
   std::string self;
};

TEST_F(PosixDirectoryTest, FindsRootAndTheTestsOwnUserByUid) {
   Ref<UserInfo> root;
   directory->FindUser("root", root);
   auto* posix = dynamic_cast<PosixUserInfo*>(root.Get());
   ASSERT_NE(nullptr, posix);
   EXPECT_EQ(0u, posix->GetUid());
   EXPECT_EQ("root", root->GetName());
   EXPECT_TRUE(directory->IsUserEqual("root", root.Get()));

   Ref<UserInfo> me;
   directory->FindUser(self, me);
   EXPECT_EQ(geteuid(), dynamic_cast<PosixUserInfo*>(me.Get())->GetUid());
   // Equality is by uid: root and the test's user are the same exactly when it runs as root.
   EXPECT_EQ(geteuid() == 0, directory->IsUserEqual("root", me.Get()));
   EXPECT_FALSE(directory->IsUserEqual(kNobody, me.Get()));
}

TEST_F(PosixDirectoryTest, UnknownPrincipalsAreNotFound) {
   Ref<UserInfo> user;
   EXPECT_THROW(directory->FindUser(kNobody, user), AuthUserNotFoundException);
   Ref<AuthTokenHelper> token;
   EXPECT_THROW(directory->CreateAuthToken(kNobody, token), AuthUserNotFoundException);
   EXPECT_EQ(USER_NOT_FOUND, directory->ValidatePrincipal(kNobody, false));
   EXPECT_EQ(USER_NOT_FOUND, directory->ValidatePrincipal(kNobody, true));
   EXPECT_EQ(USER_VALID, directory->ValidatePrincipal("root", false));
   EXPECT_EQ(USER_VALID, directory->ValidatePrincipal(GroupName(0), true));
}

TEST_F(PosixDirectoryTest, MembershipCoversThePrimaryAndSupplementaryGroups) {
   Ref<AuthTokenHelper> token;
   directory->CreateAuthToken(self, token);
   Ref<UserInfo> me;
   directory->FindUser(self, me);
   struct passwd entry;
   struct passwd* result = nullptr;
   std::vector<char> buffer(16384);
   ASSERT_EQ(0, getpwnam_r(self.c_str(), &entry, buffer.data(), buffer.size(), &result));
   std::vector<gid_t> groups{entry.pw_gid};
   int count = 64;
   std::vector<gid_t> listed(count);
   ASSERT_GE(getgrouplist(self.c_str(), entry.pw_gid, listed.data(), &count), 0);
   listed.resize(count);
   for (gid_t gid : listed) {
      std::string name = GroupName(gid);
      if (name.empty()) continue;
      // With the token's remembered groups and without a token.
      EXPECT_TRUE(directory->IsGroupMember(token->GetUserInfo(), name, token.Get())) << name;
      EXPECT_TRUE(directory->IsGroupMember(me.Get(), name, nullptr)) << name;
   }
   EXPECT_FALSE(directory->IsGroupMember(me.Get(), kNobody, token.Get()));
   // Some group the user is not in, when the database has one.
   for (gid_t gid = 1; gid < 200; ++gid) {
      std::string name = GroupName(gid);
      if (name.empty() || std::find(listed.begin(), listed.end(), gid) != listed.end()) continue;
      EXPECT_FALSE(directory->IsGroupMember(token->GetUserInfo(), name, token.Get())) << name;
      break;
   }
}

TEST_F(PosixDirectoryTest, AGroupEntryOfTheTestsPrimaryGroupGrantsItsRole) {
   Ref<EntityTree> tree;
   CreateEntityTree("root", tree);
   tree->AddEntity("vm", "root");
   Ref<TestSupport::MemoryStorage> storage(new TestSupport::MemoryStorage());
   TestSupport::AuthLogLines log;
   Ref<AuthorizeManager> manager;
   CreateAuthorizeManager(manager);
   manager->Init(directory.Get(), storage.Get(), tree.Get(), log.logger.Get());
   Ref<AuthEntity> vm;
   tree->FindEntity("vm", vm);
   manager->CreateACE(vm.Get(), GroupName(getegid()), true, kRoleReadOnly, false);
   Ref<Session> session(new TestSupport::TestSession());
   manager->AddConnection(session.Get(), self, nullptr, false);
   EXPECT_TRUE(manager->HasEntityPrivilege(session.Get(), vm.Get(), kPrivilegeRead));
   EXPECT_TRUE(log.Has("[ACL] Resolved group " + GroupName(getegid())));
   EXPECT_THROW(manager->CreateACE(vm.Get(), kNobody, true, kRoleReadOnly, false), AuthUserNotFoundException);
   manager->Shutdown();
}

}  // namespace
}  // namespace Pelmora::Authorize
