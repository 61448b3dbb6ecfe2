#include "pelmora/http/session.h"

#include <sys/random.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <map>
#include <mutex>
#include <unordered_map>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/cookie.h"
#include "pelmora/http/request.h"
#include "pelmora/http/response.h"
#include "pelmora/object/weak.h"
#include "pelmora/perfCounter/registry.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/system/threadPool.h"
#include "src/http/httpLog.h"
#include "src/http/sessionImpl.h"

namespace Pelmora::Http {

namespace {

constexpr size_t kIdBytes = 16;
constexpr size_t kIdLength = 2 * kIdBytes;

long long Now() {
   return std::chrono::duration_cast<std::chrono::microseconds>(
              std::chrono::steady_clock::now().time_since_epoch())
       .count();
}

std::string NewId() {
   unsigned char bytes[kIdBytes];
   size_t got = 0;
   while (got < kIdBytes) {
      ssize_t n = ::getrandom(bytes + got, kIdBytes - got, 0);
      if (n < 0) {
         if (errno == EINTR) continue;
         throw SystemException(errno);
      }
      got += static_cast<size_t>(n);
   }
   static const char kDigits[] = "0123456789abcdef";
   std::string id(kIdLength, '0');
   for (size_t i = 0; i < kIdBytes; ++i) {
      id[2 * i] = kDigits[bytes[i] >> 4];
      id[2 * i + 1] = kDigits[bytes[i] & 0xF];
   }
   return id;
}

// What a service counts, read by the counter registry; kept apart from the service so
// that the registry does not hold it.
class SessionStats : public virtual PerfCounter::GroupPublisher, public ObjectImpl {
public:
   enum { ACTIVE, CREATED, EXPIRED, REFUSED, COUNT };
   static constexpr const char* kNames[COUNT] = {"Active", "Created", "Expired", "Refused"};

   void CollectValues(RefVector<PerfCounter::Metadata>&, std::vector<PerfCounter::Value>& values) override {
      values.clear();
      for (const auto& value : _values) values.emplace_back(value.load(std::memory_order_relaxed));
   }
   void Add(int which, long long n) { _values[which].fetch_add(n, std::memory_order_relaxed); }
   void Set(int which, long long n) { _values[which].store(n, std::memory_order_relaxed); }

private:
   std::atomic<long long> _values[COUNT] = {};
};

class SessionServiceImpl;

class SessionImpl : public virtual Session, public ObjectImpl {
public:
   SessionImpl(std::string id, SessionServiceImpl* service, long long now);

   std::string GetId() const override { return _id; }
   bool IsAuthenticated() const override { return _authenticated.load(std::memory_order_acquire); }
   void SetAuthenticated(bool authenticated) override {
      _authenticated.store(authenticated, std::memory_order_release);
   }
   void SetAttribute(const std::string& name, Object* value) override {
      Ref<Object> held(value);  // an ended session does not keep it
      Ref<Object> old;          // released outside the lock: its destructor may reach back here
      std::lock_guard<std::mutex> lock(_mutex);
      auto at = _attributes.find(name);
      if (value == nullptr) {
         if (at == _attributes.end()) return;
         old = std::move(at->second);
         _attributes.erase(at);
      } else if (_valid) {
         if (at == _attributes.end()) {
            _attributes.emplace(name, std::move(held));
         } else {
            old = std::move(at->second);
            at->second = std::move(held);
         }
      }
   }
   bool GetAttribute(const std::string& name, Ref<Object>& out) const override {
      std::lock_guard<std::mutex> lock(_mutex);
      auto at = _attributes.find(name);
      if (at == _attributes.end()) {
         out.Reset();
         return false;
      }
      out = at->second;
      return true;
   }
   void Invalidate() override;
   bool IsValid() const override {
      std::lock_guard<std::mutex> lock(_mutex);
      return _valid;
   }
   using ObjectImpl::ToString;
   std::string ToString() const override { return "Session " + _id; }

   // Marks the session ended and lets go of its values (they may refer back to it).
   // False when it had ended already.
   bool End() {
      std::map<std::string, Ref<Object>> values;
      {
         std::lock_guard<std::mutex> lock(_mutex);
         if (!_valid) return false;
         _valid = false;
         values.swap(_attributes);
      }
      return true;
   }
   // Both under the service's lock.
   long long GetLastAccess() const { return _lastAccess; }
   void Touch(long long now) { _lastAccess = now; }

private:
   const std::string _id;
   WeakRef<SessionServiceImpl> _service;
   long long _lastAccess;
   std::atomic<bool> _authenticated{false};
   mutable std::mutex _mutex;
   bool _valid = true;
   std::map<std::string, Ref<Object>> _attributes;
};

// The timer holds only a weak link to the service, so an unused service still goes away;
// users call Shutdown to stop the timer at once.
class SessionServiceImpl : public virtual SessionService, public WeakLinkableImpl<ObjectImpl> {
public:
   SessionServiceImpl(const SessionServiceConfig& config, Service::Logger* logger)
       : _config(config), _logger(logger != nullptr ? logger : GetHttpLogger()) {
      // Refuse a cookie name or path that could not go out in Set-Cookie now, not per request.
      Ref<Cookie> probe;
      CreateCookie(_config.cookieName, std::string(kIdLength, '0'), probe);
      probe->SetPath(_config.cookiePath);
      PublishStats();
   }
   // Sessions still referred to elsewhere end with their service.
   ~SessionServiceImpl() override {
      if (_timer) _timer->Cancel();
      if (_statsItem) _statsItem->Unregister();
      for (auto& [id, session] : _sessions) session->End();
   }

