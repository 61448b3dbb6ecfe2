#pragma once
// The running daemon: one HTTP service on the application's pool that answers the status
// page, its JSON endpoints, /metrics and /healthz, and optionally static documents. It
// takes the stop and reload signals itself, so that a stop lets requests in progress
// finish before the pool goes. One per process, made after InitApp.

#include <atomic>
#include <chrono>
#include <memory>
#include <string>

#include "pelmora/http/documentHandler.h"
#include "pelmora/http/httpSvc.h"
#include "pelmora/object/ref.h"
#include "tools/pelmorad/options.h"

namespace Pelmora::Daemon {

class EndpointCounters;
class ManagementApi;

class Daemon {
public:
   Daemon(const Options& options, std::string stateDir);
   ~Daemon();
   Daemon(const Daemon&) = delete;
   Daemon& operator=(const Daemon&) = delete;

   // Binds the listening socket, registers the endpoints, starts serving and takes the
   // signals. ConfigError for a malformed setting; the socket's exceptions leave it (an
   // address in use).
   void Start();
   // "http://127.0.0.1:8080/", with the port actually bound.
   const std::string& GetUrl() const { return _url; }
   // Lends the calling (main) thread to the pool until a stop has drained the service.
   void Run();
   // The graceful stop SIGTERM and SIGINT ask for: /healthz answers 503 for the drain
   // delay, then the service stops accepting and lets requests finish until its deadline,
   // then the pool is told to shut down. Any thread; later calls do nothing.
   void Stop();
   bool IsStopping() const { return _stopping.load(); }
   long long GetUptimeSeconds() const;

   // The file given with --config (empty: the compiled-in defaults only), where
   // configuration changes are written back.
   const std::string& GetConfigFile() const { return _options.configFile; }
   const std::string& GetStateDir() const { return _stateDir; }
   // Where more endpoints are added (a path prefix per handler).
   Http::HttpSvc* GetHttpService() const { return _svc.Get(); }
   Http::DocumentHandler* GetDocumentHandler() const { return _documents.Get(); }

private:
   void RegisterEndpoints();
   void OnSignal(int number);
   std::string StatusJson();

   Options _options;
   std::string _stateDir;
   std::string _url;
   int _logLines = 40;
   int _maxSleepMs = 60000;
   int _drainDelayMs = 0;
   bool _sleepEndpoint = false;
   const std::chrono::steady_clock::time_point _started;
   const long long _startedWallMicroseconds;
   std::atomic<bool> _stopping{false};
   bool _signalsTaken = false;
   Ref<Http::HttpSvc> _svc;
   Ref<Http::DocumentHandler> _documents;
   std::unique_ptr<EndpointCounters> _counters;
   std::unique_ptr<ManagementApi> _management;
};

}  // namespace Pelmora::Daemon
