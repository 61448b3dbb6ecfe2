#pragma once
// Access-control entries and lists. An ACE grants one role to one user or group on one
// entity, optionally to its descendants too; an entity's ACL is its entries in insertion
// order. The manager's lock guards an ACL and its entries.

#include <string>
#include <vector>

#include "pelmora/authorize/providers.h"
#include "pelmora/authorize/roles.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Authorize {

// The user name of sessions that have not logged in.
constexpr const char* kAnonymousUser = "_auth_anon_";

class PELMORA_EXPORT ACE : public ObjectImpl {
public:
   virtual bool IsUser() const = 0;
   // Whether the entry applies to `user`; when it does, `role` is its role.
   virtual bool GetRoleForUser(const std::string& user, AuthTokenHelper* token, Ref<Role>& role) = 0;

   const std::string& GetPrincipal() const { return _principal; }
   bool GetPropagate() const { return _propagate; }
   Role* GetRole() const { return _role.Get(); }
   // What the directory said of the principal when the entry was made.
   UserValidationResult GetValidation() const { return _validation; }
   void Change(Role* role, bool propagate) {
      _role = role;
      _propagate = propagate;
   }
   ACEData ToData(const std::string& entityId) const;

   // A UserACE, or a GroupACE when `isGroup`. `role` must be the role `roleId` names
   // (AuthRoleNotFoundException when null or another); an empty name is refused with
   // AuthUserNotFoundException. `validation`, when given, is kept with the entry.
   static void CreateACE(int roleId, const std::string& name, bool isGroup, Role* role, bool propagate,
                         Ref<ACE>& out, UserValidationResult* validation = nullptr);

protected:
   ACE(const std::string& principal, Role* role, bool propagate, UserValidationResult validation)
      : _principal(principal), _propagate(propagate), _role(role), _validation(validation) {}

private:
   const std::string _principal;
   bool _propagate;
   Ref<Role> _role;
   const UserValidationResult _validation;
};

class PELMORA_EXPORT UserACE : public ACE {
public:
   using ACE::ACE;
   bool IsUser() const override { return true; }
   // Same user by the token's directory; by name when there is no token.
   bool GetRoleForUser(const std::string& user, AuthTokenHelper* token, Ref<Role>& role) override;
};

class PELMORA_EXPORT GroupACE : public ACE {
public:
   using ACE::ACE;
   bool IsUser() const override { return false; }
   // Membership by the token's directory; a null token panics.
   bool GetRoleForUser(const std::string& user, AuthTokenHelper* token, Ref<Role>& role) override;
};

class PELMORA_EXPORT ACL : public ObjectImpl {
public:
   // AuthAlreadyExistsException for a second entry of the same principal and kind.
   void AddACE(ACE* ace);
   // False when there was no such entry.
   bool DeleteACE(const std::string& name, bool isGroup);
   // AuthPermissionNotFoundException when there is no such entry.
   void ChangeACE(const std::string& name, bool isGroup, Role* role, bool propagate);
   ACE* FindEntry(const std::string& name, bool isGroup) const;
   // The entries whose role is `roleId`.
   void FindEntries(int roleId, std::vector<Ref<ACE>>& out) const;
   const std::vector<Ref<ACE>>& GetEntries() const { return _entries; }
   bool IsEmpty() const { return _entries.empty(); }

   // The entity's own access for `user` and the access it passes to descendants, each
   // null when no entry gives one. False when no entry applies at all. Groups that
   // applied are appended to `resolvedGroups` when given.
   bool GetAccessForUser(const std::string& user, AuthTokenHelper* token, Ref<EntityAccess>& own,
                         Ref<EntityAccess>& propagated,
                         std::vector<std::string>* resolvedGroups = nullptr) const;

private:
   std::vector<Ref<ACE>> _entries;
};

}  // namespace Pelmora::Authorize
