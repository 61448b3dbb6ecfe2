#pragma once
// The exceptions of the authorisation layer. Every one derives from AuthException; those
// about a principal say "User <name>" or "Group <name>", then ", cause: <message>" when
// a cause is known. The others carry what they are about through their accessors.

#include <string>

#include "pelmora/exception/throwable.h"
#include "pelmora/object/export.h"

namespace Pelmora::Authorize {

class PELMORA_EXPORT AuthException : public Exception {
public:
   AuthException() : Exception("Authorize Exception") {}
   explicit AuthException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(AuthException)
};

// The message of the exceptions about a principal.
PELMORA_EXPORT std::string PrincipalMessage(const std::string& name, bool isGroup,
                                            const std::string& cause = std::string());

#define PELMORA_AUTH_PLAIN_EXCEPTION(Class)   \
   class PELMORA_EXPORT Class : public AuthException { \
   public:                                    \
      Class() = default;                      \
      PELMORA_EXCEPTION_CLONE(Class)          \
   };
PELMORA_AUTH_PLAIN_EXCEPTION(AuthAlreadyExistsException)
PELMORA_AUTH_PLAIN_EXCEPTION(AuthInvalidRoleNameException)
PELMORA_AUTH_PLAIN_EXCEPTION(AuthMinimumAdminPermissionException)
PELMORA_AUTH_PLAIN_EXCEPTION(AuthRolePermissionsExistException)
PELMORA_AUTH_PLAIN_EXCEPTION(AuthSameRoleException)
PELMORA_AUTH_PLAIN_EXCEPTION(AuthSystemPrivilegeException)
PELMORA_AUTH_PLAIN_EXCEPTION(AuthSystemRoleException)
#undef PELMORA_AUTH_PLAIN_EXCEPTION

// A storage failure; the message is the storage's own text.
class PELMORA_EXPORT AuthStorageException : public AuthException {
public:
   AuthStorageException() = default;
   explicit AuthStorageException(const std::string& message) : AuthException(message) {}
   PELMORA_EXCEPTION_CLONE(AuthStorageException)
};

class PELMORA_EXPORT AuthEntityNotFoundException : public AuthException {
public:
   explicit AuthEntityNotFoundException(const std::string& entityId) : _entityId(entityId) {}
   const std::string& GetEntityId() const { return _entityId; }
   PELMORA_EXCEPTION_CLONE(AuthEntityNotFoundException)

private:
   std::string _entityId;
};

class PELMORA_EXPORT AuthPrivilegeNotFoundException : public AuthException {
public:
   explicit AuthPrivilegeNotFoundException(const std::string& privilegeId) : _privilegeId(privilegeId) {}
   const std::string& GetPrivilegeId() const { return _privilegeId; }
   PELMORA_EXCEPTION_CLONE(AuthPrivilegeNotFoundException)

private:
   std::string _privilegeId;
};

class PELMORA_EXPORT AuthRoleNotFoundException : public AuthException {
public:
   explicit AuthRoleNotFoundException(int roleId) : _roleId(roleId) {}
   int GetRoleId() const { return _roleId; }
   PELMORA_EXCEPTION_CLONE(AuthRoleNotFoundException)

private:
   int _roleId;
};

class PELMORA_EXPORT AuthPermissionNotFoundException : public AuthException {
public:
   AuthPermissionNotFoundException(const std::string& principal, const std::string& entityId, bool isGroup)
      : AuthException(PrincipalMessage(principal, isGroup)), _entityId(entityId) {}
   const std::string& GetEntityId() const { return _entityId; }
   PELMORA_EXCEPTION_CLONE(AuthPermissionNotFoundException)

private:
   std::string _entityId;
};

// The directory says the principal does not exist.
class PELMORA_EXPORT AuthUserNotFoundException : public AuthException {
public:
   AuthUserNotFoundException(const std::string& name, bool isGroup, const std::string& cause = std::string())
      : AuthException(PrincipalMessage(name, isGroup, cause)) {}
   PELMORA_EXCEPTION_CLONE(AuthUserNotFoundException)
};

// The directory could not tell whether the principal exists (its source failed).
class PELMORA_EXPORT AuthUserUnresolvedException : public AuthException {
public:
   AuthUserUnresolvedException(const std::string& name, bool isGroup, const std::string& cause = std::string())
      : AuthException(PrincipalMessage(name, isGroup, cause)) {}
   PELMORA_EXCEPTION_CLONE(AuthUserUnresolvedException)
};

class PELMORA_EXPORT NoPermissionException : public AuthException {
public:
   NoPermissionException(const std::string& entityId, const std::string& privilegeId)
      : _entityId(entityId), _privilegeId(privilegeId) {}
   const std::string& GetEntityId() const { return _entityId; }
   const std::string& GetPrivilegeId() const { return _privilegeId; }
   PELMORA_EXCEPTION_CLONE(NoPermissionException)

private:
   std::string _entityId;
   std::string _privilegeId;
};

}  // namespace Pelmora::Authorize
