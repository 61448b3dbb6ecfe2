#pragma once
// SOAP services: a SoapSvc carries SOAP 1.1 calls from one transport (HTTP POST, standard
// input and output, or a CGI program) to the application's SoapRequestHandler, with the
// call as a SoapRequest and the answer written through a Reply. A BodyHandlerMap is the
// usual request handler: it parses the envelope and dispatches on the body element.
// Services and handler maps are thread-safe; a request and its reply belong to one call.

#include <string>

#include "pelmora/exception/throwable.h"
#include "pelmora/http/httpSvc.h"
#include "pelmora/http/session.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/config.h"
#include "pelmora/service/logger.h"
#include "pelmora/soap/envelope.h"
#include "pelmora/soap/fault.h"
#include "pelmora/system/functor.h"
#include "pelmora/xml/node.h"

namespace Pelmora::Soap {

// The incoming call: its body as a Reader (-1 at the end; InvalidRequestException
// "SOAP request exceeds N bytes" past the service's request limit) and what came with it.
class PELMORA_EXPORT SoapRequest : public virtual Reader {
public:
   // The request, the failure (null on success) and the bytes placed (-1: body ended).
   using ReadCallback = System::Functor<void, SoapRequest*, Exception*, int>;

   // As Read, completing through `callback`; `buffer` must live until then. One read may
   // be pending at a time (a second is a panic).
   virtual void AsyncRead(char* buffer, int length, const ReadCallback& callback) = 0;
   // The "SOAPAction" without its quotes, "User-Agent" and "norvex_client" values; false
   // when the transport did not carry one.
   virtual bool GetSoapAction(std::string& out) const = 0;
   virtual bool GetUserAgent(std::string& out) const = 0;
   virtual bool GetNorvexClient(std::string& out) const = 0;
   // The caller's HTTP session; false on transports without sessions.
   virtual bool GetSession(Ref<Http::Session>& out) const = 0;
};

// The answer to one call, as "text/xml; charset=utf-8". WriteReply and WriteFault send the
// whole envelope and complete the reply; a second one raises InvalidStateException. A
// reply that cannot be written is logged, and the call ends.
class PELMORA_EXPORT Reply : public virtual Object {
public:
   // `body` goes inside the envelope's Body (null: an empty Body).
   virtual void WriteReply(const Xml::Node* body) = 0;
   // A Fault (CreateFaultNode); `detail`'s children, if given, are moved into its
   // "detail". Over HTTP and CGI a fault is sent with status 500.
   virtual void WriteFault(FaultCode code, const std::string& message, const std::string& actor = std::string(),
                           Xml::Node* detail = nullptr) = 0;
   // Forgets the status and headers set so far and sets the content type again.
   virtual void Reset() = 0;
   virtual bool IsComplete() const = 0;
};

class PELMORA_EXPORT SoapRequestHandler : public virtual Object {
public:
   // Must answer through `reply`; an exception that leaves is answered with a fault.
   virtual void HandleRequest(SoapRequest* request, Reply* reply) = 0;
};

// The body element a BodyHandler serves: its namespace URI (empty: none) and local name.
struct PELMORA_EXPORT BodyHandlerInfo {
   std::string uri;
   std::string name;
};

class PELMORA_EXPORT BodyHandler : public virtual Object {
public:
   virtual void GetBodyHandlerInfo(BodyHandlerInfo& out) const = 0;
   // `header` is the envelope's Header (null when absent), `body` the element served.
   // InvalidRequestException leaving it is answered with a client fault, any other
   // exception with a server fault.
   virtual void HandleBody(SoapRequest* request, Xml::ElementNode* header, Xml::ElementNode* body,
                           Reply* reply) = 0;
};

// Parses each request's envelope and calls the body handler registered for its body
// element. Invalid SOAP and unknown body elements are answered with client faults.
class PELMORA_EXPORT BodyHandlerMap : public virtual SoapRequestHandler {
public:
   // AlreadyExistsException when a handler holds that element already.
   virtual void AddBodyHandler(BodyHandler* handler) = 0;
   // Registers the handler's local name in the map's default version namespace, whatever
   // its own namespace; AlreadyExistsException as above.
   virtual void AddDefaultVersionUriBodyHandler(BodyHandler* handler) = 0;
   virtual void RemoveBodyHandler(const BodyHandlerInfo& info) = 0;
   virtual bool LookupBodyHandler(const BodyHandlerInfo& info, Ref<BodyHandler>& out) = 0;
};

// `logger` may be null (the SOAP layer's logger).
PELMORA_EXPORT void CreateBodyHandlerMap(Service::Logger* logger, const std::string& defaultVersionUri,
                                         Ref<BodyHandlerMap>& out);

class PELMORA_EXPORT SoapSvc : public virtual Object {
public:
   virtual void SetSoapRequestHandler(SoapRequestHandler* handler) = 0;
   virtual void GetSoapRequestHandler(Ref<SoapRequestHandler>& out) = 0;
   // Reads the settings and begins serving.
   virtual void Start() = 0;
   virtual void Stop() = 0;
   // A random UUID made when the service was.
   virtual const std::string& GetInstanceId() const = 0;
};

// SOAP over HTTP. Settings under "pelmora/soap" (docs/soap.md): "path" (default "/soap")
// and "serviceStatePath" (default "/serviceState") are the paths Start registers with the
// HTTP service; "enableChunkedResponses" (false); "maxRequestBytes" (10 MiB);
// "maxSessionCount" (10000; 0: no sessions) and "sessionTimeout" (seconds, 1800; 0 or less:
// never) for the sessions named by the cookie "norvex_soap_session"; "wsdlRoot" (none).
class PELMORA_EXPORT HttpSoapSvc : public virtual SoapSvc {
public:
   // The directory whose documents GET ".../name?wsdl" serves; empty: none.
   virtual void SetWsdlRoot(const std::string& directory) = 0;
   // The HTTP handler, for registering at further paths.
   virtual void GetHttpRequestHandler(Ref<Http::RequestHandler>& out) = 0;
   // Null before Start and after Stop.
   virtual void GetSessionService(Ref<Http::SessionService>& out) = 0;
};

// SOAP over standard input and output, or as a CGI program: one request per process.
class PELMORA_EXPORT StdinSoapSvc : public virtual SoapSvc {
public:
   // Reads the request from standard input, dispatches it and writes the answer to
   // standard output; returns the exit status (0, or 1 when the request failed).
   virtual int HandleStdin() = 0;
   // Logs and ends the process with `status`.
   [[noreturn]] virtual void Exit(int status) = 0;
};

// `logger` may be null (the SOAP layer's logger); settings from the application's
// configuration, or from `view` (the "pelmora/soap" subtree; null: defaults).
PELMORA_EXPORT void CreateSoapSvcOnHttp(Service::Logger* logger, Http::HttpSvc* httpSvc, Ref<SoapSvc>& out);
PELMORA_EXPORT void CreateSoapSvcOnHttp(Service::Logger* logger, Http::HttpSvc* httpSvc, Service::Config::View* view,
                                        Ref<HttpSoapSvc>& out);
// Loggers "SoapSvcOnStdio" and "CgiSoapSvc" under `logger` (null: the SOAP layer's).
PELMORA_EXPORT void CreateSoapSvcOnStdio(Service::Logger* logger, Ref<SoapSvc>& out);
PELMORA_EXPORT void CreateSoapSvcOnStdio(Service::Logger* logger, Ref<StdinSoapSvc>& out);
PELMORA_EXPORT void CreateCgiSoapSvc(Service::Logger* logger, Ref<SoapSvc>& out);
PELMORA_EXPORT void CreateCgiSoapSvc(Service::Logger* logger, Ref<StdinSoapSvc>& out);

}  // namespace Pelmora::Soap
