#include <cstdio>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/app.h"
#include "pelmora/service/logMacros.h"
#include "src/http/httpLog.h"
#include "src/http/httpSvcImpl.h"

namespace Pelmora::Http {

using Service::Logger;

namespace {

// The maker's desktop clients, which take neither chunked bodies nor bodies without a
// length.
const char* const kDefaultNonChunkingAgents = "Norvex-desktop/.*|Norvex-console/1\\..*";
const char* const kDefaultAgentsNeedingLength = "Norvex-desktop/.*|Norvex-client/3.*";

void ReadTimeout(Logger* logger, Service::Config::View* view, const char* key, long long& out) {
   long long ms = 0;
   if (view == nullptr || !view->Get(key, &ms)) ms = out / 1000;
   out = ms > 0 ? ms * 1000 : ms;
   if (ms < 0)
      PELMORA_LOG_INFO(logger, "Setting %1 to %2 %3", key, ms, "disabled");
   else
      PELMORA_LOG_INFO(logger, "Setting %1 to %2 %3", key, ms, "ms");
}

bool ValidXFrameOptions(const std::string& value) {
   return value == "DENY" || value == "SAMEORIGIN" || value.rfind("ALLOW-FROM ", 0) == 0;
}

}  // namespace

HttpSvcConfig::HttpSvcConfig(Logger* logger, Service::Config::View* view) {
   if (logger == nullptr) logger = GetHttpLogger();
   nonChunkingAgents = kDefaultNonChunkingAgents;
   agentsNeedingContentLength = kDefaultAgentsNeedingLength;
   ReadTimeout(logger, view, "readTimeoutMs", defaultReadTimeout);
   ReadTimeout(logger, view, "writeTimeoutMs", defaultWriteTimeout);
   ReadTimeout(logger, view, "authenticatedReadTimeoutMs", authenticatedReadTimeout);
   ReadTimeout(logger, view, "authenticatedWriteTimeoutMs", authenticatedWriteTimeout);
   ReadTimeout(logger, view, "requestDeadlineMs", requestDeadline);
   ReadTimeout(logger, view, "shutdownDeadlineMs", shutdownDeadline);
   if (view == nullptr) return;
   unsigned int bufferSize = 0;
   if (view->Get("buffersize", &bufferSize)) {
      PELMORA_LOG_INFO(logger, "Setting buffer size to %1", bufferSize);
      SetBufferSize(bufferSize);
   }
   if (view->Get("maxBufferedResponseBytes", &maxBufferedResponseBytes))
      PELMORA_LOG_INFO(logger, "Max buffered response size is %1 bytes", maxBufferedResponseBytes);
   if (view->Get("maxRequestBodyBytes", &maxRequestBodyBytes))
      PELMORA_LOG_INFO(logger, "Max request body size is %1 bytes", maxRequestBodyBytes);
   if (view->Get("maxHeaderFields", &maxHeaderFields))
      PELMORA_LOG_INFO(logger, "Max header fields is %1", maxHeaderFields);
   if (view->Get("maxConnections", &maxConnections))
      PELMORA_LOG_INFO(logger, "Max open connections is %1", maxConnections);
   if (view->Get("accessLog", &accessLog)) PELMORA_LOG_INFO(logger, "Access log is %1", accessLog ? "on" : "off");
   view->Get("EnableXFrameOptionsHeader", &xFrameOptionsEnabled);
   std::string frame;
   if (view->Get("XFrameOptionsHeader", &frame)) {
      if (ValidXFrameOptions(frame)) {
         xFrameOptions = frame;
      } else {
         PELMORA_LOG_WARNING(logger,
                             "Invalid value provided for X-Frame-Options response header: %1. Set to default value.",
                             frame);
      }
   }
   std::string agents;
   if (view->Get("nonChunkingAgents", &agents)) nonChunkingAgents = agents;
   if (view->Get("agentsNeedingContentLength", &agents)) agentsNeedingContentLength = agents;
}

bool LookupByPrefix(const std::string& path, const RequestHandlerMap& handlers, Ref<RequestHandler>& out,
                    Logger* logger) {
   if (logger == nullptr) logger = GetHttpLogger();
   PELMORA_LOG_TRIVIA(logger, "Lookup handler by prefix for: %1", path);
   std::string candidate = path;
   for (;;) {
      if (candidate.empty()) {
         PELMORA_LOG_TRIVIA(logger, "No match found for: %1", path);
         return false;
      }
      PELMORA_LOG_TRIVIA(logger, "Inspecting path: %1", candidate);
      auto found = handlers.find(candidate);
      if (found != handlers.end()) {
         PELMORA_LOG_TRIVIA(logger, "Found matching path: %1", candidate);
         out = found->second;
         return true;
      }
      if (candidate.size() >= 2 && candidate.back() == '/') {
         candidate.pop_back();
         continue;
      }
      size_t cut = candidate.find_last_of("/?#");
      if (cut == std::string::npos) {
         PELMORA_LOG_TRIVIA(logger, "No match found for: %1", path);
         return false;
      }
      candidate.resize(cut);
   }
}

bool IsValidUtf8(const std::string& text) {
   const auto* p = reinterpret_cast<const unsigned char*>(text.data());
   const auto* end = p + text.size();
   while (p < end) {
      unsigned char c = *p++;
      if (c < 0x80) continue;
      int more;
      unsigned int value;
      if (c >= 0xC2 && c <= 0xDF) {
         more = 1;
         value = c & 0x1F;
      } else if (c >= 0xE0 && c <= 0xEF) {
         more = 2;
         value = c & 0x0F;
      } else if (c >= 0xF0 && c <= 0xF4) {
         more = 3;
         value = c & 0x07;
      } else {
         return false;
      }
      if (end - p < more) return false;
      for (int i = 0; i < more; ++i) {
         if ((p[i] & 0xC0) != 0x80) return false;
         value = (value << 6) | (p[i] & 0x3F);
      }
      p += more;
      if ((more == 2 && value < 0x800) || (more == 3 && value < 0x10000) || value > 0x10FFFF ||
          (value >= 0xD800 && value <= 0xDFFF))
         return false;
   }
   return true;
}

HttpSvcImpl::HttpSvcImpl(System::ServerSocket* socket, Logger* logger, Service::Config::View* view)
    : _logger([&] {
         Ref<Logger> child;
         (logger != nullptr ? logger : GetHttpLogger())->CreateLogger("HTTPService", child);
         return child;
      }()),
      _config(_logger.Get(), view),
      _socket(socket) {
   _logger->CreateLogger("HttpConnection", _connectionLogger);
   if (socket != nullptr) _listeners.push_back(MakeListener(socket));
   CompileAgents(view);
}

HttpSvcImpl::~HttpSvcImpl() { StopWatcher(); }

void HttpSvcImpl::StopWatcher() {
   std::thread watcher;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      _watcherStop = true;
      watcher.swap(_watcher);
   }
   _changed.notify_all();
   if (!watcher.joinable()) return;
   // The watcher may hold the last reference and so end the service on its own thread.
   if (watcher.get_id() == std::this_thread::get_id())
      watcher.detach();
   else
      watcher.join();
}

