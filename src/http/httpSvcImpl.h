#pragma once
// The server's internals, shared by the service, its connections and their tests.

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <regex>
#include <set>
#include <thread>
#include <vector>

#include "pelmora/http/httpSvc.h"

namespace Pelmora::Http {

class HttpSvcImpl;

// One accepted stream: reads a request, dispatches it, and after a kept-alive response
// reads the next one. Driven by one chain of completions at a time.
class HttpConnectionImpl : public virtual HttpConnection, public ObjectImpl {
public:
   enum State { WAITING = 0, BUSY = 1, CLOSED = 2 };

   HttpConnectionImpl(HttpSvcImpl* svc, System::Stream* stream);

   void Begin();
   const HttpSvcConfig& GetHttpSvcConfig() const;
   long long GetReadTimeout() const;
   bool IsAuthenticated() const { return _authenticated; }
   void InitClientCapabilities();
   void GetClientCapabilities(ClientCapabilities& out) override { out = _capabilities; }
   long long GetMaxBufferedResponseBytes() override;
   void ResponseCompleted(bool keepAlive) override;
   bool DeferResponse() override;
   void ResponseFinished(Exception* error) override;
   // Closes the stream; the pending read ends the connection.
   void Close(const char* why);
   // Whether the connection waits with no part of a request received.
   bool IsIdle();
   // Whether a request header has been arriving for longer than `limit` microseconds.
   bool IsOverdue(std::chrono::steady_clock::time_point now, long long limit);
   State GetState();
   System::Stream* GetStream() const { return _stream.Get(); }
   // The stream wrapper reports each read here: before it and with its byte count after.
   void ReadBegins();
   void ReadEnds(int count);

private:
   void Next();
   void HeaderDone(Exception* error, bool gotRequest);
   bool Process(Exception* error, bool gotRequest);
   bool Dispatch();
   bool AfterResponse(bool next);
   bool FinishRequest();
   void End();

   Ref<HttpSvcImpl> _svc;
   Ref<System::Stream> _stream;
   Ref<Request> _request;
   Ref<Response> _response;
   Ref<Service::Logger> _logger;
   ClientCapabilities _capabilities;
   bool _authenticated = false;
   bool _firstRequest = true;
   bool _completed = false;
   bool _completedKeepAlive = false;
   std::string _agent;  // the last User-Agent and what the expressions said of it
   bool _agentKnown = false;
   bool _agentNonChunking = false;
   bool _agentNeedsLength = false;
   bool _deferred = false;  // the response finishes after its handler returned
   std::chrono::steady_clock::time_point _began;
   long long _writtenBefore = 0;

   std::mutex _mutex;
   State _state = WAITING;
   bool _starting = false;
   bool _syncDone = false;
   std::unique_ptr<Exception> _syncError;
   bool _syncGot = false;
   std::chrono::steady_clock::time_point _firstByte;
   bool _haveFirstByte = false;
   int _readsPending = 0;
   bool _deferredDone = false;
   bool _deferredFailed = false;
   bool _awaitingDeferred = false;
   bool _nextAfterDeferred = false;
};

class HttpSvcImpl : public virtual HttpSvc, public ObjectImpl {
public:
   HttpSvcImpl(System::ServerSocket* socket, Service::Logger* logger, Service::Config::View* view);
   ~HttpSvcImpl() override;

   void Start() override;
   void AddServerSocket(System::ServerSocket* socket) override;
   void Stop() override;
   void SetRequestHandler(RequestHandler* handler) override;
   void GetRequestHandler(Ref<RequestHandler>& out) override;
   void AddRequestHandler(const std::string& path, RequestHandler* handler) override;
   void RemoveRequestHandler(const std::string& path) override;
   long long GetDefaultReadTimeout() override { return _config.defaultReadTimeout; }
   long long GetDefaultWriteTimeout() override { return _config.defaultWriteTimeout; }
   long long GetAuthenticatedReadTimeout() override { return _config.authenticatedReadTimeout; }
   long long GetAuthenticatedWriteTimeout() override { return _config.authenticatedWriteTimeout; }
   int GetConnectionCount() override;
   using ObjectImpl::ToString;
   std::string ToString() const override;

   const HttpSvcConfig& GetConfig() const { return _config; }
   Service::Logger* GetLogger() const { return _logger.Get(); }
   // The child logger every connection logs to, made once rather than per connection.
   Service::Logger* GetConnectionLogger() const { return _connectionLogger.Get(); }
   bool IsRunning();
   // 0 stopped, 1 started, 2 stopping (Stop lets requests in progress finish).
   int GetOpState();
   // The handler for `path` and whether it is the default one.
   bool FindHandler(const std::string& path, Ref<RequestHandler>& out);
   void ConnectionEnded(HttpConnectionImpl* connection);
   // The compiled agent expressions; an empty expression matches nothing.
   bool IsNonChunkingAgent(const std::string& agent) const;
   bool NeedsContentLength(const std::string& agent) const;
   // Both of the above, remembered for the last agent asked about: most clients of a
   // server send the same agent on connection after connection.
   void ClassifyAgent(const std::string& agent, bool& nonChunking, bool& needsLength);

   // The first pause after a failed accept and the longest one.
   static constexpr long long kFirstAcceptBackoff = 10000;
   static constexpr long long kLastAcceptBackoff = 1000000;

private:
   // One listening socket with its accept state.
   struct Listener {
      Ref<System::ServerSocket> socket;
      bool pending = false;            // an accept is issued
      long long backoff = 0;           // microseconds; 0 while accepts succeed
      bool retryScheduled = false;     // the watcher issues the next accept at retryAt
      std::chrono::steady_clock::time_point retryAt;
   };
   static std::shared_ptr<Listener> MakeListener(System::ServerSocket* socket) {
      auto listener = std::make_shared<Listener>();
      listener->socket = socket;
      return listener;
   }

   void IssueAccept(const std::shared_ptr<Listener>& listener);
   void IssueAccepts();
   void AcceptHttpConn(const std::shared_ptr<Listener>& listener, Exception* error, System::Stream* stream);
   void Watch();
   void StopWatcher();
   void CompileAgents(Service::Config::View* view);

   Ref<Service::Logger> _logger;
   Ref<Service::Logger> _connectionLogger;
   HttpSvcConfig _config;
   std::regex _nonChunking;
   std::regex _needsLength;
   bool _haveNonChunking = false;
   bool _haveNeedsLength = false;
   std::mutex _agentMutex;
   bool _lastAgentKnown = false;
   std::string _lastAgent;
   bool _lastAgentNonChunking = false;
   bool _lastAgentNeedsLength = false;

   std::mutex _mutex;
   Ref<System::ServerSocket> _socket;  // the first listener's, for ToString
   std::vector<std::shared_ptr<Listener>> _listeners;
   Ref<RequestHandler> _defaultHandler;
   RequestHandlerMap _handlers;
   enum OpState { STOPPED = 0, STARTED = 1, STOPPING = 2 } _opState = STOPPED;
   std::set<Ref<HttpConnectionImpl>> _connections;
   std::condition_variable _changed;
   std::thread _watcher;
   bool _watcherStop = false;
};

// Whether `text` is well-formed UTF-8 (no overlong forms, surrogates or values past
// U+10FFFF).
bool IsValidUtf8(const std::string& text);

}  // namespace Pelmora::Http
