#pragma once
// The manager's implementation, visible to this layer's tests.

#include <atomic>
#include <functional>
#include <string>
#include <unordered_map>
#include <vector>

#include "pelmora/authorize/authorizeManager.h"
#include "pelmora/perfCounter/registry.h"
#include <pthread.h>

#include "pelmora/object/threadAnnotations.h"
#include "src/authorize/privileges.h"
#include "src/authorize/userCache.h"

namespace Pelmora::Authorize {

// The counter names the manager registers in the process's counter registry.
constexpr const char* kCounterChecks = "/Authorize/Checks";
constexpr const char* kCounterCacheHits = "/Authorize/CacheHits";
constexpr const char* kCounterCacheMisses = "/Authorize/CacheMisses";
constexpr const char* kCounterSessions = "/Authorize/Sessions";

// Check statistics, counted without the manager's lock. Every check is a hit or a
// miss, so the number of checks is their sum: one increment per check.
struct AuthorizeStats : public ObjectImpl {
   std::atomic<long long> cacheHits{0};
   std::atomic<long long> cacheMisses{0};
   std::atomic<long long> sessions{0};
};

// The manager's reader/writer lock: pthread's with writers preferred, so that a stream
// of checks cannot hold a change off. It is not recursive: a thread that already holds
// it in either mode and takes it again panics rather than deadlocking behind a waiting
// writer. The calling thread's holds are tracked so that the Is...Locked queries answer
// for it.
class PELMORA_CAPABILITY("rwlock") ManagerLock {
public:
   ManagerLock();
   ~ManagerLock();
   ManagerLock(const ManagerLock&) = delete;
   ManagerLock& operator=(const ManagerLock&) = delete;

   void ReadLock() PELMORA_ACQUIRE_SHARED();
   void WriteLock() PELMORA_ACQUIRE();
   void Unlock() PELMORA_RELEASE_GENERIC();
   bool IsReadLocked() const;
   bool IsWriteLocked() const;

private:
   pthread_rwlock_t _lock;
};

class AuthorizeManagerImpl : public virtual AuthorizeManager, public ObjectImpl {
public:
   AuthorizeManagerImpl();
   ~AuthorizeManagerImpl() override;

   void Init(UserDirectory* userDirectory, StorageProvider* storageProvider, AppModelProvider* appModelProvider,
             Service::Logger* logger, Service::Config::View* config) override;
   void Shutdown() override;
   UserDirectory* GetUserDirectory() override;
   StorageProvider* GetStorageProvider() override;
   AppModelProvider* GetAppModelProvider() override;

   void AddConnection(Session* session, const std::string& user, Ref<AuthTokenHelper> token,
                      bool privileged) override;
   void RemoveConnection(Session* session) override;
   std::string GetUser(Session* session) override;
   void GetAuthToken(const std::string& user, Ref<AuthTokenHelper>& out) override;

   bool HasPrivilege(Session* session, const std::string& privilegeId) override;
   bool HasRootAccess(Session* session) override;
   bool HasEntityPrivilege(Session* session, AuthEntity* entity, const std::string& privilegeId) override;
   bool HasEntityPrivilege(const std::string& user, AuthEntity* entity, const std::string& privilegeId) override;
   void HasEntityPrivilegeList(Session* session, const EntityPrivilegeList& list,
                               std::vector<bool>& results) override;
   void HasEntityPrivilegeListUncached(Session* session, const EntityPrivilegeList& list,
                                       std::vector<bool>& results) override;
   void GetEntityRoles(Session* session, AuthEntity* entity, std::vector<int>& roleIds) override;

   void CreateRole(const std::string& name, const PrivSet& privileges, int& id) override;
   void CreateRoleWithId(const std::string& name, const PrivSet& privileges, int id, bool persist) override;
   void ModifyRole(int id, const std::string& name, PrivSet& privileges, bool persist) override;
   void RemoveRole(int id, bool removePermissions, bool persist) override;
   void GetRole(int id, Ref<Role>& out) override;
   void GetRoles(RoleResult& out) override;
   void GetRolePrivList(int id, std::vector<std::string>& privilegeIds) override;
   void GetPrivileges(PrivilegeResult& out) override;
   void GetPrivilege(const std::string& id, Ref<Privilege>& out) override;
   void AddPrivileges(const std::vector<PrivilegeDef>& privileges) override;
   void RemovePrivileges(const std::vector<std::string>& privilegeIds) override;
   void MoveRolePermissions(int fromRoleId, int toRoleId) override;