void HttpSvcImpl::CompileAgents(Service::Config::View* view) {
   struct Item {
      const char* key;
      const char* fallback;
      std::string* text;
      std::regex* compiled;
      bool* have;
   };
   Item items[] = {
       {"nonChunkingAgents", kDefaultNonChunkingAgents, &_config.nonChunkingAgents, &_nonChunking,
        &_haveNonChunking},
       {"agentsNeedingContentLength", kDefaultAgentsNeedingLength, &_config.agentsNeedingContentLength,
        &_needsLength, &_haveNeedsLength},
   };
   for (Item& item : items) {
      bool configured = view != nullptr && view->IsSet(item.key);
      if (item.text->empty()) {
         PELMORA_LOG_INFO(_logger.Get(), "Parameter %1 is empty", item.key);
         continue;
      }
      try {
         *item.compiled = std::regex(*item.text, std::regex::extended);
         *item.have = true;
         if (configured)
            PELMORA_LOG_INFO(_logger.Get(), "Loaded %1: '%2'", item.key, *item.text);
         else
            PELMORA_LOG_INFO(_logger.Get(), "Using default for %1: '%2'", item.key, *item.text);
      } catch (const std::regex_error&) {
         PELMORA_LOG_WARNING(_logger.Get(), "Unable to parse %1: '%2'.  Using default: '%3'", item.key,
                             *item.text, item.fallback);
         *item.text = item.fallback;
         *item.compiled = std::regex(*item.text, std::regex::extended);
         *item.have = true;
      }
   }
}

