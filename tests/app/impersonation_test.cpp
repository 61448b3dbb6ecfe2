// Impersonation drops root for good, or refuses to go on.

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/daemon.h"
#include "tests/support/appProcess.h"

namespace Pelmora::Service {
namespace {

TEST(ImpersonationDeathTest, DropsToTheUserAndGroupForGood) {
   passwd* nobody = getpwnam("nobody");
   if (geteuid() != 0 || !nobody) GTEST_SKIP() << "needs root and the user nobody";
   uid_t uid = nobody->pw_uid;
   gid_t gid = nobody->pw_gid;
   EXPECT_EXIT(([&] {
                  Impersonate("nobody", "");
                  APP_CHILD_CHECK(getuid() == uid && geteuid() == uid);
                  APP_CHILD_CHECK(getgid() == gid && getegid() == gid);
                  APP_CHILD_CHECK(setuid(0) != 0);
                  _exit(0);
               })(),
               testing::ExitedWithCode(0), "");
}

TEST(ImpersonationTest, RefusesUnknownNamesRootAndNothing) {
   EXPECT_THROW(Impersonate("", ""), InvalidArgumentException);
   EXPECT_THROW(Impersonate("pelmora-no-such-user", ""), NotFoundException);
   EXPECT_THROW(Impersonate("root", ""), InvalidStateException);
   if (getpwnam("nobody")) {
      EXPECT_THROW(Impersonate("nobody", "pelmora-no-such-group"), NotFoundException);
   }
   EXPECT_EQ(geteuid(), getuid()) << "a refused impersonation changed the process";
}

}  // namespace
}  // namespace Pelmora::Service
