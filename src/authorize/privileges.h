#pragma once
// The table of known privileges of one manager: ids to dense indexes, the built-in ones
// first. Not thread-safe; the manager's lock guards it.

#include <string>
#include <unordered_map>
#include <vector>

#include "pelmora/authorize/privileges.h"

namespace Pelmora::Authorize {

class PrivilegeTable {
public:
   // With the three built-in privileges only.
   PrivilegeTable();

   // Null when unknown.
   Privilege* Find(const std::string& id) const;
   // The new privilege, at the lowest free index; an id already known is kept as it is.
   // AuthAlreadyExistsException when the id is taken by another group, InvalidArgument for
   // an id that is not "<group>.<name>", FullException when every index is in use.
   Privilege* Add(const PrivilegeDef& def);
   // AuthSystemPrivilegeException for a built-in one, AuthPrivilegeNotFoundException for
   // an unknown id.
   void Remove(const std::string& id);
   void GetAll(PrivilegeResult& out) const;
   // Every index in use.
   PrivSet Known() const;
   // The ids of the privileges in `set`.
   void Names(const PrivSet& set, std::vector<std::string>& out) const;

private:
   std::unordered_map<std::string, Ref<Privilege>> _byId;
   std::vector<Privilege*> _byIndex;
};

}  // namespace Pelmora::Authorize