bool HttpSvcImpl::IsNonChunkingAgent(const std::string& agent) const {
   return _haveNonChunking && std::regex_match(agent, _nonChunking);
}

bool HttpSvcImpl::NeedsContentLength(const std::string& agent) const {
   return _haveNeedsLength && std::regex_match(agent, _needsLength);
}

void HttpSvcImpl::ClassifyAgent(const std::string& agent, bool& nonChunking, bool& needsLength) {
   {
      std::lock_guard<std::mutex> lock(_agentMutex);
      if (_lastAgentKnown && _lastAgent == agent) {
         nonChunking = _lastAgentNonChunking;
         needsLength = _lastAgentNeedsLength;
         return;
      }
   }
   // The expressions run outside the lock; two threads may both work out a new agent.
   nonChunking = IsNonChunkingAgent(agent);
   needsLength = NeedsContentLength(agent);
   std::lock_guard<std::mutex> lock(_agentMutex);
   _lastAgent = agent;
   _lastAgentNonChunking = nonChunking;
   _lastAgentNeedsLength = needsLength;
   _lastAgentKnown = true;
}

void HttpSvcImpl::Start() {
   std::unique_lock<std::mutex> lock(_mutex);
   if (_listeners.empty()) throw InvalidStateException("ServerSocket not set");
   if (!_defaultHandler) throw InvalidStateException("No RequestHandler has been set");
   if (_opState == STARTED) {
      lock.unlock();
      PELMORA_LOG_INFO(_logger.Get(), "Request to start ignored, already started");
      return;
   }
   _opState = STARTED;
   _watcherStop = false;
   // The watcher keeps the service alive until Stop, as the pending accept does.
   if (!_watcher.joinable()) _watcher = std::thread([self = Ref<HttpSvcImpl>(this)] { self->Watch(); });
   lock.unlock();
   IssueAccepts();
   PELMORA_LOG_INFO(_logger.Get(), "Http Service started: %1", ToString());
}

void HttpSvcImpl::AddServerSocket(System::ServerSocket* socket) {
   if (socket == nullptr) throw InvalidArgumentException("null server socket");
   {
      std::lock_guard<std::mutex> lock(_mutex);
      if (!_socket) _socket = socket;
      _listeners.push_back(MakeListener(socket));
   }
   IssueAccepts();
}

void HttpSvcImpl::IssueAccepts() {
   std::vector<std::shared_ptr<Listener>> listeners;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      listeners = _listeners;
   }
   for (const auto& listener : listeners) IssueAccept(listener);
}

void HttpSvcImpl::IssueAccept(const std::shared_ptr<Listener>& listener) {
   {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_opState != STARTED || listener->pending || listener->retryScheduled) return;
      if (static_cast<int>(_connections.size()) >= _config.maxConnections) return;
      listener->pending = true;
   }
   Ref<HttpSvcImpl> self(this);
   try {
      listener->socket->AsyncAccept([self, listener](System::ServerSocket*, Exception* e, System::Stream* stream) {
         self->AcceptHttpConn(listener, e, stream);
      });
   } catch (const Exception& e) {
      {
         std::lock_guard<std::mutex> lock(_mutex);
         listener->pending = false;
      }
      PELMORA_LOG_INFO(_logger.Get(), "Socket closed, not issuing another Accept");
   }
}

