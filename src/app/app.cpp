// The application object: creation, start-up in order, the registry, Run, Stop and Exit.

#include "src/app/appImpl.h"

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <unordered_set>

#include <sys/wait.h>
#include <unistd.h>

#include "pelmora/exception/backtrace.h"
#include "pelmora/exception/debugConfig.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/object/scoreboard.h"
#include "pelmora/service/logMacros.h"

namespace Pelmora::Service {

namespace {

std::mutex& GlobalMutex() {
   static std::mutex* const mutex = new std::mutex();  // used by exit handlers
   return *mutex;
}
Ref<AppImpl>& GlobalApp() {
   static Ref<AppImpl>* const app = new Ref<AppImpl>();
   return *app;
}
bool g_created = false;
Ref<AppInfo>& PendingInfo() {
   static Ref<AppInfo>* const info = new Ref<AppInfo>();
   return *info;
}
std::atomic<bool> g_alertOnMissingQuickExit{false};
std::atomic<bool> g_exitHookRegistered{false};

void DoQuickExit() {
   if (!g_alertOnMissingQuickExit.load()) return;
   static const char warning[] =
       "WARNING: This application is not using QuickExit(). The exit code will be set to 0.\n";
   ssize_t ignored = write(STDERR_FILENO, warning, sizeof(warning) - 1);
   (void)ignored;
   _exit(0);
}

// Reads a key, keeping `value` when it is absent; a malformed value is logged and the
// default kept.
template <class T>
void ReadSetting(Config::View* view, Logger* logger, const std::string& key, T& value) {
   try {
      view->Get(key, &value);
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(logger, "Encountered errors while reading %1: %2", key, e.GetMessage());
   }
}

std::string ProgramName() {
   return program_invocation_short_name ? program_invocation_short_name : "";
}

// A child that dumps core at once: the libraries a later dump needs are then resident.
void GenerateOneCoreDump() {
   pid_t child = fork();
   if (child == 0) {
      signal(SIGABRT, SIG_DFL);
      abort();
   }
   if (child > 0) {
      int status = 0;
      while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
      }
   }
}

}  // namespace

Ref<AppImpl> GetAppImpl() {
   std::lock_guard<std::mutex> lock(GlobalMutex());
   return GlobalApp();
}

void CreateApp() {
   std::lock_guard<std::mutex> lock(GlobalMutex());
   if (g_created) throw AlreadyInitializedException();
   g_created = true;
   GlobalApp() = new AppImpl();
}

App* GetApp() {
   std::lock_guard<std::mutex> lock(GlobalMutex());
   return GlobalApp().Get();
}

namespace {

// The part every InitApp shares once it has a configuration.
void InitCreated(Config* config) {
   Ref<AppImpl> app = GetAppImpl();
   app->Init(config);
   app->LoadPlugins();
   app->InitPlugins();
}

}  // namespace

void InitApp() {
   CreateApp();
   Ref<Config> config;
   CreateScratchConfig(config);
   InitCreated(config.Get());
}

void InitApp(const std::string& configFile) {
   CreateApp();
   Ref<Config> config;
   CreateXmlFileConfig(configFile, -1, 0, config);
   InitCreated(config.Get());
}

void InitApp(Config* config) {
   CreateApp();
   InitCreated(config);
}

void InitApp(Config* defaults, const std::string& configFile) {
   CreateApp();
   Ref<Config> config;
   CreateXmlFileConfig(configFile, -1, 0, config);
   Ref<Config::View> defaultsView;
   defaults->GetMainView(defaultsView);
   SetConfigDefaults(config.Get(), defaultsView.Get());
   InitCreated(config.Get());
}

void InitApp(const std::string& logName, const std::string& logDirectory,
             const std::string& configFile) {
   Ref<Config> defaults;
   CreateScratchConfig(defaults);
   Ref<Config::View> view;
   defaults->GetMainView(view);
   view->Set("log/name", logName);
   view->Set("log/directory", logDirectory);
   InitApp(defaults.Get(), configFile);
}

void SetAppInfo(AppInfo* info) {
   PELMORA_VERIFY(info);
   Ref<AppImpl> app;
   {
      std::lock_guard<std::mutex> lock(GlobalMutex());
      PendingInfo() = info;
      app = GlobalApp();
   }
   if (app) app->SetInfo(info);
}

void SetAlertOnMissingQuickExit(bool on) { g_alertOnMissingQuickExit.store(on); }
bool GetAlertOnMissingQuickExit() { return g_alertOnMissingQuickExit.load(); }