   void StartTimer() {
      std::lock_guard<std::mutex> lock(_timerMutex);
      ScheduleNext();
   }

   bool ResolveSession(Request* request, Response* response, Ref<Session>& out) override;
   bool LookupSession(const std::string& id, Ref<Session>& out) override;
   size_t GetSessionCount() override {
      std::lock_guard<std::mutex> lock(_mutex);
      return _sessions.size();
   }
   size_t ExpireIdleSessions() override;
   void Shutdown() override;
   using ObjectImpl::ToString;
   std::string ToString() const override { return "SessionService " + _config.cookieName; }

   // The session left the map on its own (Invalidate).
   void Remove(SessionImpl* session) {
      Ref<SessionImpl> held;  // dropped outside the lock
      std::lock_guard<std::mutex> lock(_mutex);
      auto at = _sessions.find(session->GetId());
      if (at != _sessions.end() && at->second.Get() == session) {
         held = std::move(at->second);
         _sessions.erase(at);
         _stats->Set(SessionStats::ACTIVE, static_cast<long long>(_sessions.size()));
      }
   }

private:
   // The live session named `id`, its clock restarted; one found idle past the
   // time-out is taken out into `expired` instead, to be ended outside the lock.
   // Under _mutex.
   bool FindLocked(const std::string& id, long long now, Ref<SessionImpl>& out,
                   std::vector<Ref<SessionImpl>>& expired) {
      auto at = _sessions.find(id);
      if (at == _sessions.end()) return false;
      if (IsIdle(at->second.Get(), now)) {
         expired.push_back(std::move(at->second));
         _sessions.erase(at);
         _stats->Add(SessionStats::EXPIRED, 1);
         _stats->Set(SessionStats::ACTIVE, static_cast<long long>(_sessions.size()));
         return false;
      }
      at->second->Touch(now);
      out = at->second;
      return true;
   }
   // Under "/Http/Sessions/Cookie='<name>'/" in the process's registry. A second service
   // with the same cookie name goes without.
   void PublishStats() {
      RefVector<PerfCounter::Metadata> metadata;
      for (int i = 0; i < SessionStats::COUNT; ++i) {
         metadata.push_back(new PerfCounter::Metadata(
             "/Http/Sessions/Cookie='" + _config.cookieName + "'/" + SessionStats::kNames[i],
             i == SessionStats::ACTIVE ? PerfCounter::Metadata::TYPE_GAUGE : PerfCounter::Metadata::TYPE_COUNTER));
      }
      try {
         PerfCounter::GetCounterRegistry()->RegisterGroup(metadata, _stats.Get(), _statsItem);
      } catch (const Exception& e) {
         PELMORA_LOG_VERBOSE(_logger.Get(), "Sessions of cookie %1 publish no counters: %2", _config.cookieName,
                             e.GetMessage());
      }
   }
   bool IsIdle(SessionImpl* session, long long now) const {
      return _config.idleTimeout >= 0 && now - session->GetLastAccess() > _config.idleTimeout;
   }
   // Under _timerMutex.
   void ScheduleNext() {
      if (_stopped || _config.idleTimeout < 0 || _config.expiryInterval <= 0) return;
      System::ThreadPool* pool = System::GetThreadPool();
      if (pool == nullptr) return;
      WeakRef<SessionServiceImpl> weak(this);
      pool->ScheduleTimer(
          [weak] {
             if (Ref<SessionServiceImpl> self = weak.Promote()) self->TimerFired();
          },
          _config.expiryInterval, _timer);
   }
   // Holds _timerMutex throughout, so Shutdown waits for an expiry in progress.
   void TimerFired() {
      std::lock_guard<std::mutex> lock(_timerMutex);
      if (_stopped) return;
      ExpireIdleSessions();
      ScheduleNext();
   }

   const SessionServiceConfig _config;
   Ref<Service::Logger> _logger;
   Ref<SessionStats> _stats{new SessionStats()};
   Ref<PerfCounter::RegistryItem> _statsItem;

   std::mutex _timerMutex;  // taken before _mutex
   bool _stopped = false;
   Ref<System::ScheduledItem> _timer;

