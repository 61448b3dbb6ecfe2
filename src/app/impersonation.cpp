// Dropping root for good: to the configured user and group, with the user's groups.

#include <grp.h>
#include <pwd.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

namespace {

std::vector<char> LookupBuffer(int which) {
   long size = sysconf(which);
   return std::vector<char>(size > 0 ? static_cast<size_t>(size) : 16384);
}

[[noreturn]] void ThrowSystem(int error, const std::string& what) {
   throw SystemException(error, what + ": " + System::GetErrorMessage(error));
}

}  // namespace

void Impersonate(const std::string& user, const std::string& group) {
   if (user.empty()) throw InvalidArgumentException("no user to impersonate");
   std::vector<char> buffer = LookupBuffer(_SC_GETPW_R_SIZE_MAX);
   passwd entry, *found = nullptr;
   int error = getpwnam_r(user.c_str(), &entry, buffer.data(), buffer.size(), &found);
   if (error != 0) ThrowSystem(error, "getpwnam_r " + user);
   if (!found) throw NotFoundException("No such user: " + user);
   uid_t uid = entry.pw_uid;
   gid_t gid = entry.pw_gid;
   if (!group.empty()) {
      std::vector<char> groupBuffer = LookupBuffer(_SC_GETGR_R_SIZE_MAX);
      struct group groupEntry, *groupFound = nullptr;
      error = getgrnam_r(group.c_str(), &groupEntry, groupBuffer.data(), groupBuffer.size(),
                         &groupFound);
      if (error != 0) ThrowSystem(error, "getgrnam_r " + group);
      if (!groupFound) throw NotFoundException("No such group: " + group);
      gid = groupEntry.gr_gid;
   }
   if (uid == 0) throw InvalidStateException("Refusing to impersonate root: " + user);
   // Groups first: once the user is dropped, they can no longer be changed.
   if (geteuid() == 0 && initgroups(user.c_str(), gid) != 0) ThrowSystem(errno, "initgroups");
   if (setresgid(gid, gid, gid) != 0) ThrowSystem(errno, "setresgid");
   if (setresuid(uid, uid, uid) != 0) ThrowSystem(errno, "setresuid");
   // A change of user makes the process undumpable; core files are still wanted.
   prctl(PR_SET_DUMPABLE, 1, 0, 0, 0);
   if (geteuid() == 0 || getuid() == 0 || setuid(0) == 0) {
      throw InvalidStateException("Still root after impersonating " + user);
   }
}

}  // namespace Pelmora::Service
