#pragma once
// The application object's implementation and the start-up pieces its units share.

#include <atomic>
#include <string>
#include <vector>

#include "pelmora/service/app.h"
#include "pelmora/service/daemon.h"

namespace Pelmora::Service {

class AppImpl : public virtual App, public System::LockableObjectImpl {
public:
   AppImpl();

   void Init(Config* config) override;
   Ref<Logger> GetAppLogger() override;
   Ref<LogManager> GetAppLogManager() override;
   Ref<System::ThreadPool> GetThreadPool() override;
   Ref<Config> GetConfig() override;
   void LoadPlugin(const std::string& name, const std::string& path, Ref<Plugin>& out) override;
   void GetPlugins(PluginMap& out) override;
   void RegisterObject(const std::string& name, Object* object) override;
   void UnregisterObject(const std::string& name) override;
   void LookupObject(const std::string& name, Ref<Object>& out) override;
   void GetObjects(RefMap<std::string, Object>& out) override;
   void CreateChannelReader(const std::string& name, const ChannelCallback& callback,
                            Ref<ChannelReader>& out) override;
   void CreateChannelWriter(const std::string& name, Ref<ChannelWriter>& out) override;
   void Run() override;
   void SetExitStatus(int status) override;
   int GetExitStatus() override;
   void Stop() override;
   void Exit() override;
   Ref<AppInfo> GetAppInfo() override;
   void LoadPlugins() override;
   void InitPlugins() override;
   void StartPlugins() override;

   void SetInfo(AppInfo* info);
   // SIGHUP: reread the configuration and apply its log levels, reopen the log files.
   void Reload();

private:
   void InitializeLogging();
   void ReadPanicSettings();
   void InitializeRefTracker();
   void StartDaemonParts();
   void StopDaemonParts();
   void ShutdownPlugins();
   // The plug-ins in load order.
   std::vector<std::string> LoadOrder();
   void LoadPluginLogged(const std::string& name, const std::string& path,
                         const std::string& baseDirectory);

   Ref<Config> _config;
   Ref<Config::View> _view;
   Ref<LogManager> _logManager;
   Ref<Logger> _logger;
   Ref<System::ThreadPool> _pool;
   Ref<ChannelManager> _channels;
   Ref<AppInfo> _info;
   PluginMap _plugins;
   std::vector<std::string> _pluginOrder;
   RefMap<std::string, Object> _objects;
   std::atomic<int> _exitStatus{0};
   bool _initialized = false;
   bool _impersonating = false;
   Ref<Notifier> _notifier;
   bool _signalThread = false;
   std::string _pidFile;
};

// The dependency order of plug-ins: each name after its dependencies. Throws
// InvalidStateException with "Cyclic dependency detected for plugin: %1" or
// "Missing dependency [%1] for plugin [%2]".
void OrderPlugins(const std::vector<std::pair<std::string, std::vector<std::string>>>& plugins,
                  std::vector<std::string>& order);

// Sets a level by name on `logger`; an unknown one falls back to `fallback` and leaves
// the text to log in `complaint`. Returns the name in force.
std::string ApplyLogLevel(Logger* logger, const std::string& key, const std::string& wanted,
                          const std::string& fallback, bool memory, std::string& complaint);

// Makes `alerts` the application's (GetAlerts); null forgets them.
void InstallAlerts(Alerts* alerts);

// Stops the application's reaper and forgets it.
void ReleaseChildReaper();

// The process's app, for the units that act on it (signals); null when none.
Ref<AppImpl> GetAppImpl();

}  // namespace Pelmora::Service
