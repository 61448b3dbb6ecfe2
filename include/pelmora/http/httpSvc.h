#pragma once
// The HTTP server: an HttpSvc accepts connections on a server socket, reads requests one
// after another on each connection, and hands each to the RequestHandler registered for
// the longest matching path prefix (or the default one). Idle connections wait without a
// thread; the limits below protect it from slow, idle and oversized clients.
// Thread-safe; handlers run on pool threads, one request of a connection at a time.

#include <map>
#include <unordered_map>
#include <string>

#include "pelmora/http/request.h"
#include "pelmora/http/response.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/config.h"
#include "pelmora/service/logger.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/socket.h"

namespace Pelmora::Http {

// Answers requests; one operation per verb. Handlers may be shared by several paths and
// services and are called concurrently for different connections.
class PELMORA_EXPORT RequestHandler : public virtual Object {
public:
   virtual void HandleDelete(Request* request, Response* response) = 0;
   virtual void HandlePost(Request* request, Response* response) = 0;
   virtual void HandleHead(Request* request, Response* response) = 0;
   virtual void HandleGet(Request* request, Response* response) = 0;
   virtual void HandlePut(Request* request, Response* response) = 0;
};

// A base that refuses every verb with 400; a handler overrides the verbs it serves.
class PELMORA_EXPORT RequestHandlerMixin : public virtual RequestHandler {
public:
   void HandleDelete(Request* request, Response* response) override;
   void HandlePost(Request* request, Response* response) override;
   void HandleHead(Request* request, Response* response) override;
   void HandleGet(Request* request, Response* response) override;
   void HandlePut(Request* request, Response* response) override;

protected:
   void Unsupported(const char* verb, Request* request, Response* response);
};

using RequestHandlerMap = std::unordered_map<std::string, Ref<RequestHandler>>;

// The handler for `path`: exact matches of successively shorter prefixes ("/a/b/",
// "/a/b", "/a"); query and fragment are cut like segments. False when none matches.
PELMORA_EXPORT bool LookupByPrefix(const std::string& path, const RequestHandlerMap& handlers,
                                   Ref<RequestHandler>& out, Service::Logger* logger = nullptr);

// The service's settings, read once from "pelmora/http" (keys and defaults: docs/http.md).
// Immutable after construction and shared by every connection.
class PELMORA_EXPORT HttpSvcConfig {
public:
   // Every default; `view` (may be null) overrides them, each applied setting logged.
   HttpSvcConfig(Service::Logger* logger, Service::Config::View* view);

   long long defaultReadTimeout = 45000000;
   long long defaultWriteTimeout = 45000000;
   long long authenticatedReadTimeout = 1200000000;
   long long authenticatedWriteTimeout = 1800000000;
   std::string nonChunkingAgents;
   std::string agentsNeedingContentLength;
   long long maxBufferedResponseBytes = -1;
   bool xFrameOptionsEnabled = true;
   std::string xFrameOptions = "DENY";
   long long maxRequestBodyBytes = 10 * 1024 * 1024;
   int maxHeaderFields = 100;
   long long requestDeadline = 30000000;
   int maxConnections = 10000;
   long long shutdownDeadline = 10000000;
   bool accessLog = false;
};

class PELMORA_EXPORT HttpSvc : public virtual Object {
public:
   // Begins accepting. InvalidStateException "ServerSocket not set" or "No RequestHandler
   // has been set" when it cannot.
   virtual void Start() = 0;
   // Listens on `socket` as well (the service may listen on several: TCP, Unix, TLS).
   // A socket added while the service runs starts accepting at once; Stop closes it.
   virtual void AddServerSocket(System::ServerSocket* socket) = 0;
   // Stops accepting, closes idle connections at once and lets requests in progress
   // finish until the shutdown deadline; what is left then is closed and logged.
   virtual void Stop() = 0;
   virtual void SetRequestHandler(RequestHandler* handler) = 0;
   virtual void GetRequestHandler(Ref<RequestHandler>& out) = 0;
   virtual void AddRequestHandler(const std::string& path, RequestHandler* handler) = 0;
   virtual void RemoveRequestHandler(const std::string& path) = 0;
   virtual long long GetDefaultReadTimeout() = 0;
   virtual long long GetDefaultWriteTimeout() = 0;
   virtual long long GetAuthenticatedReadTimeout() = 0;
   virtual long long GetAuthenticatedWriteTimeout() = 0;
   // Connections currently open.
   virtual int GetConnectionCount() = 0;
};

// A stopped service on `socket`, logging under a child "HTTPService" of `logger` (null:
// the HTTP layer's logger), its settings from the application's configuration.
PELMORA_EXPORT void CreateHttpSvc(System::ServerSocket* socket, Service::Logger* logger, Ref<HttpSvc>& out);
// As above with settings taken from `view` ("pelmora/http" subtree; null: defaults).
PELMORA_EXPORT void CreateHttpSvc(System::ServerSocket* socket, Service::Logger* logger,
                                  Service::Config::View* view, Ref<HttpSvc>& out);

}  // namespace Pelmora::Http
