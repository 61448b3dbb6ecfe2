#include "src/authorize/privileges.h"

#include <algorithm>

#include "pelmora/authorize/exceptions.h"
#include "pelmora/exception/exceptions.h"

namespace Pelmora::Authorize {

Privilege::Privilege(const std::string& id, const std::string& groupId, unsigned index)
   : _id(id), _groupId(groupId), _index(index) {
   PELMORA_VERIFY(id.find(groupId) == 0);
   PELMORA_VERIFY(id.length() > groupId.length() + 1);
   PELMORA_VERIFY(index < MAX_PRIVILEGES);
}

PrivilegeTable::PrivilegeTable() : _byIndex(MAX_PRIVILEGES, nullptr) {
   for (const char* id : {kPrivilegeAnonymous, kPrivilegeView, kPrivilegeRead}) {
      Add(PrivilegeDef{id, kPrivilegeGroupSystem});
   }
}

Privilege* PrivilegeTable::Find(const std::string& id) const {
   auto it = _byId.find(id);
   return it == _byId.end() ? nullptr : it->second.Get();
}

Privilege* PrivilegeTable::Add(const PrivilegeDef& def) {
   if (Privilege* known = Find(def.id)) {
      if (known->GetGroupId() != def.groupId) throw AuthAlreadyExistsException();
      return known;
   }
   // Checked here so that outside input never reaches the constructor's panics.
   if (def.groupId.empty() || def.id.find(def.groupId) != 0 ||
       def.id.length() <= def.groupId.length() + 1 || def.id[def.groupId.length()] != '.') {
      throw InvalidArgumentException(def.id);
   }
   auto slot = std::find(_byIndex.begin(), _byIndex.end(), nullptr);
   if (slot == _byIndex.end()) throw FullException("No free privilege index for " + def.id);
   Ref<Privilege> privilege(new Privilege(def.id, def.groupId, static_cast<unsigned>(slot - _byIndex.begin())));
   *slot = privilege.Get();
   _byId.emplace(def.id, privilege);
   return privilege.Get();
}

void PrivilegeTable::Remove(const std::string& id) {
   Privilege* privilege = Find(id);
   if (!privilege) throw AuthPrivilegeNotFoundException(id);
   if (privilege->IsSystem()) throw AuthSystemPrivilegeException();
   _byIndex[privilege->GetIndex()] = nullptr;
   _byId.erase(id);
}

void PrivilegeTable::GetAll(PrivilegeResult& out) const {
   out.clear();
   for (Privilege* privilege : _byIndex) {
      if (privilege) out.emplace_back(privilege);
   }
}

PrivSet PrivilegeTable::Known() const {
   PrivSet set;
   for (const auto& [id, privilege] : _byId) set.Set(privilege->GetIndex());
   return set;
}

void PrivilegeTable::Names(const PrivSet& set, std::vector<std::string>& out) const {
   out.clear();
   for (unsigned i = 0; i < MAX_PRIVILEGES; ++i) {
      if (_byIndex[i] && set.Test(i)) out.push_back(_byIndex[i]->GetId());
   }
}

}  // namespace Pelmora::Authorize