void QuickExit(int status) {
   try {
      GetDefaultLogManager()->Flush();
   } catch (...) {
   }
   fflush(nullptr);
   _exit(status);
}

AppImpl::AppImpl() = default;

void AppImpl::Init(Config* config) {
   if (!config) throw InvalidArgumentException("config");
   Logger* log = GetDefaultLogger();
   // 1. The configuration and the program's identity.
   {
      Ref<Config::View> view;
      config->GetMainView(view);
      Ref<AppInfo> info;
      {
         std::lock_guard<std::mutex> lock(GlobalMutex());
         info = PendingInfo();
      }
      if (!info) info = new AppInfo(ProgramName(), "");
      System::Synchronized lock(this);
      if (_initialized) throw AlreadyInitializedException();
      _config = config;
      _view = view;
      _info = info;
      _logManager = GetDefaultLogManager();
      _logger = log;
   }
   // 2. Debug settings.
   {
      DebugConfig& debug = GetDebugConfig();
      bool prefetchSymbols = false, prefetchCoreDumpLibs = false, resolveSymbols = true;
      int backtraceSize = debug.GetExceptionBacktrace();
      ReadSetting(_view.Get(), log, "pelmora/debug/prefetchSymbols", prefetchSymbols);
      ReadSetting(_view.Get(), log, "pelmora/debug/prefetchCoreDumpLibs", prefetchCoreDumpLibs);
      ReadSetting(_view.Get(), log, "pelmora/debug/resolveSymbols", resolveSymbols);
      ReadSetting(_view.Get(), log, "pelmora/debug/exceptionBacktraceLogSize", backtraceSize);
      debug.SetPrefetchSymbols(prefetchSymbols);
      debug.SetPrefetchCoreDumpLibs(prefetchCoreDumpLibs);
      debug.SetResolveSymbols(resolveSymbols);
      debug.SetExceptionBacktrace(backtraceSize);
      if (prefetchSymbols) {
         // Resolving one backtrace loads the unwinder and the symbol tables now, not
         // during the first panic.
         Ref<System::Backtrace> trace;
         System::CaptureBacktrace(0, trace);
         trace->GetText();
      }
   }
   // 3.
   InitializeLogging();
   // 4. No separate low-level library logs in this process; the switch is reported.
   bool handleTarnLogging = true;
   ReadSetting(_view.Get(), log, "pelmora/handleTarnLogging", handleTarnLogging);
   if (handleTarnLogging) {
      PELMORA_LOG_INFO(log, "Handling tarn/lib logs with PelMora facilities");
   } else {
      PELMORA_LOG_INFO(log, "tarn/lib logs will NOT be handled by PelMora");
   }
   // 5.
   ReadPanicSettings();
   // 6.
   {
      Ref<ChannelManager> channels;
      CreateChannelManager(channels);
      System::Synchronized lock(this);
      _channels = channels;
   }
   PELMORA_LOG_INFO(log, "Initialized channel manager");
   InitializeRefTracker();
   {
      Ref<Alerts> alerts;
      CreateLogAlerts(alerts);
      InstallAlerts(alerts.Get());
   }
   // 7.
   std::string workingDir;
   ReadSetting(_view.Get(), log, "workingDir", workingDir);
   if (!workingDir.empty() && chdir(workingDir.c_str()) != 0) {
      int error = errno;
      PELMORA_LOG_ERROR(log, "Failed to set the current working directory: %1, %2", workingDir,
                        System::GetErrorMessage(error));
   }
   {
      char buffer[PATH_MAX];
      PELMORA_LOG_INFO(log, "Current working directory: %1",
                       getcwd(buffer, sizeof(buffer)) ? buffer : "");
   }
   // 8.
   if (GetDebugConfig().GetPrefetchCoreDumpLibs()) {
      PELMORA_LOG_WARNING(log,
                          "Prefetching core dump libs. A core dump may be created in the process.");
      GenerateOneCoreDump();
   }
   // 9.
   {
      const bool defaultValue = false;
      bool panicOnNewFailure = defaultValue;
      try {
         _view->Get("panicOnNewFailure", &panicOnNewFailure);
      } catch (const Exception& e) {
         panicOnNewFailure = defaultValue;
         PELMORA_LOG_WARNING(log,
                             "Encountered errors while reading panicOnNewFailure parameter: %1\n "
                             "assuming default value (%2)",
                             e.GetMessage(), defaultValue ? "true" : "false");
      }
      if (panicOnNewFailure) InstallNewHandler();
   }
   // 10. The pool leaves Init with its exception: nothing runs without it.
   {
      Ref<Config::View> poolView;
      _view->GetView("pelmora/threadPool", poolView);
      Ref<System::ThreadPool> pool;
      System::CreateThreadPool(poolView.Get(), pool);
      System::SetThreadPool(pool.Get());
      System::Synchronized lock(this);
      _pool = pool;
   }
   try {
      LoadXmlDocLimits(_view.Get());
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(log, "Encountered errors while reading XML limits: %1", e.GetMessage());
   }
   StartDaemonParts();
   // 11.
   bool useStackTracer = false;
   ReadSetting(_view.Get(), log, "pelmora/useStackTracer", useStackTracer);
   if (useStackTracer) EnableStackTracer();
   bool impersonate = false;
   ReadSetting(_view.Get(), log, "pelmora/impersonate", impersonate);
   if (impersonate) {
      std::string user, group;
      ReadSetting(_view.Get(), log, "pelmora/impersonation/user", user);
      ReadSetting(_view.Get(), log, "pelmora/impersonation/group", group);
      // Running on as root after being told to drop it is worse than not starting.
      Impersonate(user, group);
      PELMORA_LOG_INFO(log, "Impersonating user %1", user);
      System::Synchronized lock(this);
      _impersonating = true;
   }
   // 12.
   bool sysCommand = false;
   ReadSetting(_view.Get(), log, "pelmora/sysCommand/enable", sysCommand);
   if (sysCommand) {
      int idlePollMs = 100;
      ReadSetting(_view.Get(), log, "pelmora/sysCommand/reaperPollMs", idlePollMs);
      bool initReaper = false;
      try {
         Ref<ChildReaper> reaper;
         CreateChildReaper(idlePollMs, reaper);
         initReaper = true;
      } catch (const Exception& e) {
         PELMORA_LOG_ERROR(log, "Failed to start the child reaper: %1", e.GetMessage());
      }
      PELMORA_VERIFY(initReaper == true);
   }
   // 13.
   bool alert = false;
   ReadSetting(_view.Get(), log, "pelmora/alertOnMissingQuickExit", alert);
   SetAlertOnMissingQuickExit(alert);
   if (!g_exitHookRegistered.exchange(true)) atexit(&DoQuickExit);

   System::Synchronized lock(this);
   _initialized = true;
}

