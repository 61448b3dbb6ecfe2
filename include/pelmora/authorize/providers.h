#pragma once
// What the embedding program supplies to the authorisation manager: the users and groups
// (UserDirectory), the entity tree (AppModelProvider) and the persistence of roles and
// permissions (StorageProvider). Providers are called from any thread and must be
// thread-safe; the manager calls the storage provider only while it holds its own write
// lock (or during Init), so a storage provider sees one change at a time.

#include <string>
#include <vector>

#include "pelmora/authorize/privileges.h"
#include "pelmora/authorize/roles.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Authorize {

// A connection of one user. The manager keys its session table by the object's identity
// and asks nothing else of it.
class PELMORA_EXPORT Session : public virtual Object {};

// A user as the directory resolved it.
class PELMORA_EXPORT UserInfo : public virtual Object {
public:
   virtual const std::string& GetName() const = 0;
};

class UserDirectory;

// What a session carries to answer questions about its user: the resolved user and the
// directory that resolved it (the directory may cache memberships in it).
class PELMORA_EXPORT AuthTokenHelper : public virtual Object {
public:
   virtual UserInfo* GetUserInfo() const = 0;
   virtual UserDirectory* GetUserDirectory() const = 0;
};

// What a directory knows of a principal's existence.
enum UserValidationResult {
   USER_VALID = 0,
   USER_NOT_FOUND = 1,
   // The directory could not answer (its source is down); the principal may exist.
   USER_UNRESOLVED = 2,
};

class PELMORA_EXPORT UserDirectory : public virtual Object {
public:
   // The user called `name`: AuthUserNotFoundException when there is none,
   // AuthUserUnresolvedException when the directory cannot tell.
   virtual void FindUser(const std::string& name, Ref<UserInfo>& out) = 0;
   virtual UserValidationResult ValidatePrincipal(const std::string& name, bool isGroup) = 0;
   // Whether `principal` names the same user as `user` (by the directory's identity,
   // not by spelling). False for an unknown principal.
   virtual bool IsUserEqual(const std::string& principal, UserInfo* user) = 0;
   // Whether `user` belongs to `group`. AuthUserUnresolvedException when it cannot tell.
   virtual bool IsGroupMember(UserInfo* user, const std::string& group, AuthTokenHelper* token) = 0;
   // A token for `user`, as FindUser fails.
   virtual void CreateAuthToken(const std::string& user, Ref<AuthTokenHelper>& out) = 0;
};

// One node of the entity tree.
class PELMORA_EXPORT AuthEntity : public virtual Object {
public:
   virtual const std::string& GetId() const = 0;
};

// The ids of an entity's ancestors, nearest parent first, the root last.
using ParentChain = std::vector<std::string>;

class PELMORA_EXPORT AppModelProvider : public virtual Object {
public:
   // False when there is no such entity.
   virtual bool FindEntity(const std::string& id, Ref<AuthEntity>& out) = 0;
   virtual void GetRootEntity(Ref<AuthEntity>& out) = 0;
   // AuthEntityNotFoundException for an entity not in the tree.
   virtual void GetParentChain(const std::string& id, ParentChain& out) = 0;
};

// A permission as stored.
struct PELMORA_EXPORT ACEData {
   std::string entityId;
   std::string principal;
   bool isGroup = false;
   int roleId = 0;
   bool propagate = false;
   friend bool operator==(const ACEData&, const ACEData&) = default;
};

// One atomic change of the store: either every write made through it between creation
// and Commit is kept, or none. Dropping it uncommitted rolls back.
class PELMORA_EXPORT AuthTransaction : public virtual Object {
public:
   virtual void Commit() = 0;
   virtual void Rollback() = 0;
};

// Every operation raises AuthStorageException on failure.
class PELMORA_EXPORT StorageProvider : public virtual Object {
public:
   virtual void LoadPrivileges(std::vector<PrivilegeDef>& out) = 0;
   virtual void LoadRoles(std::vector<RoleData>& out) = 0;
   virtual void LoadACEs(std::vector<ACEData>& out) = 0;

   virtual void BeginTransaction(Ref<AuthTransaction>& out) = 0;
   // Writes go through the open transaction; insert or replace by key.
   virtual void StorePrivilege(AuthTransaction* tx, const PrivilegeDef& privilege) = 0;
   virtual void RemovePrivilege(AuthTransaction* tx, const std::string& id) = 0;
   virtual void StoreRole(AuthTransaction* tx, const RoleData& role) = 0;
   virtual void RemoveRole(AuthTransaction* tx, int id) = 0;
   // Keyed by entity, principal and group flag.
   virtual void StoreACE(AuthTransaction* tx, const ACEData& ace) = 0;
   virtual void RemoveACE(AuthTransaction* tx, const std::string& entityId,
                          const std::string& principal, bool isGroup) = 0;
};

}  // namespace Pelmora::Authorize
