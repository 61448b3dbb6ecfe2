#include "tools/pelmorad/daemon.h"

#include <sys/time.h>

#include <array>
#include <csignal>
#include <functional>
#include <map>
#include <mutex>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/prometheusHandler.h"
#include "pelmora/http/url.h"
#include "pelmora/io/writers.h"
#include "pelmora/perfCounter/registry.h"
#include "pelmora/service/app.h"
#include "pelmora/service/daemon.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/system/address.h"
#include "pelmora/system/socket.h"
#include "pelmora/system/threadState.h"
#include "tools/pelmorad/embedded.h"
#include "tools/pelmorad/json.h"
#include "tools/pelmorad/managementApi.h"
#include "tools/pelmorad/settings.h"
#include "tools/pelmorad/statusApi.h"

namespace Pelmora::Daemon {

namespace {

enum Endpoint { kPage, kStatus, kCounters, kLog, kThreads, kMetrics, kHealth, kSleep, kEndpointCount };
constexpr std::array<const char*, kEndpointCount> kEndpointNames = {
    "page", "status", "counters", "log", "threads", "metrics", "healthz", "sleep"};

Service::Logger* DaemonLogger() {
   static Service::Logger* const logger = [] {
      Ref<Service::Logger> child;
      Service::GetDefaultLogger()->CreateLogger("pelmorad", child);
      return child.Release();  // kept until exit, like the loggers it hangs off
   }();
   return logger;
}

long long WallMicroseconds() {
   timeval now;
   gettimeofday(&now, nullptr);
   return static_cast<long long>(now.tv_sec) * 1000000 + now.tv_usec;
}

// The value of `name` in the query of `path` ("/api/log?lines=20"); false when absent.
bool GetQueryParameter(const std::string& path, const std::string& name, std::string& value) {
   size_t query = path.find('?');
   if (query == std::string::npos) return false;
   std::string rest = path.substr(query + 1, path.find('#', query) - query - 1);
   size_t at = 0;
   while (at <= rest.size()) {
      size_t end = rest.find('&', at);
      if (end == std::string::npos) end = rest.size();
      std::string pair = rest.substr(at, end - at);
      size_t eq = pair.find('=');
      if (pair.substr(0, eq) == name) {
         value = eq == std::string::npos ? "" : pair.substr(eq + 1);
         return true;
      }
      at = end + 1;
   }
   return false;
}

// A non-negative number no larger than `limit`, or `fallback` when absent or not a number.
int GetNumberParameter(const std::string& path, const std::string& name, int fallback, int limit) {
   std::string text;
   if (!GetQueryParameter(path, name, text) || text.empty()) return fallback;
   char* end = nullptr;
   long value = std::strtol(text.c_str(), &end, 10);
   if (*end != '\0' || value < 0) return fallback;
   return static_cast<int>(std::min<long>(value, limit));
}

void Reply(Http::Response* response, const Http::ResponseCode::Info& code, const std::string& type,
           const std::string& body, bool cache = false) {
   response->SetStatusCode(code);
   response->GetHeader().SetContentType(type);
   if (!cache) response->GetHeader().SetField("Cache-Control", "no-store");
   response->SetContentLength(static_cast<long long>(body.size()));
   if (!body.empty()) response->Write(body.data(), static_cast<int>(body.size()));
   response->Complete();
}

void ReplyJson(Http::Response* response, const Http::ResponseCode::Info& code, const std::string& json) {
   Reply(response, code, "application/json; charset=utf-8", json);
}

std::string ErrorJson(const std::string& message) {
   JsonWriter json;
   json.BeginObject().Key("error").String(message).EndObject();
   return json.Text();
}

// A line on the calling thread's board for as long as it lives.
class ThreadStateEntry {
public:
   explicit ThreadStateEntry(const std::string& text) : _index(System::AddThreadState(text.c_str())) {}
   ~ThreadStateEntry() { System::RemoveThreadState(_index); }
   ThreadStateEntry(const ThreadStateEntry&) = delete;
   ThreadStateEntry& operator=(const ThreadStateEntry&) = delete;

private:
   unsigned _index;
};

}  // namespace

// Requests answered per endpoint, published as "/Pelmorad/Endpoint='name'/Requests", with
// the process's uptime and open connections beside them.
class EndpointCounters {
public:
   explicit EndpointCounters(Daemon* daemon) : _publisher(new Publisher(this)), _daemon(daemon) {
      RefVector<PerfCounter::Metadata> metadata;
      for (const char* name : kEndpointNames) {
         metadata.push_back(new PerfCounter::Metadata(std::string("/Pelmorad/Endpoint='") + name + "'/Requests",
                                                      PerfCounter::Metadata::TYPE_COUNTER));
      }
      metadata.push_back(new PerfCounter::Metadata("/Pelmorad/UptimeSeconds", PerfCounter::Metadata::TYPE_GAUGE));
      metadata.push_back(new PerfCounter::Metadata("/Pelmorad/HTTP/Connections", PerfCounter::Metadata::TYPE_GAUGE));
      PerfCounter::GetCounterRegistry()->RegisterGroup(metadata, _publisher.Get(), _item);
   }
   ~EndpointCounters() {
      _item->Unregister();
      _publisher->Detach();
   }
   void Count(Endpoint endpoint) { _requests[endpoint].fetch_add(1, std::memory_order_relaxed); }

private:
   class Publisher : public virtual PerfCounter::GroupPublisher, public ObjectImpl {
   public:
      explicit Publisher(EndpointCounters* owner) : _owner(owner) {}
      void CollectValues(RefVector<PerfCounter::Metadata>&, std::vector<PerfCounter::Value>& values) override {
         values.clear();
         std::lock_guard<std::mutex> lock(_mutex);
         if (!_owner) return;
         for (auto& count : _owner->_requests) values.emplace_back(count.load(std::memory_order_relaxed));
         values.emplace_back(_owner->_daemon->GetUptimeSeconds());
         Http::HttpSvc* svc = _owner->_daemon->GetHttpService();
         values.emplace_back(svc ? svc->GetConnectionCount() : 0);
      }
      // The registry may still hold the publisher after the owner is gone.
      void Detach() {
         std::lock_guard<std::mutex> lock(_mutex);
         _owner = nullptr;
      }