void AppImpl::ReadPanicSettings() {
   try {
      bool outputToFiles = true;
      std::string logDirectory, logName, panicDirectory, panicName;
      _view->Get("log/outputToFiles", &outputToFiles);
      _view->Get("log/directory", &logDirectory);
      _view->Get("log/name", &logName);
      _view->Get("panic/directory", &panicDirectory);
      _view->Get("panic/name", &panicName);
      if (panicDirectory.empty() && outputToFiles) panicDirectory = logDirectory;
      if (panicName.empty() && !logName.empty()) panicName = logName + ".panic";
      if (!panicDirectory.empty() && !panicName.empty()) {
         SetPanicLocation(panicDirectory, panicName);
      }
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(_logger.Get(),
                          "Encountered errors while reading log/panic parameters:\nException: %1",
                          e.GetMessage());
   }
}

// "refTracker/<entry>/className" names each class (mangled) whose references are traced.
void AppImpl::InitializeRefTracker() {
   try {
      std::vector<std::string> entries;
      _view->GetChildNames("refTracker", entries);
      std::unordered_set<std::string> classes;
      for (const std::string& entry : entries) {
         std::string name;
         if (_view->Get("refTracker/" + entry + "/className", &name) && !name.empty()) {
            classes.insert(name);
         }
      }
      if (classes.empty()) return;
      Ref<RefTracker> tracker;
      CreateRefTracker(classes, tracker);
      PELMORA_LOG_INFO(_logger.Get(), "Tracking references of %1 classes",
                       static_cast<int>(classes.size()));
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(_logger.Get(), "Encountered errors while reading refTracker: %1",
                          e.GetMessage());
   }
}

Ref<Logger> AppImpl::GetAppLogger() {
   System::Synchronized lock(this);
   return _logger;
}
Ref<LogManager> AppImpl::GetAppLogManager() {
   System::Synchronized lock(this);
   return _logManager;
}
Ref<System::ThreadPool> AppImpl::GetThreadPool() {
   System::Synchronized lock(this);
   return _pool;
}
Ref<Config> AppImpl::GetConfig() {
   System::Synchronized lock(this);
   return _config;
}
Ref<AppInfo> AppImpl::GetAppInfo() {
   {
      System::Synchronized lock(this);
      if (_info) return _info;
   }
   std::lock_guard<std::mutex> lock(GlobalMutex());
   return PendingInfo();
}

