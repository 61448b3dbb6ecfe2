// The application's daemon behaviour: signals, service-manager notifications, the PID
// file, and the reload a SIGHUP asks for.

#include <csignal>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logMacros.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

namespace {

void HandleSignal(int number) {
   Ref<AppImpl> app = GetAppImpl();
   if (!app) return;
   Ref<Logger> log = app->GetAppLogger();
   if (number == SIGHUP) {
      app->Reload();
      return;
   }
   PELMORA_LOG_INFO(log.Get(), "Received signal %1, stopping", number);
   app->Stop();
}

}  // namespace

void AppImpl::StartDaemonParts() {
   Logger* log = _logger.Get();
   Config::View* view = _view.Get();
   bool handleSignals = true;
   std::string pidFile;
   long long watchdogMs = -1;
   try {
      view->Get("pelmora/daemon/handleSignals", &handleSignals);
      view->Get("pelmora/daemon/pidFile", &pidFile);
      view->Get("pelmora/daemon/watchdogIntervalMs", &watchdogMs);
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(log, "Encountered errors while reading pelmora/daemon: %1", e.GetMessage());
   }
   if (handleSignals) {
      try {
         StartSignalThread(&HandleSignal);
         System::Synchronized lock(this);
         _signalThread = true;
      } catch (const Exception& e) {
         PELMORA_LOG_ERROR(log, "Failed to start signal handling: %1", e.GetMessage());
      }
   }
   if (!pidFile.empty()) {
      try {
         WritePidFile(pidFile);
         System::Synchronized lock(this);
         _pidFile = pidFile;
      } catch (const Exception& e) {
         PELMORA_LOG_ERROR(log, "Failed to write the PID file: %1", e.GetMessage());
      }
   }
   Ref<Notifier> notifier;
   CreateNotifier(notifier);
   if (notifier->IsEnabled()) {
      long long period = watchdogMs >= 0 ? watchdogMs * 1000 : GetWatchdogPeriodFromEnvironment();
      notifier->StartWatchdog(period);
      System::Synchronized lock(this);
      _notifier = notifier;
   }
}

void AppImpl::StopDaemonParts() {
   Ref<Notifier> notifier;
   bool signalThread;
   std::string pidFile;
   {
      System::Synchronized lock(this);
      notifier = std::move(_notifier);
      signalThread = std::exchange(_signalThread, false);
      pidFile = std::move(_pidFile);
   }
   if (notifier) notifier->StopWatchdog();
   if (signalThread) StopSignalThread();
   if (!pidFile.empty() && !RemovePidFile(pidFile)) {
      PELMORA_LOG_WARNING(_logger.Get(), "PID file %1 was not removed", pidFile);
   }
}

void AppImpl::Reload() {
   Ref<Config> config = GetConfig();
   Ref<LogManager> manager = GetAppLogManager();
   Ref<Logger> log = GetAppLogger();
   if (!config || !manager) return;
   // The levels first, so that the lines below already follow them.
   try {
      if (config->Refresh()) {
         Ref<Config::View> view;
         config->GetMainView(view);
         std::string level, memoryLevel = "verbose", levelComplaint, memoryComplaint;
         view->Get("log/level", &level);
         view->Get("log/memoryLevel", &memoryLevel);
         level = ApplyLogLevel(log.Get(), "log/level", level, "info", false, levelComplaint);
         memoryLevel = ApplyLogLevel(log.Get(), "log/memoryLevel", memoryLevel, "verbose", true,
                                     memoryComplaint);
         manager->SetDefaultLevels(level, memoryLevel);
         manager->LoadLogLevels(config.Get());
         for (const std::string* complaint : {&levelComplaint, &memoryComplaint}) {
            if (!complaint->empty()) PELMORA_LOG_WARNING(log.Get(), "%1", *complaint);
         }
         PELMORA_LOG_INFO(log.Get(), "Configuration refreshed");
      }
   } catch (const Exception& e) {
      PELMORA_LOG_ERROR(log.Get(), "Failed to refresh the configuration: %1", e.GetMessage());
   }
   manager->Reopen();
   PELMORA_LOG_INFO(log.Get(), "Reopened log files");
}

void ReloadApp() {
   if (Ref<AppImpl> app = GetAppImpl()) app->Reload();
}

}  // namespace Pelmora::Service
