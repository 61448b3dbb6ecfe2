#include <gtest/gtest.h>

#include "pelmora/authorize/exceptions.h"
#include "pelmora/authorize/roles.h"

namespace Pelmora::Authorize {
namespace {

PrivSet Bits(std::initializer_list<unsigned> indexes) {
   PrivSet set;
   for (unsigned i : indexes) set.Set(i);
   return set;
}

TEST(RolesTest, SystemRolesAreCumulativeAndAdminHasEveryKnownPrivilege) {
   Roles roles;
   roles.SetupDefaultRoles(Bits({0, 1, 2, 7}));
   RoleResult all;
   roles.GetAll(all);
   ASSERT_EQ(5u, all.size());
   EXPECT_EQ(kRoleNoAccess, all[0]->GetId());
   EXPECT_EQ("NoAccess", all[0]->GetName());
   EXPECT_TRUE(all[0]->GetPrivileges().IsEmpty());
   EXPECT_EQ(Bits({0}), roles.Find(kRoleAnonymous)->GetPrivileges());
   EXPECT_EQ(Bits({0, 1}), roles.Find(kRoleView)->GetPrivileges());
   EXPECT_EQ(Bits({0, 1, 2}), roles.Find(kRoleReadOnly)->GetPrivileges());
   EXPECT_EQ(Bits({0, 1, 2, 7}), roles.Find(kRoleAdmin)->GetPrivileges());
   EXPECT_EQ("Anonymous", roles.Find(kRoleAnonymous)->GetName());
   EXPECT_EQ("View", roles.Find(kRoleView)->GetName());
   EXPECT_EQ("ReadOnly", roles.Find(kRoleReadOnly)->GetName());
   EXPECT_EQ(roles.Find(kRoleAdmin), roles.FindByName("Admin"));
   EXPECT_TRUE(roles.Find(kRoleAdmin)->IsSystem());
}

TEST(RolesTest, NewIdsFillTheFirstGapAmongPositiveIds) {
   Roles roles;
   roles.SetupDefaultRoles(PrivSet());
   EXPECT_EQ(1, roles.NextFreeId());
   roles.Add(new Role(1, "a", PrivSet()));
   roles.Add(new Role(2, "b", PrivSet()));
   roles.Add(new Role(4, "c", PrivSet()));
   EXPECT_EQ(3, roles.NextFreeId());
   roles.Add(new Role(3, "d", PrivSet()));
   EXPECT_EQ(5, roles.NextFreeId());
   EXPECT_THROW(roles.Add(new Role(3, "e", PrivSet())), AuthAlreadyExistsException);
   roles.Remove(1);
   EXPECT_EQ(1, roles.NextFreeId());
}

TEST(RolesTest, ClearingAPrivilegeTakesItFromEveryRole) {
   Roles roles;
   roles.SetupDefaultRoles(Bits({0, 1, 2, 9}));
   roles.Add(new Role(1, "ops", Bits({1, 9})));
   roles.ClearPrivilege(9);
   EXPECT_EQ(Bits({1}), roles.Find(1)->GetPrivileges());
   EXPECT_EQ(Bits({0, 1, 2}), roles.Find(kRoleAdmin)->GetPrivileges());
}

TEST(EntityAccessTest, IsTheUnionOfItsRolesAndTheSharedInstancesHoldTheirRoles) {
   Ref<Role> a(new Role(1, "a", Bits({3, 4})));
   Ref<Role> b(new Role(2, "b", Bits({4, 8})));
   EntityAccess access({a, b});
   EXPECT_EQ(Bits({3, 4, 8}), access.GetPrivileges());
   EXPECT_EQ((std::vector<int>{1, 2}), access.GetRoleIds());

   EntityAccess* none = Roles::GetNoAccessEntityAccess();
   EXPECT_TRUE(none->IsEmpty());
   EXPECT_TRUE(none->GetPrivileges().IsEmpty());
   EntityAccess* view = Roles::GetViewEntityAccess();
   EXPECT_EQ(Bits({kPrivilegeIndexAnonymous, kPrivilegeIndexView}), view->GetPrivileges());
   EXPECT_EQ(std::vector<int>{kRoleView}, view->GetRoleIds());
}

}  // namespace
}  // namespace Pelmora::Authorize
