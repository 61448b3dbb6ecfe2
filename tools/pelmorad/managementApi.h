#pragma once
// pelmorad's SOAP management API at /soap (document/literal, namespace
// "urn:pelmora:management"): GetStatus, QueryCounters, GetConfig, SetConfig, GetLogTail,
// GetThreadStates and Echo, with the WSDL compiled into the binary and served at
// /soap?wsdl. Callers get a session through the "norvex_soap_session" cookie. Bad
// arguments are answered with client faults, failures inside the daemon with server
// faults. Made and stopped by the Daemon; calls run concurrently on pool threads.

#include <mutex>
#include <string>

#include "pelmora/http/httpSvc.h"
#include "pelmora/object/ref.h"
#include "pelmora/soap/soapSvc.h"

namespace Pelmora::Daemon {

class Daemon;

constexpr char kManagementNamespace[] = "urn:pelmora:management";

class ManagementApi {
public:
   explicit ManagementApi(Daemon* daemon);
   ~ManagementApi();
   ManagementApi(const ManagementApi&) = delete;
   ManagementApi& operator=(const ManagementApi&) = delete;

   // Registers the SOAP path (setting "pelmora/soap/path", default "/soap") with the
   // daemon's HTTP service, which must not have been started yet.
   void Start();
   // Unregisters it and ends the sessions; later calls do nothing.
   void Stop();
   // The SOAP service's instance id, a random UUID per process (GetStatus reports it).
   const std::string& GetInstanceId() const;

   // Writes `value` at `path` to the configuration file and, only when that worked, into
   // the running configuration. InvalidRequestException when no file was given, the file
   // cannot be written back (a compressed flat or properties file) or the path cannot
   // hold the value; other exceptions for failed writes. Calls are serialised.
   void SetConfig(const std::string& path, const std::string& value);

private:
   Daemon* _daemon;
   Ref<Soap::HttpSoapSvc> _soap;
   Ref<Http::RequestHandler> _handler;
   std::string _path;
   std::mutex _setMutex;
   bool _started = false;
};

// The embedded WSDL with its soap:address set to `location` (XML-escaped here).
std::string GetManagementWsdl(const std::string& location);

}  // namespace Pelmora::Daemon
