#pragma once
// Per-user caches of effective access. UserData is one user's: its token, its root-access
// flag and a bounded map from entity id to the access the user has there and the access
// the entity passes to its descendants; the oldest entry goes first when the map is full.
// UserData is thread-safe (checks fill it under the manager's shared lock). UserCache
// maps sessions to the UserData of their users; the manager's lock guards it.

#include <atomic>
#include <deque>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include "pelmora/authorize/providers.h"
#include "pelmora/authorize/roles.h"

namespace Pelmora::Authorize {

class UserData : public ObjectImpl {
public:
   struct Cached {
      Ref<EntityAccess> own;
      // Never null: what descendants without an applicable entry inherit.
      Ref<EntityAccess> propagated;
   };

   UserData(const std::string& user, AuthTokenHelper* token, unsigned maxEntries)
      : _user(user), _token(token), _maxEntries(maxEntries) {}

   const std::string& GetUser() const { return _user; }
   AuthTokenHelper* GetToken() const { return _token.Get(); }
   bool HasRootAccess() const { return _rootAccess.load(std::memory_order_acquire); }
   void SetRootAccess(bool root) { _rootAccess.store(root, std::memory_order_release); }

   bool Find(const std::string& entityId, Cached& out);
   // Whether the entity is cached; when it is, `allowed` says whether its own access has
   // privilege `index`. Takes no reference: the hot path of a check.
   bool TestCached(const std::string& entityId, unsigned index, bool& allowed);
   void Store(const std::string& entityId, const Cached& access);
   void Clear();
   // Shrinks the map at once when it holds more.
   void SetMaxEntries(unsigned maxEntries);
   size_t Size();

private:
   void EvictTo(size_t size);

   const std::string _user;
   const Ref<AuthTokenHelper> _token;
   std::atomic<bool> _rootAccess{false};
   std::mutex _mutex;
   unsigned _maxEntries;
   std::unordered_map<std::string, Cached> _entries;
   // Insertion order, for eviction.
   std::deque<std::string> _order;
};

class UserCache {
public:
   // The session's user shares the UserData of the user's other sessions; the first
   // session's token is the user's.
   UserData* Register(Session* session, const std::string& user, AuthTokenHelper* token, bool privileged,
                      unsigned maxEntries);
   // False for an unknown session.
   bool Release(Session* session);
   // Null for an unknown session; `privileged`, when given, receives the session's flag.
   UserData* GetUserData(Session* session, bool* privileged = nullptr) const;
   bool IsPrivileged(Session* session) const;
   // One name per user with a session, sorted.
   void GetActiveUsers(std::vector<std::string>& out) const;
   void GetAllUserData(std::vector<Ref<UserData>>& out) const;
   size_t SessionCount() const { return _sessions.size(); }
   void Clear();

private:
   struct SessionEntry {
      Ref<Session> session;
      Ref<UserData> data;
      bool privileged;
   };
   struct UserEntry {
      Ref<UserData> data;
      int sessions = 0;
   };
   std::unordered_map<Session*, SessionEntry> _sessions;
   std::unordered_map<std::string, UserEntry> _users;
};

}  // namespace Pelmora::Authorize
