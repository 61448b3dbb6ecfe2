#pragma once
// Roles and effective access. A Role is a named PrivSet with an integer id: the system
// roles have negative ids and never change, user roles positive ids. EntityAccess is
// what a user may do on one entity: the union of the privileges of its roles, with the
// role ids. Roles keeps the role table of one manager; the manager's lock guards it and
// the roles in it. EntityAccess is immutable and shared.

#include <map>
#include <string>
#include <vector>

#include "pelmora/authorize/privileges.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Authorize {

constexpr int kRoleAdmin = -1;
constexpr int kRoleReadOnly = -2;
constexpr int kRoleView = -3;
constexpr int kRoleAnonymous = -4;
constexpr int kRoleNoAccess = -5;

class PELMORA_EXPORT Role : public ObjectImpl {
public:
   Role(int id, const std::string& name, const PrivSet& privileges)
      : _id(id), _name(name), _privileges(privileges) {}

   int GetId() const { return _id; }
   bool IsSystem() const { return _id < 0; }
   const std::string& GetName() const { return _name; }
   const PrivSet& GetPrivileges() const { return _privileges; }
   // Writers hold the manager's write lock.
   void SetName(const std::string& name) { _name = name; }
   void SetPrivileges(const PrivSet& privileges) { _privileges = privileges; }

private:
   const int _id;
   std::string _name;
   PrivSet _privileges;
};

// A role as stored: privileges by id, so that indexes may differ between runs.
struct PELMORA_EXPORT RoleData {
   int id = 0;
   std::string name;
   std::vector<std::string> privilegeIds;
};

using RoleResult = std::vector<Ref<Role>>;

class PELMORA_EXPORT EntityAccess : public ObjectImpl {
public:
   EntityAccess() = default;
   // The union of the roles' privileges.
   explicit EntityAccess(const std::vector<Ref<Role>>& roles);

   bool HasPrivilege(unsigned index) const { return _privileges.Test(index); }
   const PrivSet& GetPrivileges() const { return _privileges; }
   const std::vector<int>& GetRoleIds() const { return _roleIds; }
   bool IsEmpty() const { return _roleIds.empty(); }

private:
   PrivSet _privileges;
   std::vector<int> _roleIds;
};

class PELMORA_EXPORT Roles {
public:
   // Replaces the table with the five system roles; Admin gets every privilege set in
   // `known`.
   void SetupDefaultRoles(const PrivSet& known);
   // AlreadyExists when the id is taken; the name is not checked here.
   void Add(Role* role);
   void Remove(int id);
   // Null when absent.
   Role* Find(int id) const;
   Role* FindByName(const std::string& name) const;
   // Sorted by id.
   void GetAll(RoleResult& out) const;
   // The lowest positive id not in use.
   int NextFreeId() const;
   // Clears the bit of a removed privilege in every role.
   void ClearPrivilege(unsigned index);

   // The shared instances for no access at all and for view-only access.
   static EntityAccess* GetNoAccessEntityAccess();
   static EntityAccess* GetViewEntityAccess();

private:
   std::map<int, Ref<Role>> _roles;
};

}  // namespace Pelmora::Authorize