   std::mutex _mutex;
   std::unordered_map<std::string, Ref<SessionImpl>> _sessions;
   // A refusal was logged and no session was made since.
   bool _refusing = false;
};

SessionImpl::SessionImpl(std::string id, SessionServiceImpl* service, long long now)
    : _id(std::move(id)), _service(service), _lastAccess(now) {}

void SessionImpl::Invalidate() {
   if (!End()) return;
   if (Ref<SessionServiceImpl> service = _service.Promote()) service->Remove(this);
}

bool SessionServiceImpl::ResolveSession(Request* request, Response* response, Ref<Session>& out) {
   out.Reset();
   long long now = Now();
   Ref<SessionImpl> found;
   std::vector<Ref<SessionImpl>> expired;
   RefList<Cookie> cookies;
   request->GetCookieList(cookies);
   {
      std::lock_guard<std::mutex> lock(_mutex);
      for (const Ref<Cookie>& cookie : cookies) {
         if (cookie->GetName() != _config.cookieName || !IsSessionIdShape(cookie->GetValue())) continue;
         if (FindLocked(cookie->GetValue(), now, found, expired)) break;
      }
   }
   for (const Ref<SessionImpl>& session : expired) session->End();
   if (found) {
      out = found;
      return true;
   }

   Ref<SessionImpl> made;
   bool logRefusal = false;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_sessions.size() >= _config.maxSessionCount) {
         logRefusal = !_refusing;
         _refusing = true;
         _stats->Add(SessionStats::REFUSED, 1);
      } else {
         std::string id;
         do {
            id = NewId();
         } while (_sessions.count(id) != 0);
         made = new SessionImpl(id, this, now);
         _sessions.emplace(id, made);
         _refusing = false;
         _stats->Add(SessionStats::CREATED, 1);
         _stats->Set(SessionStats::ACTIVE, static_cast<long long>(_sessions.size()));
      }
   }
   if (!made) {
      if (logRefusal) {
         PELMORA_LOG_WARNING(_logger.Get(), "Refusing new HTTP sessions: %1 sessions exist, the maximum",
                             static_cast<long long>(_config.maxSessionCount));
      }
      return false;
   }
   Ref<Cookie> cookie;
   CreateCookie(_config.cookieName, made->GetId(), cookie);
   cookie->SetPath(_config.cookiePath);
   cookie->SetHttpOnly(true);
   cookie->SetSameSite("Strict");
   if (response->IsSecure()) cookie->SetSecure(true);
   response->AddCookie(cookie.Get());
   out = made;
   return true;
}

bool SessionServiceImpl::LookupSession(const std::string& id, Ref<Session>& out) {
   out.Reset();
   if (!IsSessionIdShape(id)) return false;
   Ref<SessionImpl> found;
   std::vector<Ref<SessionImpl>> expired;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      FindLocked(id, Now(), found, expired);
   }
   for (const Ref<SessionImpl>& session : expired) session->End();
   out = found;
   return found.Get() != nullptr;
}

size_t SessionServiceImpl::ExpireIdleSessions() {
   std::vector<Ref<SessionImpl>> expired;
   long long now = Now();
   {
      std::lock_guard<std::mutex> lock(_mutex);
      for (auto at = _sessions.begin(); at != _sessions.end();) {
         if (IsIdle(at->second.Get(), now)) {
            expired.push_back(std::move(at->second));
            at = _sessions.erase(at);
         } else {
            ++at;
         }
      }
      _stats->Add(SessionStats::EXPIRED, static_cast<long long>(expired.size()));
      _stats->Set(SessionStats::ACTIVE, static_cast<long long>(_sessions.size()));
   }
   for (const Ref<SessionImpl>& session : expired) session->End();
   if (!expired.empty()) {
      PELMORA_LOG_VERBOSE(_logger.Get(), "Ended %1 idle HTTP sessions", static_cast<long long>(expired.size()));
   }
   return expired.size();
}

void SessionServiceImpl::Shutdown() {
   {
      std::lock_guard<std::mutex> lock(_timerMutex);
      _stopped = true;
      if (_timer) _timer->Cancel();
      _timer.Reset();
   }
   std::unordered_map<std::string, Ref<SessionImpl>> ended;
   Ref<PerfCounter::RegistryItem> statsItem;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      ended.swap(_sessions);
      statsItem = std::move(_statsItem);
      _stats->Set(SessionStats::ACTIVE, 0);
   }
   if (statsItem) statsItem->Unregister();
   for (auto& [id, session] : ended) session->End();
}

}  // namespace

bool IsSessionIdShape(const std::string& text) {
   if (text.size() != kIdLength) return false;
   for (char c : text) {
      if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'))) return false;
   }
   return true;
}

bool IsAuthenticatedResponse(Response* response) {
   if (response->IsUsingAuthenticatedTimeout()) return true;
   Ref<Object> attached;
   response->GetSession(attached);
   auto* session = dynamic_cast<Session*>(attached.Get());
   return session != nullptr && session->IsAuthenticated();
}

void CreateSessionService(const SessionServiceConfig& config, Service::Logger* logger, Ref<SessionService>& out) {
   Ref<SessionServiceImpl> service = new SessionServiceImpl(config, logger);
   service->StartTimer();
   out = service;
}

bool ResolveSession(SessionService* service, Request* request, Response* response, Ref<Session>& out) {
   if (!service->ResolveSession(request, response, out)) return false;
   response->SetSession(out.Get());
   return true;
}

}  // namespace Pelmora::Http
