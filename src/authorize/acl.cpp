#include "pelmora/authorize/acl.h"

#include <atomic>

#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/service/logMacros.h"
#include "src/authorize/authLog.h"

namespace Pelmora::Authorize {

namespace {
std::atomic<Service::Logger*> g_authLog{nullptr};
}  // namespace

Service::Logger* AuthLog() {
   Service::Logger* logger = g_authLog.load(std::memory_order_acquire);
   return logger ? logger : Service::GetDefaultLogger();
}

void SetAuthLog(Service::Logger* logger) { g_authLog.store(logger, std::memory_order_release); }

ACEData ACE::ToData(const std::string& entityId) const {
   return ACEData{entityId, _principal, !IsUser(), _role->GetId(), _propagate};
}

void ACE::CreateACE(int roleId, const std::string& name, bool isGroup, Role* role, bool propagate,
                    Ref<ACE>& out, UserValidationResult* validation) {
   if (!role || role->GetId() != roleId) throw AuthRoleNotFoundException(roleId);
   if (name.empty()) throw AuthUserNotFoundException(name, isGroup);
   UserValidationResult known = validation ? *validation : USER_VALID;
   if (isGroup) {
      out = new GroupACE(name, role, propagate, known);
   } else {
      out = new UserACE(name, role, propagate, known);
   }
}

bool UserACE::GetRoleForUser(const std::string& user, AuthTokenHelper* token, Ref<Role>& role) {
   bool same = GetPrincipal() == user;
   if (!same && token && token->GetUserDirectory() && token->GetUserInfo()) {
      try {
         same = token->GetUserDirectory()->IsUserEqual(GetPrincipal(), token->GetUserInfo());
      } catch (const Exception&) {
         same = false;
      }
   }
   if (same) role = GetRole();
   return same;
}

bool GroupACE::GetRoleForUser(const std::string& user, AuthTokenHelper* token, Ref<Role>& role) {
   (void)user;
   PELMORA_VERIFY(token != NULL);
   UserDirectory* directory = token->GetUserDirectory();
   try {
      if (!directory || !directory->IsGroupMember(token->GetUserInfo(), GetPrincipal(), token)) return false;
   } catch (const Exception&) {
      PELMORA_LOG_WARNING(AuthLog(), "[ACL] Failed to determine group membership for %1", GetPrincipal());
      return false;
   }
   PELMORA_LOG_TRIVIA(AuthLog(), "[ACL] Resolved group %1", GetPrincipal());
   role = GetRole();
   return true;
}

void ACL::AddACE(ACE* ace) {
   if (FindEntry(ace->GetPrincipal(), !ace->IsUser())) throw AuthAlreadyExistsException();
   _entries.emplace_back(ace);
}

bool ACL::DeleteACE(const std::string& name, bool isGroup) {
   for (auto it = _entries.begin(); it != _entries.end(); ++it) {
      if ((*it)->GetPrincipal() == name && (*it)->IsUser() != isGroup) {
         _entries.erase(it);
         return true;
      }
   }
   return false;
}

void ACL::ChangeACE(const std::string& name, bool isGroup, Role* role, bool propagate) {
   ACE* ace = FindEntry(name, isGroup);
   if (!ace) throw AuthPermissionNotFoundException(name, std::string(), isGroup);
   ace->Change(role, propagate);
}

ACE* ACL::FindEntry(const std::string& name, bool isGroup) const {
   for (const Ref<ACE>& ace : _entries) {
      if (ace->GetPrincipal() == name && ace->IsUser() != isGroup) return ace.Get();
   }
   return nullptr;
}

void ACL::FindEntries(int roleId, std::vector<Ref<ACE>>& out) const {
   for (const Ref<ACE>& ace : _entries) {
      if (ace->GetRole()->GetId() == roleId) out.push_back(ace);
   }
}

bool ACL::GetAccessForUser(const std::string& user, AuthTokenHelper* token, Ref<EntityAccess>& own,
                           Ref<EntityAccess>& propagated, std::vector<std::string>* resolvedGroups) const {
   std::vector<Ref<Role>> ownRoles;
   std::vector<Ref<Role>> propagatedRoles;
   bool applied = false;
   bool ownClosed = false;
   for (const Ref<ACE>& ace : _entries) {
      Ref<Role> role;
      if (!ace->GetRoleForUser(user, token, role)) continue;
      applied = true;
      if (!ownClosed) ownRoles.push_back(role);
      if (ace->GetPropagate()) propagatedRoles.push_back(role);
      if (ace->IsUser()) {
         // The user's own entry outranks any group's: later entries no longer widen the
         // entity's access, and a propagating one decides the subtree as well.
         if (ace->GetPropagate()) break;
         ownClosed = true;
      } else if (resolvedGroups) {
         resolvedGroups->push_back(ace->GetPrincipal());
      }
   }
   own = applied ? new EntityAccess(ownRoles) : nullptr;
   propagated = propagatedRoles.empty() ? nullptr : new EntityAccess(propagatedRoles);
   return applied;
}

}  // namespace Pelmora::Authorize
