// soap_echo: a SOAP service with an echo operation and one with a structured argument,
// over HTTP (POST /soap or /, WSDL at /soap/echo.wsdl?wsdl, until SIGTERM or SIGINT), on
// standard input/output (--stdio) or as a CGI program (--cgi, or when GATEWAY_INTERFACE
// is set).
//
//   soap_echo [--host H] [--port N] [--wsdl-root DIR] [--config FILE] [--max-sessions N]
//             [--stdio | --cgi]
//
// --max-sessions sets "pelmora/soap/maxSessionCount"; 0 serves without sessions, as a load
// generator that never sends cookies back needs.

#include <signal.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "echoService.h"
#include "pelmora/exception/throwable.h"
#include "pelmora/http.h"
#include "pelmora/service.h"
#include "pelmora/soap.h"
#include "pelmora/system.h"

using namespace Pelmora;

namespace {

int Usage(const char* program) {
   std::fprintf(stderr,
                "usage: %s [--host H] [--port N] [--wsdl-root DIR] [--config FILE] [--max-sessions N] "
                "[--stdio | --cgi]\n",
                program);
   return 2;
}

void ServeOneRequest(bool cgi) {
   Ref<Soap::StdinSoapSvc> svc;
   if (cgi) {
      Soap::CreateCgiSoapSvc(nullptr, svc);
   } else {
      Soap::CreateSoapSvcOnStdio(nullptr, svc);
   }
   Ref<Soap::BodyHandlerMap> map;
   Soap::CreateBodyHandlerMap(nullptr, "urn:anchor:echo", map);
   SoapEcho::AddEchoHandlers(map.Get());
   svc->SetSoapRequestHandler(map.Get());
   svc->Start();
   svc->Exit(svc->HandleStdin());
}

}  // namespace

int main(int argc, char** argv) {
   std::string host = "127.0.0.1", wsdlRoot = PELMORA_SOAP_ECHO_WSDL_DIR, configFile, maxSessions;
   int port = 18490;
   bool stdio = false, cgi = std::getenv("GATEWAY_INTERFACE") != nullptr;
   for (int i = 1; i < argc; ++i) {
      std::string option = argv[i];
      if (option == "--stdio") {
         stdio = true;
      } else if (option == "--cgi") {
         cgi = true;
      } else if (i + 1 >= argc) {
         return Usage(argv[0]);
      } else if (option == "--host") {
         host = argv[++i];
      } else if (option == "--port") {
         port = std::atoi(argv[++i]);
      } else if (option == "--wsdl-root") {
         wsdlRoot = argv[++i];
      } else if (option == "--config") {
         configFile = argv[++i];
      } else if (option == "--max-sessions") {
         maxSessions = argv[++i];
      } else {
         return Usage(argv[0]);
      }
   }
   if (stdio || cgi) {
      try {
         ServeOneRequest(cgi);
      } catch (const Exception& e) {
         std::fprintf(stderr, "soap_echo: %s\n", e.GetMessage().c_str());
         return 1;
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
      Ref<Service::Config> config;
      if (!configFile.empty()) {
         Service::CreateXmlFileConfig(configFile, 0, 0, config);
         config->Load();
      } else {
         Service::CreateScratchConfig(config);
      }
      Ref<Service::Config::View> httpView, soapView;
      config->GetView("pelmora/http", httpView);
      config->GetView("pelmora/soap", soapView);
      if (!maxSessions.empty()) soapView->Set("maxSessionCount", maxSessions.c_str());
      System::ServerSocketOptions options;
      options.backlog = 1024;
      Ref<System::ServerSocket> socket;
      System::CreateTcpServerSocket(host, port, options, socket);
      Ref<Http::HttpSvc> http;
      Http::CreateHttpSvc(socket.Get(), nullptr, httpView.Get(), http);
      Ref<Soap::HttpSoapSvc> soap;
      Soap::CreateSoapSvcOnHttp(nullptr, http.Get(), soapView.Get(), soap);
      Ref<Soap::BodyHandlerMap> map;
      Soap::CreateBodyHandlerMap(nullptr, "urn:anchor:echo", map);
      SoapEcho::AddEchoHandlers(map.Get());
      soap->SetSoapRequestHandler(map.Get());
      soap->SetWsdlRoot(wsdlRoot);
      soap->Start();
      // Every other path is SOAP too, so that clients may post to "/".
      Ref<Http::RequestHandler> handler;
      soap->GetHttpRequestHandler(handler);
      http->SetRequestHandler(handler.Get());
      http->Start();
      std::fprintf(stderr, "soap_echo: serving on http://%s:%d/soap\n", host.c_str(), port);
      int signal = 0;
      sigwait(&stopSignals, &signal);
      http->Stop();
      soap->Stop();
   } catch (const Exception& e) {
      std::fprintf(stderr, "soap_echo: %s\n", e.GetMessage().c_str());
      return 1;
   }
   return 0;
}
