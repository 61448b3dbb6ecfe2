// pelmora-httpd: serves the files under a document root and answers GET /hello with a
// fixed text, until SIGTERM or SIGINT. Settings come from an optional configuration
// file ("pelmora/http/...").
//
//   pelmora-httpd [--host H] [--port N] [--docroot DIR] [--config FILE]

#include <signal.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "pelmora/exception/throwable.h"
#include "pelmora/http.h"
#include "pelmora/service.h"
#include "pelmora/system.h"

using namespace Pelmora;

int main(int argc, char** argv) {
   std::string host = "127.0.0.1", docroot = ".", configFile;
   int port = 8080;
   for (int i = 1; i + 1 < argc; i += 2) {
      if (std::strcmp(argv[i], "--host") == 0) host = argv[i + 1];
      else if (std::strcmp(argv[i], "--port") == 0) port = std::atoi(argv[i + 1]);
      else if (std::strcmp(argv[i], "--docroot") == 0) docroot = argv[i + 1];
      else if (std::strcmp(argv[i], "--config") == 0) configFile = argv[i + 1];
      else {
         std::fprintf(stderr, "usage: %s [--host H] [--port N] [--docroot DIR] [--config FILE]\n", argv[0]);
         return 2;
      }
   }
   // The signals are taken by sigwait below, so every thread started from here on
   // inherits them blocked.
   sigset_t stopSignals;
   sigemptyset(&stopSignals);
   sigaddset(&stopSignals, SIGTERM);
   sigaddset(&stopSignals, SIGINT);
   pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
   try {
      Ref<System::ThreadPool> pool;
      System::CreateThreadPool(nullptr, pool);
      System::SetThreadPool(pool.Get());
      Ref<Service::Config::View> httpView, mainView;
      if (!configFile.empty()) {
         Ref<Service::Config> config;
         Service::CreateXmlFileConfig(configFile, 0, 0, config);
         config->Load();
         config->GetView("pelmora/http", httpView);
         config->GetMainView(mainView);
      }
      Ref<Http::DocumentHandler> documents;
      Http::CreateHTTPDocRequestHandler(docroot, mainView.Get(), documents);
      documents->RegisterURIHandler("/hello", [](Http::Request*, Http::Response* response) {
         response->GetHeader().SetContentType("text/plain");
         response->Write("Hello, world!", 13);
         response->Complete();
      });
      System::ServerSocketOptions options;
      options.backlog = 1024;
      Ref<System::ServerSocket> socket;
      System::CreateTcpServerSocket(host, port, options, socket);
      Ref<Http::HttpSvc> svc;
      Http::CreateHttpSvc(socket.Get(), nullptr, httpView.Get(), svc);
      svc->SetRequestHandler(documents.Get());
      svc->Start();
      int signal = 0;
      sigwait(&stopSignals, &signal);
      svc->Stop();
   } catch (const Exception& e) {
      std::fprintf(stderr, "pelmora-httpd: %s\n", e.GetMessage().c_str());
      return 1;
   }
   return 0;
}