   private:
      std::mutex _mutex;
      EndpointCounters* _owner;
   };

   Ref<Publisher> _publisher;
   Ref<PerfCounter::RegistryItem> _item;
   Daemon* _daemon;
   std::array<std::atomic<long long>, kEndpointCount> _requests{};
};

Daemon::Daemon(const Options& options, std::string stateDir)
   : _options(options),
     _stateDir(std::move(stateDir)),
     _started(std::chrono::steady_clock::now()),
     _startedWallMicroseconds(WallMicroseconds()) {}

Daemon::~Daemon() {
   if (_signalsTaken) Service::StopSignalThread();
}

long long Daemon::GetUptimeSeconds() const {
   return std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() - _started).count();
}

void Daemon::Start() {
   Ref<Service::Config> config = Service::GetApp()->GetConfig();
   Ref<Service::Config::View> view, httpView;
   config->GetMainView(view);
   config->GetView("pelmora/http", httpView);
   std::string address = "127.0.0.1", docroot;
   int port = 8080;
   auto read = [&view](const std::string& key, auto* value) {
      try {
         view->Get(key, value);
      } catch (const Exception& e) {
         throw ConfigError("bad value for " + key + " in the configuration: " + e.GetMessage());
      }
   };
   read("pelmorad/http/address", &address);
   read("pelmorad/http/port", &port);
   read("pelmorad/docroot", &docroot);
   read("pelmorad/status/logLines", &_logLines);
   read("pelmorad/debug/sleepEndpoint", &_sleepEndpoint);
   read("pelmorad/debug/maxSleepMs", &_maxSleepMs);
   read("pelmorad/shutdown/drainDelayMs", &_drainDelayMs);
   if (!_options.listen.empty()) address = _options.listen;
   if (_options.port >= 0) port = _options.port;

   std::map<std::string, std::string> roots;
   if (!docroot.empty()) roots["/"] = docroot;
   Http::CreateHTTPDocRequestHandler(roots, view.Get(), _documents);
   _counters = std::make_unique<EndpointCounters>(this);
   RegisterEndpoints();

   System::ServerSocketOptions socketOptions;
   socketOptions.backlog = 1024;
   Ref<System::ServerSocket> socket;
   System::CreateTcpServerSocket(address, port, socketOptions, socket);
   Ref<System::BindingInfo> bound;
   socket->GetBindingInfo(bound);
   std::string host = bound->GetAddress();
   if (host.find(':') != std::string::npos) host = "[" + host + "]";
   _url = "http://" + host + ":" + std::to_string(bound->GetPort()) + "/";

   Http::CreateHttpSvc(socket.Get(), nullptr, httpView.Get(), _svc);
   _svc->SetRequestHandler(_documents.Get());
   _management = std::make_unique<ManagementApi>(this);
   _management->Start();
   _svc->Start();
   try {
      Service::StartSignalThread([this](int number) { OnSignal(number); });
      _signalsTaken = true;
   } catch (const AlreadyInitializedException&) {
      PELMORA_LOG_WARNING(DaemonLogger(), "pelmora/daemon/handleSignals is on: a stop will not let "
                                          "requests in progress finish");
   }
   PELMORA_LOG_INFO(DaemonLogger(), "Serving %1 (state in %2%3%4)", _url, _stateDir,
                    docroot.empty() ? "" : ", documents from ", docroot);
}

