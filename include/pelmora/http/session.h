#pragma once
// Server-side HTTP sessions. A SessionService hands each client a session named by a
// cookie holding 128 random bits, caps how many sessions exist and ends sessions left
// idle longer than its time-out (checked on a pool timer). A session's authenticated
// flag decides whether its connection runs under the authenticated time-outs.
// Thread-safe: sessions and the service may be used from any thread.

#include <cstddef>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/logger.h"

namespace Pelmora::Http {

class Request;
class Response;

class PELMORA_EXPORT Session : public virtual Object {
public:
   // 32 lower-case hex digits; the cookie's value.
   virtual std::string GetId() const = 0;
   virtual bool IsAuthenticated() const = 0;
   virtual void SetAuthenticated(bool authenticated) = 0;
   // Application values kept with the session; a null value removes the name.
   virtual void SetAttribute(const std::string& name, Object* value) = 0;
   virtual bool GetAttribute(const std::string& name, Ref<Object>& out) const = 0;
   // Ends the session now: its cookie no longer resolves to it.
   virtual void Invalidate() = 0;
   virtual bool IsValid() const = 0;
};

struct PELMORA_EXPORT SessionServiceConfig {
   std::string cookieName = "pelmora_session";
   std::string cookiePath = "/";
   // Sessions that may exist at once; a new one past it is refused.
   size_t maxSessionCount = 10000;
   // Microseconds a session may stay unused; negative: never expires.
   long long idleTimeout = 30LL * 60 * 1000000;
   // How often idle sessions are looked for, in microseconds.
   long long expiryInterval = 60LL * 1000000;
};

class PELMORA_EXPORT SessionService : public virtual Object {
public:
   // The live session the request's cookie names (its idle clock restarted), or a new
   // one whose cookie is added to the response. False, with `out` null, when a new
   // session would pass the maximum count.
   virtual bool ResolveSession(Request* request, Response* response, Ref<Session>& out) = 0;
   // The live session named `id`, its idle clock restarted as by ResolveSession.
   virtual bool LookupSession(const std::string& id, Ref<Session>& out) = 0;
   virtual size_t GetSessionCount() = 0;
   // Ends every session idle longer than the time-out; returns how many ended.
   virtual size_t ExpireIdleSessions() = 0;
   // Stops the expiry timer and ends every session.
   virtual void Shutdown() = 0;
};

// A running service; `logger` may be null (the HTTP layer's logger).
PELMORA_EXPORT void CreateSessionService(const SessionServiceConfig& config, Service::Logger* logger,
                                         Ref<SessionService>& out);

// ResolveSession on `service`, and on success attaches the session to the response so
// that the connection follows the session's authenticated flag.
PELMORA_EXPORT bool ResolveSession(SessionService* service, Request* request, Response* response,
                                   Ref<Session>& out);

}  // namespace Pelmora::Http
