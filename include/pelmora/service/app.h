#pragma once
// The application object: the process-wide root of a service. A process creates it once
// (InitApp); from then on every part reaches the configuration, the loggers and the thread
// pool through it. It loads plug-ins, keeps a registry of named objects, lends the main
// thread to the pool (Run) and ends the process in order (Stop, Exit). One per process;
// every operation but Init, Run and Exit may be called from any thread.

#include <map>
#include <string>
#include <utility>

#include "pelmora/object/containers.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/appChannels.h"
#include "pelmora/service/config.h"
#include "pelmora/service/logger.h"
#include "pelmora/service/plugin.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/threadPool.h"

namespace Pelmora::Service {

// The identity of the running program. Init makes one from the program's name when the
// program did not set its own (SetAppInfo).
class PELMORA_EXPORT AppInfo : public ObjectImpl {
public:
   AppInfo() = default;
   AppInfo(std::string name, std::string version)
      : _name(std::move(name)), _version(std::move(version)) {}
   const std::string& GetName() const { return _name; }
   const std::string& GetVersion() const { return _version; }

private:
   std::string _name;
   std::string _version;
};

class PELMORA_EXPORT App : public virtual System::LockableObject {
public:
   using PluginMap = std::map<std::string, std::pair<Ref<Plugin>, Ref<System::SharedLibrary>>>;

   // Starts the process's services from `config` (kept). Configuration errors are logged
   // and defaults used; a thread pool that cannot be made throws.
   virtual void Init(Config* config) = 0;
   virtual Ref<Logger> GetAppLogger() = 0;
   virtual Ref<LogManager> GetAppLogManager() = 0;
   virtual Ref<System::ThreadPool> GetThreadPool() = 0;
   virtual Ref<Config> GetConfig() = 0;
   // Opens `path`, calls its entry symbol and keeps the plug-in under `name`.
   virtual void LoadPlugin(const std::string& name, const std::string& path, Ref<Plugin>& out) = 0;
   virtual void GetPlugins(PluginMap& out) = 0;

   // The registry keeps a reference to each object. AlreadyExistsException for a taken
   // name; NotFoundException for an absent one.
   virtual void RegisterObject(const std::string& name, Object* object) = 0;
   virtual void UnregisterObject(const std::string& name) = 0;
   virtual void LookupObject(const std::string& name, Ref<Object>& out) = 0;
   virtual void GetObjects(RefMap<std::string, Object>& out) = 0;

   virtual void CreateChannelReader(const std::string& name, const ChannelCallback& callback,
                                    Ref<ChannelReader>& out) = 0;
   virtual void CreateChannelWriter(const std::string& name, Ref<ChannelWriter>& out) = 0;

   // Starts the plug-ins (StartPlugins), tells the service manager the process is ready,
   // then the calling (main) thread runs the pool's main-thread queue until it shuts down.
   virtual void Run() = 0;
   virtual void SetExitStatus(int status) = 0;
   virtual int GetExitStatus() = 0;
   // Asks the pool to shut down; nothing before Init made it.
   virtual void Stop() = 0;
   // Waits for the pool ("app/shutdownWaitTimeInSecs", 15 by default), shuts the plug-ins
   // down in reverse load order and releases everything. Nothing when Init did not complete.
   virtual void Exit() = 0;
   virtual Ref<AppInfo> GetAppInfo() = 0;

   // Loads every plug-in listed under "plugins/" (see plugin.h), dependencies first.
   virtual void LoadPlugins() = 0;
   // Init and Start of every loaded plug-in, in load order.
   virtual void InitPlugins() = 0;
   virtual void StartPlugins() = 0;
};

// Creates the application object: AlreadyInitializedException on a second call.
PELMORA_EXPORT void CreateApp();
// The application object, or null before CreateApp and after Exit.
PELMORA_EXPORT App* GetApp();

// CreateApp, Init, LoadPlugins and InitPlugins, with: a scratch configuration; the XML file `configFile`; `config`;
// the file's configuration with `defaults` behind it; a scratch configuration holding
// "log/name" and "log/directory" behind the file's.
PELMORA_EXPORT void InitApp();
PELMORA_EXPORT void InitApp(const std::string& configFile);
PELMORA_EXPORT void InitApp(Config* config);
PELMORA_EXPORT void InitApp(Config* defaults, const std::string& configFile);
PELMORA_EXPORT void InitApp(const std::string& logName, const std::string& logDirectory,
                            const std::string& configFile);

// What SIGHUP does when the application handles signals: refreshes the configuration
// (applying changed log levels) and reopens the log files. For a program that takes the
// signals itself ("pelmora/daemon/handleSignals" false). Nothing before Init.
PELMORA_EXPORT void ReloadApp();

// Stores the program's identity record; null is a panic.
PELMORA_EXPORT void SetAppInfo(AppInfo* info);

// With the alert on, a process that ends through exit() instead of QuickExit writes a
// warning and exits with status 0.
PELMORA_EXPORT void SetAlertOnMissingQuickExit(bool on);
PELMORA_EXPORT bool GetAlertOnMissingQuickExit();
// Ends the process at once with `status`: logs are flushed, exit handlers and static
// destructors are skipped (detached threads may still be using what they would destroy).
[[noreturn]] PELMORA_EXPORT void QuickExit(int status);

}  // namespace Pelmora::Service
