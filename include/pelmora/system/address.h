#pragma once
// Binding information: where one end of a stream is bound. InetBindingInfo holds an IPv4
// or IPv6 address and port, LocalBindingInfo a Unix-domain socket path. Streams hand
// them out through Stream::GetBindingInfo; the HTTP server logs and checks them;
// ResolveAddress turns host names into them. The
// objects are immutable once made, so they may be shared between threads.

#include <string>
#include <vector>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::System {

class PELMORA_EXPORT BindingInfo : public virtual Object {
public:
   // The numeric address ("127.0.0.1", "::1") or the socket path; empty when unnamed.
   virtual const std::string& GetAddress() const = 0;
   // The port, or -1 where the kind of binding has none.
   virtual int GetPort() const = 0;
};

class PELMORA_EXPORT InetBindingInfo : public virtual BindingInfo, public ObjectImpl {
public:
   InetBindingInfo(std::string address, int port, bool v6)
       : _address(std::move(address)), _port(port), _v6(v6) {}
   const std::string& GetAddress() const override { return _address; }
   int GetPort() const override { return _port; }
   bool IsV6() const { return _v6; }
   using ObjectImpl::ToString;
   // "127.0.0.1:80", "[::1]:80".
   std::string ToString() const override;

private:
   std::string _address;
   int _port;
   bool _v6;
};

class PELMORA_EXPORT LocalBindingInfo : public virtual BindingInfo, public ObjectImpl {
public:
   explicit LocalBindingInfo(std::string path) : _path(std::move(path)) {}
   const std::string& GetAddress() const override { return _path; }
   int GetPort() const override { return -1; }
   using ObjectImpl::ToString;
   // "unix:" and the path.
   std::string ToString() const override;

private:
   std::string _path;
};

// The numeric addresses of `host` (a name or a numeric IPv4 or IPv6 address) with
// `port`, in the resolver's order; `passive` for listening (empty host: every IPv4
// address). NotFoundException with the resolver's text when there are none.
PELMORA_EXPORT void ResolveAddress(const std::string& host, int port, bool passive,
                                   std::vector<Ref<InetBindingInfo>>& out);

}  // namespace Pelmora::System
