#include "pelmora/authorize/exceptions.h"

namespace Pelmora::Authorize {

std::string PrincipalMessage(const std::string& name, bool isGroup, const std::string& cause) {
   std::string message = (isGroup ? "Group " : "User ") + name;
   if (!cause.empty()) message += ", cause: " + cause;
   return message;
}

}  // namespace Pelmora::Authorize
