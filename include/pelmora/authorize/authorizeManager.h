#pragma once
// The authorisation manager answers "may this session do that here?" from per-user
// caches, and keeps roles and permissions consistent and stored. Changes are stored
// through the storage provider first and applied in memory only when stored; the last
// user with Admin on the root entity cannot be taken away. One read/write lock guards
// it: checks share it, changes hold it alone. Thread-safe.

#include <string>
#include <utility>
#include <vector>

#include "pelmora/authorize/acl.h"
#include "pelmora/authorize/privileges.h"
#include "pelmora/authorize/providers.h"
#include "pelmora/authorize/roles.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/config.h"
#include "pelmora/service/logger.h"

namespace Pelmora::Authorize {

using ACEResult = std::vector<ACEData>;
using EntityPrivilegeList = std::vector<std::pair<AuthEntity*, std::string>>;

// The configuration keys the manager reads in Init.
constexpr const char* kConfigMaxEntityCache = "pelmora/authorize/maxEntityCache";
// The user who receives Admin on the root entity when the store holds no permission.
constexpr const char* kConfigDefaultAdmin = "pelmora/authorize/defaultAdmin";
constexpr unsigned kDefaultMaxEntityCache = 10000;
constexpr const char* kDefaultAdminUser = "root";

class PELMORA_EXPORT AuthorizeManager : public virtual Object {
public:
   // Loads privileges, roles and permissions, validates the permissions and, when none
   // exist, stores Admin on the root for the default administrator. Null providers
   // panic. AuthException when the system would be left without any access rule.
   // `config`, when given, is read for the keys above.
   virtual void Init(UserDirectory* userDirectory, StorageProvider* storageProvider,
                     AppModelProvider* appModelProvider, Service::Logger* logger,
                     Service::Config::View* config = nullptr) = 0;
   // Forgets providers, sessions, caches and the loaded state.
   virtual void Shutdown() = 0;
   virtual UserDirectory* GetUserDirectory() = 0;
   virtual StorageProvider* GetStorageProvider() = 0;
   virtual AppModelProvider* GetAppModelProvider() = 0;

   // Sessions. A privileged session has root access whatever its permissions say.
   virtual void AddConnection(Session* session, const std::string& user, Ref<AuthTokenHelper> token,
                              bool privileged) = 0;
   virtual void RemoveConnection(Session* session) = 0;
   // Empty for an unknown session.
   virtual std::string GetUser(Session* session) = 0;
   // AuthUserNotFoundException / AuthUserUnresolvedException as the directory answers.
   virtual void GetAuthToken(const std::string& user, Ref<AuthTokenHelper>& out) = 0;

   // Checks answer false for an unknown session or a missing entry; an unknown privilege
   // id raises AuthPrivilegeNotFoundException. HasPrivilege asks about the root entity.
   virtual bool HasPrivilege(Session* session, const std::string& privilegeId) = 0;
   // True for a null session (internal callers).
   virtual bool HasRootAccess(Session* session) = 0;
   virtual bool HasEntityPrivilege(Session* session, AuthEntity* entity, const std::string& privilegeId) = 0;
   // For a user without a session: computed, not cached.
   virtual bool HasEntityPrivilege(const std::string& user, AuthEntity* entity,
                                   const std::string& privilegeId) = 0;
   // One answer per pair, under one lock acquisition.
   virtual void HasEntityPrivilegeList(Session* session, const EntityPrivilegeList& list,
                                       std::vector<bool>& results) = 0;
   // As HasEntityPrivilegeList, recomputing every answer instead of using the caches.
   virtual void HasEntityPrivilegeListUncached(Session* session, const EntityPrivilegeList& list,
                                               std::vector<bool>& results) = 0;
   // The ids of the roles that give the session its access to `entity`.
   virtual void GetEntityRoles(Session* session, AuthEntity* entity, std::vector<int>& roleIds) = 0;

   // Roles. Names are unique and not empty; system roles never change.
   virtual void CreateRole(const std::string& name, const PrivSet& privileges, int& id) = 0;
   // `persist` false leaves the store alone (the caller restores stored roles itself).
   virtual void CreateRoleWithId(const std::string& name, const PrivSet& privileges, int id, bool persist) = 0;
   virtual void ModifyRole(int id, const std::string& name, PrivSet& privileges, bool persist) = 0;
   // Refused with AuthRolePermissionsExistException while permissions use the role,
   // unless `removePermissions`.
   virtual void RemoveRole(int id, bool removePermissions, bool persist) = 0;
   virtual void GetRole(int id, Ref<Role>& out) = 0;
   virtual void GetRoles(RoleResult& out) = 0;
   virtual void GetRolePrivList(int id, std::vector<std::string>& privilegeIds) = 0;
   virtual void GetPrivileges(PrivilegeResult& out) = 0;
   virtual void GetPrivilege(const std::string& id, Ref<Privilege>& out) = 0;
   virtual void AddPrivileges(const std::vector<PrivilegeDef>& privileges) = 0;
   virtual void RemovePrivileges(const std::vector<std::string>& privilegeIds) = 0;
   // Gives every permission of `fromRoleId` the role `toRoleId`.
   virtual void MoveRolePermissions(int fromRoleId, int toRoleId) = 0;

   // Permissions.
   virtual void CreateACE(AuthEntity* entity, const std::string& principal, bool isGroup, int roleId,
                          bool propagate) = 0;
   virtual void ModifyACE(AuthEntity* entity, const std::string& principal, bool isGroup, int roleId,
                          bool propagate) = 0;
   virtual void RemoveACE(AuthEntity* entity, const std::string& principal, bool isGroup) = 0;
   // The entity's entries; with `inherited`, also the propagating entries of its ancestors.
   virtual void GetACEs(AuthEntity* entity, bool inherited, ACEResult& out) = 0;
   virtual void GetACEs(ACEResult& out) = 0;
   virtual void GetACEsByRole(int roleId, ACEResult& out) = 0;
   // Re-checks every stored permission's entity and principal; those found to be invalid
   // are removed and returned in `removed`.
   virtual void ValidateACEs(ACEResult& removed) = 0;
   // Deletes the permissions of a removed entity.
   virtual void RemoveAssociatedACL(const std::string& entityId) = 0;
   // Entities (with their subtrees) moved: cached access is recomputed.
   virtual void NotifyEntityMove(const std::vector<std::string>& entityIds) = 0;
   // Recomputes the caches of the sessions of `users`; all sessions when empty.
   virtual void NotifyChange(const std::vector<std::string>& users) = 0;

   virtual void ClearUserCaches() = 0;
   virtual void UpdateMaxUserCacheEntries(unsigned maxEntries) = 0;
};

// The process's manager, made on first use.
PELMORA_EXPORT void GetInstance(Ref<AuthorizeManager>& out);
// A manager of its own (tests, programs with several authorisation domains).
PELMORA_EXPORT void CreateAuthorizeManager(Ref<AuthorizeManager>& out);

}  // namespace Pelmora::Authorize