void HttpSvcImpl::AcceptHttpConn(const std::shared_ptr<Listener>& listener, Exception* error,
                                 System::Stream* stream) {
   bool running;
   bool firstFailure = false;
   long long recovered = 0;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      listener->pending = false;
      running = _opState == STARTED;
      if (running && error != nullptr) {
         // Out of descriptors or memory the next accept fails at once as well: pause,
         // doubling up to a second, and log the burst once.
         firstFailure = listener->backoff == 0;
         listener->backoff =
             firstFailure ? kFirstAcceptBackoff : std::min(listener->backoff * 2, kLastAcceptBackoff);
         listener->retryScheduled = true;
         listener->retryAt = std::chrono::steady_clock::now() + std::chrono::microseconds(listener->backoff);
      } else if (running && stream != nullptr) {
         recovered = listener->backoff;
         listener->backoff = 0;
      }
   }
   if (!running) {
      if (stream != nullptr) stream->Close();
      PELMORA_LOG_INFO(_logger.Get(), "Socket closed, not issuing another Accept");
      return;
   }
   if (error != nullptr) {
      if (firstFailure)
         PELMORA_LOG_ERROR(_logger.Get(), "accept failure %1 on stream %2", *error, static_cast<const void*>(stream));
      _changed.notify_all();
      return;
   }
   if (recovered != 0) PELMORA_LOG_INFO(_logger.Get(), "Accepting again after failed accepts");
   if (stream == nullptr) {
      PELMORA_LOG_ERROR(_logger.Get(), "stream is NULL - no read scheduled");
      IssueAccept(listener);
      return;
   }
   stream->SetReadTimeout(_config.defaultReadTimeout, Logger::LOG_INFO, "HTTP client never sent a request.");
   stream->SetWriteTimeout(_config.defaultWriteTimeout, Logger::LOG_INFO, "Timed out sending HTTP response.");
   Ref<HttpConnectionImpl> connection(new HttpConnectionImpl(this, stream));
   {
      std::lock_guard<std::mutex> lock(_mutex);
      _connections.insert(connection);
   }
   // The next accept goes out before the first read so that accepting never waits on a
   // client.
   IssueAccept(listener);
   connection->Begin();
}

void HttpSvcImpl::ConnectionEnded(HttpConnectionImpl* connection) {
   {
      std::lock_guard<std::mutex> lock(_mutex);
      _connections.erase(Ref<HttpConnectionImpl>(connection));
   }
   _changed.notify_all();
   IssueAccepts();
}

int HttpSvcImpl::GetConnectionCount() {
   std::lock_guard<std::mutex> lock(_mutex);
   return static_cast<int>(_connections.size());
}

int HttpSvcImpl::GetOpState() {
   std::lock_guard<std::mutex> lock(_mutex);
   return static_cast<int>(_opState);
}

bool HttpSvcImpl::IsRunning() {
   std::lock_guard<std::mutex> lock(_mutex);
   return _opState == STARTED;
}

void HttpSvcImpl::Watch() {
   long long limit = _config.requestDeadline;
   auto period = std::chrono::microseconds(limit > 0 ? std::clamp(limit / 10, 10000LL, 1000000LL) : 1000000LL);
   std::unique_lock<std::mutex> lock(_mutex);
   while (!_watcherStop) {
      auto wake = std::chrono::steady_clock::now() + period;
      for (const auto& listener : _listeners)
         if (listener->retryScheduled) wake = std::min(wake, listener->retryAt);
      _changed.wait_until(lock, wake);
      if (_watcherStop) continue;
      auto now = std::chrono::steady_clock::now();
      std::vector<std::shared_ptr<Listener>> retry;
      for (const auto& listener : _listeners) {
         if (listener->retryScheduled && listener->retryAt <= now) {
            listener->retryScheduled = false;
            retry.push_back(listener);
         }
      }
      std::vector<Ref<HttpConnectionImpl>> overdue;
      if (limit >= 0)
         for (const auto& connection : _connections)
            if (connection->IsOverdue(now, limit)) overdue.push_back(connection);
      lock.unlock();
      for (const auto& listener : retry) IssueAccept(listener);
      for (auto& connection : overdue) {
         PELMORA_LOG_WARNING(_logger.Get(), "Request not complete within %1 ms; closing stream %2", limit / 1000,
                             static_cast<const void*>(connection->GetStream()));
         connection->Close("deadline");
      }
      retry.clear();
      overdue.clear();
      lock.lock();
   }
}

