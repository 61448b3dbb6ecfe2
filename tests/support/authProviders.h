#pragma once
// In-memory providers for authorisation tests: a user directory whose users, groups and
// outages the test sets, and a store that keeps committed writes only and fails on
// request. Both are thread-safe.

#include <map>
#include <ostream>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "pelmora/authorize/acl.h"
#include "pelmora/authorize/exceptions.h"
#include "pelmora/authorize/providers.h"
#include "pelmora/service/logger.h"
#include "tests/support/pieceWriter.h"

namespace Pelmora::Authorize {

// Readable failures.
inline void PrintTo(const ACEData& ace, std::ostream* out) {
   *out << "{" << ace.entityId << ", " << ace.principal << (ace.isGroup ? " (group)" : "") << ", role " << ace.roleId
        << (ace.propagate ? ", propagates}" : "}");
}

}  // namespace Pelmora::Authorize

namespace Pelmora::TestSupport {

using namespace Pelmora::Authorize;

class FakeUser : public virtual UserInfo, public ObjectImpl {
public:
   explicit FakeUser(const std::string& name) : _name(name) {}
   const std::string& GetName() const override { return _name; }

private:
   const std::string _name;
};

class FakeDirectory;

class FakeToken : public virtual AuthTokenHelper, public ObjectImpl {
public:
   FakeToken(UserInfo* user, UserDirectory* directory) : _user(user), _directory(directory) {}
   UserInfo* GetUserInfo() const override { return _user.Get(); }
   UserDirectory* GetUserDirectory() const override { return _directory.Get(); }

private:
   Ref<UserInfo> _user;
   Ref<UserDirectory> _directory;
};

class FakeDirectory : public virtual UserDirectory, public ObjectImpl {
public:
   void AddUser(const std::string& name, const std::string& identity = std::string()) {
      std::lock_guard<std::mutex> lock(_mutex);
      _users[name] = identity.empty() ? name : identity;
   }
   void RemoveUser(const std::string& name) {
      std::lock_guard<std::mutex> lock(_mutex);
      _users.erase(name);
   }
   void AddMember(const std::string& group, const std::string& user) {
      std::lock_guard<std::mutex> lock(_mutex);
      _groups[group].insert(user);
   }
   void AddGroup(const std::string& group) {
      std::lock_guard<std::mutex> lock(_mutex);
      _groups[group];
   }
   // Questions about `name` (user or group) cannot be answered while it is down.
   void SetUnresolved(const std::string& name, bool down) {
      std::lock_guard<std::mutex> lock(_mutex);
      if (down) {
         _down.insert(name);
      } else {
         _down.erase(name);
      }
   }

   void FindUser(const std::string& name, Ref<UserInfo>& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_down.count(name)) throw AuthUserUnresolvedException(name, false, "directory down");
      if (!_users.count(name)) throw AuthUserNotFoundException(name, false);
      out = new FakeUser(name);
   }
   UserValidationResult ValidatePrincipal(const std::string& name, bool isGroup) override {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_down.count(name)) return USER_UNRESOLVED;
      return (isGroup ? _groups.count(name) : _users.count(name)) ? USER_VALID : USER_NOT_FOUND;
   }
   bool IsUserEqual(const std::string& principal, UserInfo* user) override {
      std::lock_guard<std::mutex> lock(_mutex);
      auto a = _users.find(principal);
      auto b = _users.find(user->GetName());
      return a != _users.end() && b != _users.end() && a->second == b->second;
   }
   bool IsGroupMember(UserInfo* user, const std::string& group, AuthTokenHelper*) override {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_down.count(group)) throw AuthUserUnresolvedException(group, true, "directory down");
      auto it = _groups.find(group);
      return it != _groups.end() && it->second.count(user->GetName());
   }
   void CreateAuthToken(const std::string& user, Ref<AuthTokenHelper>& out) override {
      Ref<UserInfo> info;
      FindUser(user, info);
      out = new FakeToken(info.Get(), this);
   }

