#include <gtest/gtest.h>

#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/exceptions.h"
#include "src/authorize/privileges.h"

namespace Pelmora::Authorize {
namespace {

TEST(PrivSetDeathTest, AnIndexPastTheLastPanics) {
   PrivSet set;
   EXPECT_DEATH(set.Set(MAX_PRIVILEGES), "Assert Failed: \"index < MAX_PRIVILEGES\"");
   EXPECT_DEATH(set.Test(5000), "Assert Failed: \"index < MAX_PRIVILEGES\"");
}

TEST(PrivilegeDeathTest, AnIdOutsideItsGroupPanics) {
   EXPECT_DEATH(Privilege("Other.View", "System", 3), "Assert Failed: \"id.find\\(groupId\\) == 0\"");
   EXPECT_DEATH(Privilege("System.", "System", 3),
                "Assert Failed: \"id.length\\(\\) > groupId.length\\(\\) \\+ 1\"");
}

TEST(PrivilegeTableTest, HoldsTheBuiltInPrivilegesFirst) {
   PrivilegeTable table;
   PrivilegeResult all;
   table.GetAll(all);
   ASSERT_EQ(3u, all.size());
   EXPECT_EQ("System.Anonymous", all[0]->GetId());
   EXPECT_EQ("System.View", all[1]->GetId());
   EXPECT_EQ("System.Read", all[2]->GetId());
   EXPECT_EQ(kPrivilegeIndexRead, table.Find("System.Read")->GetIndex());
   EXPECT_EQ("Read", table.Find("System.Read")->GetName());
   EXPECT_EQ(3u, table.Known().Count());
}

TEST(PrivilegeTableTest, AddsAtTheLowestFreeIndexAndReusesRemovedOnes) {
   PrivilegeTable table;
   EXPECT_EQ(3u, table.Add({"VM.PowerOn", "VM"})->GetIndex());
   EXPECT_EQ(4u, table.Add({"VM.PowerOff", "VM"})->GetIndex());
   // Adding a known privilege again keeps it.
   EXPECT_EQ(3u, table.Add({"VM.PowerOn", "VM"})->GetIndex());
   table.Remove("VM.PowerOn");
   EXPECT_EQ(nullptr, table.Find("VM.PowerOn"));
   EXPECT_EQ(3u, table.Add({"Host.Reboot", "Host"})->GetIndex());
   std::vector<std::string> names;
   PrivSet set;
   set.Set(3);
   set.Set(kPrivilegeIndexView);
   table.Names(set, names);
   EXPECT_EQ((std::vector<std::string>{"System.View", "Host.Reboot"}), names);
}

TEST(PrivilegeTableTest, RefusesBadIdsSystemRemovalsAndAFullTable) {
   PrivilegeTable table;
   EXPECT_THROW(table.Add({"VM", "VM"}), InvalidArgumentException);
   EXPECT_THROW(table.Add({"VMX.Power", "VM"}), InvalidArgumentException);
   EXPECT_THROW(table.Add({"System.View", "Other"}), AuthAlreadyExistsException);
   EXPECT_THROW(table.Remove("System.View"), AuthSystemPrivilegeException);
   EXPECT_THROW(table.Remove("VM.Nothing"), AuthPrivilegeNotFoundException);
   for (unsigned i = 3; i < MAX_PRIVILEGES; ++i) table.Add({"P.p" + std::to_string(i), "P"});
   EXPECT_THROW(table.Add({"P.onetoomany", "P"}), FullException);
}

}  // namespace
}  // namespace Pelmora::Authorize