void Daemon::Run() {
   {
      ThreadStateEntry board("main: running the pool's main-thread queue");
      Service::GetApp()->Run();
   }
   // The pool may have been stopped another way; the service goes all the same.
   Stop();
}

void Daemon::OnSignal(int number) {
   if (number == SIGHUP) {
      PELMORA_LOG_INFO(DaemonLogger(), "SIGHUP: refreshing the configuration and reopening the logs");
      Service::ReloadApp();
      return;
   }
   PELMORA_LOG_INFO(DaemonLogger(), "Received signal %1, stopping", number);
   Stop();
}

void Daemon::Stop() {
   if (_stopping.exchange(true)) return;
   if (_drainDelayMs > 0) {
      // Load balancers see /healthz fail and move traffic before the listener closes.
      PELMORA_LOG_INFO(DaemonLogger(), "Answering /healthz with 503 for %1 ms before stopping", _drainDelayMs);
      std::this_thread::sleep_for(std::chrono::milliseconds(_drainDelayMs));
   }
   if (_svc) {
      PELMORA_LOG_INFO(DaemonLogger(), "Stopping the HTTP service; %1 connections open", _svc->GetConnectionCount());
      _svc->Stop();
   }
   if (_management) _management->Stop();
   PELMORA_LOG_INFO(DaemonLogger(), "HTTP service stopped");
   Service::GetApp()->Stop();
}

std::string Daemon::StatusJson() {
   Ref<Service::AppInfo> info = Service::GetApp()->GetAppInfo();
   ProcessFacts facts;
   facts.name = info ? info->GetName() : "pelmorad";
   facts.version = info ? info->GetVersion() : "";
   facts.url = _url;
   facts.stateDir = _stateDir;
   facts.configFile = _options.configFile;
   facts.startedAtMicroseconds = _startedWallMicroseconds;
   facts.uptimeSeconds =
       std::chrono::duration<double>(std::chrono::steady_clock::now() - _started).count();
   facts.stopping = IsStopping();
   facts.connections = _svc ? _svc->GetConnectionCount() : 0;
   JsonWriter json;
   json.BeginObject();
   WriteProcess(json, facts);
   json.Key("pool");
   WritePool(json);
   json.Key("threads");
   WriteThreadStates(json);
   json.Key("counters");
   WriteCounters(json, "");
   json.Key("log");
   WriteLogTail(json, _logLines);
   json.EndObject();
   return json.Text();
}

