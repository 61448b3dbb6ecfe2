#include "pelmora/authorize/roles.h"

#include "pelmora/authorize/exceptions.h"

namespace Pelmora::Authorize {

EntityAccess::EntityAccess(const std::vector<Ref<Role>>& roles) {
   _roleIds.reserve(roles.size());
   for (const Ref<Role>& role : roles) {
      _privileges |= role->GetPrivileges();
      _roleIds.push_back(role->GetId());
   }
}

void Roles::SetupDefaultRoles(const PrivSet& known) {
   _roles.clear();
   PrivSet anonymous;
   anonymous.Set(kPrivilegeIndexAnonymous);
   PrivSet view = anonymous;
   view.Set(kPrivilegeIndexView);
   PrivSet readOnly = view;
   readOnly.Set(kPrivilegeIndexRead);
   Add(new Role(kRoleAdmin, "Admin", known));
   Add(new Role(kRoleReadOnly, "ReadOnly", readOnly));
   Add(new Role(kRoleView, "View", view));
   Add(new Role(kRoleAnonymous, "Anonymous", anonymous));
   Add(new Role(kRoleNoAccess, "NoAccess", PrivSet()));
}

void Roles::Add(Role* role) {
   Ref<Role> keep(role);
   if (!_roles.emplace(role->GetId(), keep).second) throw AuthAlreadyExistsException();
}

void Roles::Remove(int id) { _roles.erase(id); }

Role* Roles::Find(int id) const {
   auto it = _roles.find(id);
   return it == _roles.end() ? nullptr : it->second.Get();
}

Role* Roles::FindByName(const std::string& name) const {
   for (const auto& [id, role] : _roles) {
      if (role->GetName() == name) return role.Get();
   }
   return nullptr;
}

void Roles::GetAll(RoleResult& out) const {
   out.clear();
   for (const auto& [id, role] : _roles) out.push_back(role);
}

int Roles::NextFreeId() const {
   // The map is sorted: the first gap among the positive ids, else one past the last.
   int next = 1;
   for (auto it = _roles.lower_bound(1); it != _roles.end() && it->first == next; ++it) ++next;
   return next;
}

void Roles::ClearPrivilege(unsigned index) {
   for (auto& [id, role] : _roles) {
      PrivSet set = role->GetPrivileges();
      set.Clear(index);
      role->SetPrivileges(set);
   }
}

namespace {

// Shared for the life of the process; never destroyed, as checks may run during exit.
EntityAccess* MakeShared(std::vector<Ref<Role>> roles) {
   auto* access = new EntityAccess(roles);
   access->IncRef();
   return access;
}

}  // namespace

EntityAccess* Roles::GetNoAccessEntityAccess() {
   static EntityAccess* const noAccess = MakeShared({});
   return noAccess;
}

EntityAccess* Roles::GetViewEntityAccess() {
   static EntityAccess* const view = [] {
      PrivSet set;
      set.Set(kPrivilegeIndexAnonymous);
      set.Set(kPrivilegeIndexView);
      return MakeShared({Ref<Role>(new Role(kRoleView, "View", set))});
   }();
   return view;
}

}  // namespace Pelmora::Authorize