void HttpSvcImpl::Stop() {
   std::vector<std::shared_ptr<Listener>> listeners;
   std::vector<Ref<HttpConnectionImpl>> connections;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_opState != STARTED) return;
      _opState = STOPPING;
      listeners = _listeners;
      for (const auto& listener : _listeners) {
         listener->retryScheduled = false;
         listener->backoff = 0;
      }
      connections.assign(_connections.begin(), _connections.end());
   }
   for (const auto& listener : listeners) listener->socket->Close();
   PELMORA_LOG_INFO(_logger.Get(), "Stopped HTTP service");
   StopWatcher();
   for (auto& connection : connections)
      if (connection->IsIdle()) connection->Close("idle");
   connections.clear();
   auto deadline = std::chrono::steady_clock::now() + std::chrono::microseconds(std::max(0LL, _config.shutdownDeadline));
   std::unique_lock<std::mutex> lock(_mutex);
   while (!_connections.empty() && std::chrono::steady_clock::now() < deadline) {
      // Connections that became idle after finishing their request are closed as well.
      connections.assign(_connections.begin(), _connections.end());
      lock.unlock();
      for (auto& connection : connections)
         if (connection->IsIdle()) connection->Close("idle");
      connections.clear();
      lock.lock();
      _changed.wait_until(lock, std::min(deadline, std::chrono::steady_clock::now() + std::chrono::milliseconds(20)));
   }
   connections.assign(_connections.begin(), _connections.end());
   if (_opState == STOPPING) _opState = STOPPED;
   lock.unlock();
   for (auto& connection : connections) {
      PELMORA_LOG_WARNING(_logger.Get(), "Closing stream %1 at shutdown with a request in progress",
                          static_cast<const void*>(connection->GetStream()));
      connection->Close("shutdown");
   }
}

void HttpSvcImpl::SetRequestHandler(RequestHandler* handler) {
   std::lock_guard<std::mutex> lock(_mutex);
   _defaultHandler = handler;
}

void HttpSvcImpl::GetRequestHandler(Ref<RequestHandler>& out) {
   std::lock_guard<std::mutex> lock(_mutex);
   out = _defaultHandler;
}

void HttpSvcImpl::AddRequestHandler(const std::string& path, RequestHandler* handler) {
   std::lock_guard<std::mutex> lock(_mutex);
   _handlers[path] = handler;
}

void HttpSvcImpl::RemoveRequestHandler(const std::string& path) {
   std::lock_guard<std::mutex> lock(_mutex);
   _handlers.erase(path);
}

bool HttpSvcImpl::FindHandler(const std::string& path, Ref<RequestHandler>& out) {
   std::lock_guard<std::mutex> lock(_mutex);
   if (LookupByPrefix(path, _handlers, out, _logger.Get())) return false;
   out = _defaultHandler;
   return true;
}

std::string HttpSvcImpl::ToString() const {
   char address[32];
   std::snprintf(address, sizeof address, "%p", static_cast<const void*>(this));
   auto text = [](Object* object) { return object != nullptr ? object->ToString() : std::string("(null)"); };
   return std::string("HttpSvcImpl @") + address + " {_logger=" + text(_logger.Get()) +
          ", _socket=" + text(_socket.Get()) + ", _defaultRequestHandler=" + text(_defaultHandler.Get()) +
          ", _opState=" + std::to_string(static_cast<int>(_opState)) + "}";
}

void CreateHttpSvc(System::ServerSocket* socket, Logger* logger, Service::Config::View* view, Ref<HttpSvc>& out) {
   out = new HttpSvcImpl(socket, logger, view);
}

void CreateHttpSvc(System::ServerSocket* socket, Logger* logger, Ref<HttpSvc>& out) {
   Ref<Service::Config::View> view;
   Service::App* app = Service::GetApp();
   if (app != nullptr) {
      Ref<Service::Config> config = app->GetConfig();
      if (config) config->GetView("pelmora/http", view);
   }
   CreateHttpSvc(socket, logger, view.Get(), out);
}

}  // namespace Pelmora::Http
