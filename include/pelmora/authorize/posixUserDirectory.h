#pragma once
// The user directory of the system databases (passwd and group through NSS, so LDAP or
// other sources configured there work unchanged). Users are equal when their uids are;
// a user belongs to a group when the group is the user's primary group or one of its
// supplementary groups. A token remembers its user's group ids. Thread-safe.

#include "pelmora/authorize/providers.h"
#include "pelmora/object/export.h"

namespace Pelmora::Authorize {

class PELMORA_EXPORT PosixUserInfo : public virtual UserInfo {
public:
   virtual unsigned GetUid() const = 0;
   virtual unsigned GetGid() const = 0;
};

PELMORA_EXPORT void CreatePosixUserDirectory(Ref<UserDirectory>& out);

}  // namespace Pelmora::Authorize
