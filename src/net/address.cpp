// Binding information texts and address resolution.

#include "pelmora/system/address.h"

namespace Pelmora::System {

std::string InetBindingInfo::ToString() const {
   std::string port = std::to_string(_port);
   return _v6 ? "[" + _address + "]:" + port : _address + ":" + port;
}

std::string LocalBindingInfo::ToString() const { return "unix:" + _path; }

}  // namespace Pelmora::System
