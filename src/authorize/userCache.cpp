#include "src/authorize/userCache.h"

#include <algorithm>

namespace Pelmora::Authorize {

bool UserData::Find(const std::string& entityId, Cached& out) {
   std::lock_guard<std::mutex> lock(_mutex);
   auto it = _entries.find(entityId);
   if (it == _entries.end()) return false;
   out = it->second;
   return true;
}

bool UserData::TestCached(const std::string& entityId, unsigned index, bool& allowed) {
   std::lock_guard<std::mutex> lock(_mutex);
   auto it = _entries.find(entityId);
   if (it == _entries.end()) return false;
   allowed = it->second.own->HasPrivilege(index);
   return true;
}

void UserData::Store(const std::string& entityId, const Cached& access) {
   std::lock_guard<std::mutex> lock(_mutex);
   if (_maxEntries == 0) return;
   auto it = _entries.find(entityId);
   if (it != _entries.end()) {
      it->second = access;
      return;
   }
   EvictTo(_maxEntries - 1);
   _entries.emplace(entityId, access);
   _order.push_back(entityId);
}

void UserData::EvictTo(size_t size) {
   while (_entries.size() > size && !_order.empty()) {
      _entries.erase(_order.front());
      _order.pop_front();
   }
}

void UserData::Clear() {
   std::lock_guard<std::mutex> lock(_mutex);
   _entries.clear();
   _order.clear();
}

void UserData::SetMaxEntries(unsigned maxEntries) {
   std::lock_guard<std::mutex> lock(_mutex);
   _maxEntries = maxEntries;
   EvictTo(maxEntries);
}

size_t UserData::Size() {
   std::lock_guard<std::mutex> lock(_mutex);
   return _entries.size();
}

UserData* UserCache::Register(Session* session, const std::string& user, AuthTokenHelper* token,
                              bool privileged, unsigned maxEntries) {
   Release(session);
   UserEntry& entry = _users[user];
   if (!entry.data) entry.data = new UserData(user, token, maxEntries);
   ++entry.sessions;
   _sessions[session] = SessionEntry{Ref<Session>(session), entry.data, privileged};
   return entry.data.Get();
}

bool UserCache::Release(Session* session) {
   auto it = _sessions.find(session);
   if (it == _sessions.end()) return false;
   const std::string user = it->second.data->GetUser();
   _sessions.erase(it);
   auto userIt = _users.find(user);
   if (userIt != _users.end() && --userIt->second.sessions == 0) _users.erase(userIt);
   return true;
}

UserData* UserCache::GetUserData(Session* session, bool* privileged) const {
   auto it = _sessions.find(session);
   if (it == _sessions.end()) return nullptr;
   if (privileged) *privileged = it->second.privileged;
   return it->second.data.Get();
}

bool UserCache::IsPrivileged(Session* session) const {
   auto it = _sessions.find(session);
   return it != _sessions.end() && it->second.privileged;
}

void UserCache::GetActiveUsers(std::vector<std::string>& out) const {
   out.clear();
   for (const auto& [user, entry] : _users) out.push_back(user);
   std::sort(out.begin(), out.end());
}

void UserCache::GetAllUserData(std::vector<Ref<UserData>>& out) const {
   out.clear();
   for (const auto& [user, entry] : _users) out.push_back(entry.data);
}

void UserCache::Clear() {
   _sessions.clear();
   _users.clear();
}

}  // namespace Pelmora::Authorize