private:
   std::mutex _mutex;
   std::map<std::string, std::string> _users;  // name -> identity
   std::map<std::string, std::set<std::string>> _groups;
   std::set<std::string> _down;
};

class MemoryStorage : public virtual StorageProvider, public ObjectImpl {
public:
   struct State {
      std::map<std::string, PrivilegeDef> privileges;
      std::map<int, RoleData> roles;
      std::vector<ACEData> aces;
   };

   class Tx : public virtual AuthTransaction, public ObjectImpl {
   public:
      Tx(MemoryStorage* owner, State state) : owner(owner), state(std::move(state)) {}
      void Commit() override { owner->Finish(this); }
      void Rollback() override { done = true; }
      Ref<MemoryStorage> owner;
      State state;
      bool done = false;
   };

   // The next `count` transactions fail when committed.
   void FailCommits(int count) {
      std::lock_guard<std::mutex> lock(_mutex);
      _failCommits = count;
   }
   State Snapshot() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _state;
   }
   void Seed(const State& state) {
      std::lock_guard<std::mutex> lock(_mutex);
      _state = state;
   }
   int Commits() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _commits;
   }

   void LoadPrivileges(std::vector<PrivilegeDef>& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      out.clear();
      for (const auto& [id, def] : _state.privileges) out.push_back(def);
   }
   void LoadRoles(std::vector<RoleData>& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      out.clear();
      for (const auto& [id, role] : _state.roles) out.push_back(role);
   }
   void LoadACEs(std::vector<ACEData>& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      out = _state.aces;
   }
   void BeginTransaction(Ref<AuthTransaction>& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      out = new Tx(this, _state);
   }
   void StorePrivilege(AuthTransaction* tx, const PrivilegeDef& def) override { Of(tx).privileges[def.id] = def; }
   void RemovePrivilege(AuthTransaction* tx, const std::string& id) override { Of(tx).privileges.erase(id); }
   void StoreRole(AuthTransaction* tx, const RoleData& role) override { Of(tx).roles[role.id] = role; }
   void RemoveRole(AuthTransaction* tx, int id) override { Of(tx).roles.erase(id); }
   void StoreACE(AuthTransaction* tx, const ACEData& ace) override {
      auto& aces = Of(tx).aces;
      for (ACEData& existing : aces) {
         if (existing.entityId == ace.entityId && existing.principal == ace.principal &&
             existing.isGroup == ace.isGroup) {
            existing = ace;
            return;
         }
      }
      aces.push_back(ace);
   }
   void RemoveACE(AuthTransaction* tx, const std::string& entityId, const std::string& principal,
                  bool isGroup) override {
      std::erase_if(Of(tx).aces, [&](const ACEData& ace) {
         return ace.entityId == entityId && ace.principal == principal && ace.isGroup == isGroup;
      });
   }

private:
   State& Of(AuthTransaction* tx) { return dynamic_cast<Tx*>(tx)->state; }
   void Finish(Tx* tx) {
      std::lock_guard<std::mutex> lock(_mutex);
      tx->done = true;
      if (_failCommits > 0) {
         --_failCommits;
         throw AuthStorageException("disk full");
      }
      _state = tx->state;
      ++_commits;
   }

   std::mutex _mutex;
   State _state;
   int _failCommits = 0;
   int _commits = 0;
};

class TestSession : public virtual Session, public ObjectImpl {};

// A logger whose lines the test reads.
struct AuthLogLines {
   AuthLogLines() : target(new PieceWriter()) { Service::CreateLogger(target.Get(), "authorize", "trivia", nullptr, logger); }
   bool Has(const std::string& text) const { return target->Text().find(text) != std::string::npos; }
   std::string Text() const { return target->Text(); }
   Ref<PieceWriter> target;
   Ref<Service::Logger> logger;
};

}  // namespace Pelmora::TestSupport
