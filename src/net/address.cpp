// Binding information texts and address resolution through getaddrinfo.

#include "pelmora/system/address.h"

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <memory>

#include "pelmora/exception/exceptions.h"

namespace Pelmora::System {

std::string InetBindingInfo::ToString() const {
   std::string port = std::to_string(_port);
   return _v6 ? "[" + _address + "]:" + port : _address + ":" + port;
}

std::string LocalBindingInfo::ToString() const { return "unix:" + _path; }

void ResolveAddress(const std::string& host, int port, bool passive,
                    std::vector<Ref<InetBindingInfo>>& out) {
   out.clear();
   addrinfo hints{};
   hints.ai_family = passive && host.empty() ? AF_INET : AF_UNSPEC;
   hints.ai_socktype = SOCK_STREAM;
   hints.ai_flags = AI_NUMERICSERV | (passive ? AI_PASSIVE : 0);
   addrinfo* found = nullptr;
   std::string service = std::to_string(port);
   int rc = getaddrinfo(host.empty() ? nullptr : host.c_str(), service.c_str(), &hints, &found);
   if (rc != 0) throw NotFoundException("Cannot resolve " + host + ": " + gai_strerror(rc));
   std::unique_ptr<addrinfo, void (*)(addrinfo*)> guard(found, freeaddrinfo);
   for (addrinfo* entry = found; entry != nullptr; entry = entry->ai_next) {
      char text[INET6_ADDRSTRLEN] = {};
      if (entry->ai_family == AF_INET) {
         auto* in = reinterpret_cast<sockaddr_in*>(entry->ai_addr);
         inet_ntop(AF_INET, &in->sin_addr, text, sizeof text);
         out.emplace_back(new InetBindingInfo(text, ntohs(in->sin_port), false));
      } else if (entry->ai_family == AF_INET6) {
         auto* in6 = reinterpret_cast<sockaddr_in6*>(entry->ai_addr);
         inet_ntop(AF_INET6, &in6->sin6_addr, text, sizeof text);
         out.emplace_back(new InetBindingInfo(text, ntohs(in6->sin6_port), true));
      }
   }
   if (out.empty()) throw NotFoundException("Cannot resolve " + host + ": no stream address");
}

}  // namespace Pelmora::System
