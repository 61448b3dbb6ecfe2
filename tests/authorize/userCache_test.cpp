#include <gtest/gtest.h>

#include "src/authorize/userCache.h"
#include "tests/support/authProviders.h"

namespace Pelmora::Authorize {
namespace {

using TestSupport::TestSession;

UserData::Cached Access() {
   Ref<EntityAccess> access(new EntityAccess());
   return UserData::Cached{access, access};
}

TEST(UserDataTest, EvictsTheOldestEntryWhenFull) {
   Ref<UserData> data(new UserData("alice", nullptr, 2));
   data->Store("a", Access());
   data->Store("b", Access());
   data->Store("a", Access());  // a replacement is not a new entry
   data->Store("c", Access());
   UserData::Cached found;
   EXPECT_FALSE(data->Find("a", found));
   EXPECT_TRUE(data->Find("b", found));
   EXPECT_TRUE(data->Find("c", found));
   data->SetMaxEntries(1);
   EXPECT_EQ(1u, data->Size());
   EXPECT_TRUE(data->Find("c", found));
   bool allowed = true;
   EXPECT_TRUE(data->TestCached("c", kPrivilegeIndexView, allowed));
   EXPECT_FALSE(allowed);
   EXPECT_FALSE(data->TestCached("b", kPrivilegeIndexView, allowed));
   data->SetMaxEntries(0);
   data->Store("d", Access());
   EXPECT_EQ(0u, data->Size());
}

TEST(UserCacheTest, SessionsOfOneUserShareItsDataUntilTheLastLeaves) {
   UserCache cache;
   Ref<Session> one(new TestSession()), two(new TestSession()), other(new TestSession());
   UserData* first = cache.Register(one.Get(), "alice", nullptr, false, 10);
   EXPECT_EQ(first, cache.Register(two.Get(), "alice", nullptr, true, 10));
   cache.Register(other.Get(), "bob", nullptr, false, 10);
   EXPECT_FALSE(cache.IsPrivileged(one.Get()));
   EXPECT_TRUE(cache.IsPrivileged(two.Get()));
   std::vector<std::string> users;
   cache.GetActiveUsers(users);
   EXPECT_EQ((std::vector<std::string>{"alice", "bob"}), users);
   EXPECT_TRUE(cache.Release(one.Get()));
   EXPECT_FALSE(cache.Release(one.Get()));
   EXPECT_EQ(first, cache.GetUserData(two.Get()));
   cache.Release(two.Get());
   EXPECT_EQ(nullptr, cache.GetUserData(two.Get()));
   cache.GetActiveUsers(users);
   EXPECT_EQ(std::vector<std::string>{"bob"}, users);
   // A session registered again moves to its new user.
   cache.Register(other.Get(), "carol", nullptr, false, 10);
   cache.GetActiveUsers(users);
   EXPECT_EQ(std::vector<std::string>{"carol"}, users);
}

}  // namespace
}  // namespace Pelmora::Authorize
