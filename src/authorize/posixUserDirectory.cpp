#include "pelmora/authorize/posixUserDirectory.h"

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <vector>

#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/exceptions.h"

namespace Pelmora::Authorize {

namespace {

// The lookups below retry with a larger buffer on ERANGE: group entries with many
// members outgrow any fixed size.
constexpr size_t kInitialBuffer = 1024;
constexpr size_t kMaxBuffer = 1 << 20;

// 1 found, 0 absent; AuthUserUnresolvedException when the source failed.
int LookupUser(const std::string& name, struct passwd& entry, std::vector<char>& buffer) {
   for (buffer.resize(kInitialBuffer);; buffer.resize(buffer.size() * 2)) {
      struct passwd* result = nullptr;
      int error = getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &result);
      if (error == ERANGE && buffer.size() < kMaxBuffer) continue;
      if (result) return 1;
      // ENOENT, ESRCH, EBADF and EPERM are how various sources say "no such name".
      if (error == 0 || error == ENOENT || error == ESRCH || error == EBADF || error == EPERM) return 0;
      throw AuthUserUnresolvedException(name, false, System::GetErrorMessage(error));
   }
}

int LookupGroup(const std::string& name, gid_t& gid) {
   std::vector<char> buffer(kInitialBuffer);
   for (;; buffer.resize(buffer.size() * 2)) {
      struct group entry;
      struct group* result = nullptr;
      int error = getgrnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &result);
      if (error == ERANGE && buffer.size() < kMaxBuffer) continue;
      if (result) {
         gid = result->gr_gid;
         return 1;
      }
      if (error == 0 || error == ENOENT || error == ESRCH || error == EBADF || error == EPERM) return 0;
      throw AuthUserUnresolvedException(name, true, System::GetErrorMessage(error));
   }
}

class PosixUser : public virtual PosixUserInfo, public ObjectImpl {
public:
   PosixUser(const std::string& name, uid_t uid, gid_t gid) : _name(name), _uid(uid), _gid(gid) {}
   const std::string& GetName() const override { return _name; }
   unsigned GetUid() const override { return _uid; }
   unsigned GetGid() const override { return _gid; }

private:
   const std::string _name;
   const uid_t _uid;
   const gid_t _gid;
};

class PosixToken : public virtual AuthTokenHelper, public ObjectImpl {
public:
   PosixToken(PosixUser* user, UserDirectory* directory, std::vector<gid_t> groups)
      : _user(user), _directory(directory), _groups(std::move(groups)) {}
   UserInfo* GetUserInfo() const override { return _user.Get(); }
   UserDirectory* GetUserDirectory() const override { return _directory.Get(); }
   const std::vector<gid_t>& GetGroups() const { return _groups; }

private:
   const Ref<PosixUser> _user;
   const Ref<UserDirectory> _directory;
   // Sorted.
   const std::vector<gid_t> _groups;
};

class PosixUserDirectoryImpl : public virtual UserDirectory, public ObjectImpl {
public:
   void FindUser(const std::string& name, Ref<UserInfo>& out) override {
      Ref<PosixUser> user;
      Find(name, user);
      out = user.Get();
   }

   UserValidationResult ValidatePrincipal(const std::string& name, bool isGroup) override {
      try {
         if (isGroup) {
            gid_t gid;
            return LookupGroup(name, gid) ? USER_VALID : USER_NOT_FOUND;
         }
         struct passwd entry;
         std::vector<char> buffer;
         return LookupUser(name, entry, buffer) ? USER_VALID : USER_NOT_FOUND;
      } catch (const AuthUserUnresolvedException&) {
         return USER_UNRESOLVED;
      }
   }

   bool IsUserEqual(const std::string& principal, UserInfo* user) override {
      if (!user) return false;
      if (user->GetName() == principal) return true;
      auto* posix = dynamic_cast<PosixUserInfo*>(user);
      if (!posix) return false;
      struct passwd entry;
      std::vector<char> buffer;
      return LookupUser(principal, entry, buffer) && entry.pw_uid == posix->GetUid();
   }

   bool IsGroupMember(UserInfo* user, const std::string& group, AuthTokenHelper* token) override {
      gid_t gid;
      if (!LookupGroup(group, gid)) return false;
      if (auto* posixToken = dynamic_cast<PosixToken*>(token); posixToken && posixToken->GetUserInfo() == user) {
         return std::binary_search(posixToken->GetGroups().begin(), posixToken->GetGroups().end(), gid);
      }
      auto* posix = dynamic_cast<PosixUserInfo*>(user);
      if (!posix) return false;
      std::vector<gid_t> groups;
      Groups(user->GetName(), posix->GetGid(), groups);
      return std::binary_search(groups.begin(), groups.end(), gid);
   }

   void CreateAuthToken(const std::string& name, Ref<AuthTokenHelper>& out) override {
      Ref<PosixUser> user;
      Find(name, user);
      std::vector<gid_t> groups;
      Groups(name, user->GetGid(), groups);
      out = new PosixToken(user.Get(), this, std::move(groups));
   }

private:
   void Find(const std::string& name, Ref<PosixUser>& out) {
      struct passwd entry;
      std::vector<char> buffer;
      if (!LookupUser(name, entry, buffer)) throw AuthUserNotFoundException(name, false);
      out = new PosixUser(name, entry.pw_uid, entry.pw_gid);
   }

   // The primary and supplementary group ids of `name`, sorted.
   static void Groups(const std::string& name, gid_t primary, std::vector<gid_t>& out) {
      int count = 32;
      for (;;) {
         out.resize(count);
         int wanted = count;
         if (getgrouplist(name.c_str(), primary, out.data(), &wanted) >= 0) {
            out.resize(wanted);
            break;
         }
         // -1 with `wanted` set to the number needed; grow at least by doubling.
         if (count >= 65536) throw AuthUserUnresolvedException(name, false, "too many groups");
         count = std::max(wanted, count * 2);
      }
      std::sort(out.begin(), out.end());
   }
};

}  // namespace

void CreatePosixUserDirectory(Ref<UserDirectory>& out) { out = new PosixUserDirectoryImpl(); }

}  // namespace Pelmora::Authorize
