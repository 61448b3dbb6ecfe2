// pelmorad: the management daemon. Runs in the foreground until SIGTERM or Ctrl-C on a
// compiled-in configuration, which --config overrides key by key; see --help.

#include <cstdio>
#include <string>

#include "pelmora/exception/throwable.h"
#include "pelmora/service/app.h"
#include "tools/pelmorad/daemon.h"
#include "tools/pelmorad/options.h"
#include "tools/pelmorad/settings.h"

using namespace Pelmora;

int main(int argc, char** argv) {
   Daemon::Options options;
   Ref<Service::Config> config;
   std::string stateDir;
   try {
      options = Daemon::ParseOptions(argc, argv);
      switch (options.action) {
         case Daemon::Options::Action::kHelp: std::fputs(Daemon::GetUsageText(), stdout); return 0;
         case Daemon::Options::Action::kVersion: std::printf("pelmorad %s\n", PELMORAD_VERSION); return 0;
         case Daemon::Options::Action::kPrintDefaultConfig:
            std::fputs(Daemon::GetDefaultConfigText().c_str(), stdout);
            return 0;
         case Daemon::Options::Action::kRun: break;
      }
      Daemon::LoadConfiguration(options, config, stateDir);
   } catch (const std::exception& e) {
      std::fprintf(stderr, "pelmorad: %s\n", e.what());
      return 2;
   }
   int status = 0;
   try {
      Service::SetAppInfo(new Service::AppInfo("pelmorad", PELMORAD_VERSION));
      Service::InitApp(config.Get());
      Daemon::Daemon daemon(options, stateDir);
      try {
         daemon.Start();
      } catch (const Daemon::ConfigError& e) {
         std::fprintf(stderr, "pelmorad: %s\n", e.what());
         status = 2;
      } catch (const Exception& e) {
         std::fprintf(stderr, "pelmorad: cannot serve: %s\n", e.GetMessage().c_str());
         status = 1;
      }
      if (status != 0) {
         Service::GetApp()->Exit();
         Service::QuickExit(status);
      }
      std::printf("pelmorad %s: serving %s - open it in a browser; Ctrl-C stops\n", PELMORAD_VERSION,
                  daemon.GetUrl().c_str());
      std::fflush(stdout);
      daemon.Run();
      status = Service::GetApp()->GetExitStatus();
   } catch (const Exception& e) {
      std::fprintf(stderr, "pelmorad: %s\n", e.GetMessage().c_str());
      status = 1;
   }
   if (Service::App* app = Service::GetApp()) app->Exit();
   Service::QuickExit(status);
}
