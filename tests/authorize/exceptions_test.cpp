#include <gtest/gtest.h>

#include <memory>

#include "pelmora/authorize/exceptions.h"

namespace Pelmora::Authorize {
namespace {

TEST(AuthExceptionTest, MessagesNameThePrincipalAndItsCause) {
   EXPECT_STREQ("Authorize Exception", AuthException().what());
   EXPECT_STREQ("Authorize Exception", AuthSystemRoleException().what());
   EXPECT_STREQ("User bob", AuthUserNotFoundException("bob", false).what());
   EXPECT_STREQ("Group ops, cause: LDAP down", AuthUserUnresolvedException("ops", true, "LDAP down").what());
   EXPECT_STREQ("Group ops", AuthPermissionNotFoundException("ops", "vm-1", true).what());
}

TEST(AuthExceptionTest, CloneAndThrowKeepTheDynamicType) {
   std::unique_ptr<Exception> kept(AuthEntityNotFoundException("vm-9").Clone());
   try {
      kept->Throw();
   } catch (const AuthEntityNotFoundException& e) {
      EXPECT_EQ("vm-9", e.GetEntityId());
      return;
   } catch (...) {
   }
   FAIL() << "rethrown with another type";
}

}  // namespace
}  // namespace Pelmora::Authorize
