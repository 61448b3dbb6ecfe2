// A daemon of your own, built from the pieces pelmorad uses: the application object, an
// HTTP service with a page and /metrics, and a stop that lets requests finish first.
//   ./embedded_daemon [PORT]     then: curl localhost:8081/  and  curl localhost:8081/metrics
#include <csignal>
#include <string>

#include "pelmora/pelmora.h"

using namespace Pelmora;

int main(int argc, char** argv) {
   Ref<Service::Config> config;  // settings in memory; a file works the same (InitApp(path))
   Service::CreateScratchConfig(config);
   Ref<Service::Config::View> settings;
   config->GetMainView(settings);
   settings->Set("pelmora/daemon/handleSignals", false);  // we drain HTTP before the pool stops
   Service::InitApp(config.Get());  // logging, the thread pool, systemd notification

   Ref<Http::DocumentHandler> pages;
   Http::CreateHTTPDocRequestHandler(std::map<std::string, std::string>{}, nullptr, pages);
   pages->RegisterURIHandler("/", [](Http::Request*, Http::Response* r) {
      r->GetHeader().SetContentType("text/plain");
      r->Write("hello\n", 6);
      r->Complete();
   });
   Ref<System::ServerSocket> socket;
   System::CreateTcpServerSocket("127.0.0.1", argc > 1 ? std::stoi(argv[1]) : 8081, {}, socket);
   Ref<Http::HttpSvc> http;
   Http::CreateHttpSvc(socket.Get(), nullptr, http);
   http->SetRequestHandler(pages.Get());
   Ref<Http::RequestHandler> metrics;  // every counter, for Prometheus
   Http::CreatePrometheusRequestHandler(nullptr, metrics);
   http->AddRequestHandler("/metrics", metrics.Get());
   http->Start();

   Service::StartSignalThread([&](int signal) {
      if (signal == SIGHUP) return Service::ReloadApp();  // reopen logs, re-read settings
      http->Stop();                                        // requests in progress finish
      Service::GetApp()->Stop();                           // then Run below returns
   });
   Service::GetApp()->Run();
   Service::StopSignalThread();
   Service::GetApp()->Exit();
   Service::QuickExit(0);
}