   void CreateACE(AuthEntity* entity, const std::string& principal, bool isGroup, int roleId,
                  bool propagate) override;
   void ModifyACE(AuthEntity* entity, const std::string& principal, bool isGroup, int roleId,
                  bool propagate) override;
   void RemoveACE(AuthEntity* entity, const std::string& principal, bool isGroup) override;
   void GetACEs(AuthEntity* entity, bool inherited, ACEResult& out) override;
   void GetACEs(ACEResult& out) override;
   void GetACEsByRole(int roleId, ACEResult& out) override;
   void ValidateACEs(ACEResult& removed) override;
   void RemoveAssociatedACL(const std::string& entityId) override;
   void NotifyEntityMove(const std::vector<std::string>& entityIds) override;
   void NotifyChange(const std::vector<std::string>& users) override;

   void ClearUserCaches() override;
   void UpdateMaxUserCacheEntries(unsigned maxEntries) override;

   // What descendants of `entityId` without an applicable entry inherit: the propagated
   // access of the nearest ancestor that has one, else no access. Fills `cache` with the
   // ancestors it computed. The caller holds the lock in either mode.
   Ref<EntityAccess> FindParentAccess(const std::string& user, AuthTokenHelper* token,
                                      const std::string& entityId, UserData* cache);
   // The user's access on the entity; `cache` (may be null) is used and filled.
   Ref<EntityAccess> ComputeAccess(const std::string& user, AuthTokenHelper* token,
                                   const std::string& entityId, UserData* cache);
   unsigned GetMaxUserCacheEntries() const { return _maxEntries.load(); }
   // Entries cached for the session's user; 0 for an unknown session.
   size_t CachedEntryCount(Session* session);
   bool IsReadLocked() const { return _lock.IsReadLocked(); }
   bool IsWriteLocked() const { return _lock.IsWriteLocked(); }

private:
   class ReadGuard;
   class WriteGuard;

   void RequireInit() const;
   UserValidationResult CheckPrincipal(const std::string& name, bool isGroup);
   void Reset();
   void PublishCounters();
   unsigned PrivilegeIndex(const std::string& privilegeId) const;
   bool Check(Session* session, AuthEntity* entity, unsigned index, bool useCache);
   // Runs `writes` inside one transaction; any failure rolls it back and raises
   // AuthStorageException.
   void Persist(const std::function<void(AuthTransaction*)>& writes);
   ACL* FindACL(const std::string& entityId) const;
   ACL& GetOrCreateACL(const std::string& entityId);
   void CheckRoleName(const std::string& name, int exceptId) const;
   RoleData ToRoleData(Role* role) const;
   // Whether the permission is the last user permission with Admin on the root entity.
   bool IsLastFullAdminUser(const std::string& entityId, const std::string& principal, bool isGroup) const;
   size_t CountRootAdminUsers() const;
   void ForEachACE(const std::function<void(const std::string&, ACE*)>& visit) const;

   void LoadRoles();
   void LoadACEs();
   // Empty when the permission may be added, else the reason it may not.
   std::string ValidateNewACE(const ACEData& data, UserValidationResult& validation);
   void CreateDefaultPermission();
   void AddLoaded(const ACEData& data, UserValidationResult validation);

   // After a change under the write lock: caches recomputed, failures logged.
   void AfterChange(const std::vector<std::string>& users = {});
   void Recompute(const std::vector<std::string>& users);
   void RecomputeUser(UserData* data);

   mutable ManagerLock _lock;
   bool _initialized = false;
   Ref<UserDirectory> _directory;
   Ref<StorageProvider> _storage;
   Ref<AppModelProvider> _model;
   Ref<Service::Logger> _logger;
   std::string _rootId;
   std::string _defaultAdmin = kDefaultAdminUser;
   std::atomic<unsigned> _maxEntries{kDefaultMaxEntityCache};
   PrivilegeTable _privileges;
   Roles _roles;
   std::unordered_map<std::string, Ref<ACL>> _acls;
   UserCache _users;
   const Ref<AuthorizeStats> _stats{new AuthorizeStats()};
   Ref<PerfCounter::RegistryItem> _counters;
};

// A token for the anonymous principal: it belongs to no group.
void CreateAnonymousToken(Ref<AuthTokenHelper>& out);

}  // namespace Pelmora::Authorize