void Daemon::RegisterEndpoints() {
   // Every endpoint is counted, posts what it does on its thread's board and answers 500
   // with the reason rather than dropping the connection.
   auto serve = [this](const std::string& path, Endpoint endpoint,
                       std::function<void(Http::Request*, Http::Response*)> handler) {
      _documents->RegisterURIHandler(path, [this, endpoint, handler](Http::Request* request, Http::Response* response) {
         _counters->Count(endpoint);
         std::string state = "serving " + request->GetPath();
         ThreadStateEntry board(state);
         std::string failure;
         try {
            handler(request, response);
            return;
         } catch (const Exception& e) {
            failure = e.GetMessage();
         } catch (const std::exception& e) {
            failure = e.what();
         }
         PELMORA_LOG_ERROR(DaemonLogger(), "%1 failed: %2", request->GetPath(), failure);
         if (!response->IsHeaderSent()) response->SendError(Http::ResponseCode::InternalServerError, failure);
      });
   };
   for (const char* file : {"/", "/index.html", "/style.css", "/app.js"}) {
      std::string name = std::string(file) == "/" ? "/index.html" : file;
      const EmbeddedFile* embedded = FindEmbeddedFile(name);
      if (!embedded) continue;
      std::string type = Http::GetMimeType(name);
      if (type.rfind("text/", 0) == 0 || type.find("javascript") != std::string::npos) type += "; charset=utf-8";
      serve(file, kPage, [embedded, type](Http::Request*, Http::Response* response) {
         Reply(response, Http::ResponseCode::Ok, type,
               std::string(reinterpret_cast<const char*>(embedded->data), embedded->size), true);
      });
   }
   serve("/api/status", kStatus, [this](Http::Request*, Http::Response* response) {
      ReplyJson(response, Http::ResponseCode::Ok, StatusJson());
   });
   serve("/api/counters", kCounters, [](Http::Request* request, Http::Response* response) {
      std::string pattern;
      GetQueryParameter(request->GetPath(), "match", pattern);
      JsonWriter json;
      try {
         WriteCounters(json, pattern);
      } catch (const InvalidArgumentException& e) {
         ReplyJson(response, Http::ResponseCode::BadRequest, ErrorJson(e.GetMessage()));
         return;
      }
      ReplyJson(response, Http::ResponseCode::Ok, json.Text());
   });
   serve("/api/log", kLog, [this](Http::Request* request, Http::Response* response) {
      JsonWriter json;
      WriteLogTail(json, GetNumberParameter(request->GetPath(), "lines", _logLines, 10000));
      ReplyJson(response, Http::ResponseCode::Ok, json.Text());
   });
   serve("/api/threads", kThreads, [](Http::Request*, Http::Response* response) {
      JsonWriter json;
      json.BeginObject().Key("pool");
      WritePool(json);
      json.Key("threads");
      WriteThreadStates(json);
      json.EndObject();
      ReplyJson(response, Http::ResponseCode::Ok, json.Text());
   });
   Ref<Http::RequestHandler> metrics;
   Http::CreatePrometheusRequestHandler(PerfCounter::GetCounterRegistry(), metrics);
   serve("/metrics", kMetrics, [metrics](Http::Request* request, Http::Response* response) {
      if (request->GetMethod() == Http::RequestHeader::HEAD) {
         metrics->HandleHead(request, response);
      } else {
         metrics->HandleGet(request, response);
      }
   });
   serve("/healthz", kHealth, [this](Http::Request*, Http::Response* response) {
      if (IsStopping()) {
         Reply(response, Http::ResponseCode::ServiceUnavailable, "text/plain; charset=utf-8", "stopping\n");
      } else {
         Reply(response, Http::ResponseCode::Ok, "text/plain; charset=utf-8", "ok\n");
      }
   });
   if (_sleepEndpoint) {
      PELMORA_LOG_WARNING(DaemonLogger(), "The debug endpoint /api/sleep is on");
      serve("/api/sleep", kSleep, [this](Http::Request* request, Http::Response* response) {
         int ms = GetNumberParameter(request->GetPath(), "ms", 1000, _maxSleepMs);
         std::this_thread::sleep_for(std::chrono::milliseconds(ms));
         ReplyJson(response, Http::ResponseCode::Ok, "{\"sleptMs\":" + std::to_string(ms) + "}");
      });
   }
}

}  // namespace Pelmora::Daemon