void AppImpl::RegisterObject(const std::string& name, Object* object) {
   System::Synchronized lock(this);
   if (!_objects.emplace(name, Ref<Object>(object)).second) throw AlreadyExistsException(name);
}

void AppImpl::UnregisterObject(const std::string& name) {
   Ref<Object> released;  // dropped outside the lock: its destructor may call back
   System::Synchronized lock(this);
   auto it = _objects.find(name);
   if (it == _objects.end()) throw NotFoundException("Object not registered: " + name);
   released = std::move(it->second);
   _objects.erase(it);
}

void AppImpl::LookupObject(const std::string& name, Ref<Object>& out) {
   System::Synchronized lock(this);
   auto it = _objects.find(name);
   if (it == _objects.end()) throw NotFoundException("Object not registered: " + name);
   out = it->second;
}

void AppImpl::GetObjects(RefMap<std::string, Object>& out) {
   System::Synchronized lock(this);
   out = _objects;
}

void AppImpl::CreateChannelReader(const std::string& name, const ChannelCallback& callback,
                                  Ref<ChannelReader>& out) {
   Ref<ChannelManager> channels;
   {
      System::Synchronized lock(this);
      channels = _channels;
   }
   if (!channels) throw NotInitializedException("Application", "channel manager");
   channels->CreateChannelReader(name, callback, out);
}

void AppImpl::CreateChannelWriter(const std::string& name, Ref<ChannelWriter>& out) {
   Ref<ChannelManager> channels;
   {
      System::Synchronized lock(this);
      channels = _channels;
   }
   if (!channels) throw NotInitializedException("Application", "channel manager");
   channels->CreateChannelWriter(name, out);
}

void AppImpl::Run() {
   Ref<System::ThreadPool> pool = GetThreadPool();
   if (!pool) throw NotInitializedException("Application", "thread pool");
   StartPlugins();
   Ref<Notifier> notifier;
   {
      System::Synchronized lock(this);
      notifier = _notifier;
   }
   if (notifier) notifier->Send("READY=1\nSTATUS=Running\nMAINPID=" + std::to_string(getpid()));
   pool->MainThreadRun();
}

void AppImpl::SetExitStatus(int status) { _exitStatus.store(status); }
int AppImpl::GetExitStatus() { return _exitStatus.load(); }

void AppImpl::Stop() {
   Ref<System::ThreadPool> pool = GetThreadPool();
   if (pool) pool->RequestShutdown();
}

void AppImpl::Exit() {
   Ref<AppImpl> self(this);  // the global reference goes at the end
   Ref<System::ThreadPool> pool;
   {
      System::Synchronized lock(this);
      if (!_initialized) return;
      pool = _pool;
   }
   Logger* log = _logger.Get();
   int waitSecs = 15;
   ReadSetting(_view.Get(), log, "app/shutdownWaitTimeInSecs", waitSecs);
   Ref<Notifier> notifier;
   {
      System::Synchronized lock(this);
      notifier = _notifier;
   }
   if (notifier) notifier->Send("STOPPING=1\nSTATUS=Stopping");
   PELMORA_LOG_INFO(log, "Application exiting with status %1", GetExitStatus());
   pool->RequestShutdown();
   if (!pool->WaitShutdown(static_cast<long long>(waitSecs) * 1000000)) {
      PELMORA_LOG_WARNING(log, "Thread pool still busy after %1 seconds; exiting anyway", waitSecs);
   }
   ShutdownPlugins();
   bool impersonating;
   {
      System::Synchronized lock(this);
      impersonating = std::exchange(_impersonating, false);
   }
   // The drop is for good: nothing is given back, only its end noted.
   if (impersonating) PELMORA_LOG_INFO(log, "Impersonation shut down");
   StopDaemonParts();
   ReleaseChildReaper();

   Ref<ChannelManager> channels;
   RefMap<std::string, Object> objects;
   Ref<Config> config;
   Ref<Config::View> view;
   {
      System::Synchronized lock(this);
      channels = std::move(_channels);
      objects.swap(_objects);
      config = std::move(_config);
      view = std::move(_view);
      _pool.Reset();
      _initialized = false;
   }
   if (channels) channels->Close();
   InstallAlerts(nullptr);
   objects.clear();
   try {
      GetDefaultLogManager()->Flush();
   } catch (...) {
   }
   std::lock_guard<std::mutex> lock(GlobalMutex());
   GlobalApp().Reset();
}

}  // namespace Pelmora::Service

namespace Pelmora::Service {

void AppImpl::SetInfo(AppInfo* info) {
   System::Synchronized lock(this);
   _info = info;
}

}  // namespace Pelmora::Service
