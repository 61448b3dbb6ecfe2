// Plug-ins: the shared-library wrapper, dependency ordering, loading, and the calls into
// the loaded plug-ins.

#include <dlfcn.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <set>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/service/logMacros.h"
#include "src/app/appImpl.h"

namespace Pelmora::System {

namespace {

class SharedLibraryImpl : public virtual SharedLibrary, public ObjectImpl {
public:
   SharedLibraryImpl(std::string path, void* handle) : _path(std::move(path)), _handle(handle) {}
   ~SharedLibraryImpl() override { dlclose(_handle); }
   const std::string& GetPath() const override { return _path; }
   void* FindSymbol(const std::string& name) override { return dlsym(_handle, name.c_str()); }

private:
   std::string _path;
   void* _handle;
};

}  // namespace

void OpenSharedLibrary(const std::string& path, Ref<SharedLibrary>& out) {
   bool hasSlash = path.find('/') != std::string::npos;
   struct stat info;
   if (hasSlash && stat(path.c_str(), &info) != 0 && errno == ENOENT) {
      throw FileIONotFoundException("Shared library not found", path);
   }
   void* handle = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
   if (!handle) {
      const char* error = dlerror();
      std::string text = error ? error : "dlopen failed";
      // The loader searched its paths for a bare name and found nothing.
      if (!hasSlash && text.find("No such file") != std::string::npos) {
         throw FileIONotFoundException("Shared library not found", path);
      }
      throw SystemException(0, text);
   }
   out = new SharedLibraryImpl(path, handle);
}

}  // namespace Pelmora::System

namespace Pelmora::Service {

namespace {

using PluginList = std::vector<std::pair<std::string, std::vector<std::string>>>;

// AddPluginWithDepends: `name` after its dependencies; `resolving` holds the plug-ins
// whose dependencies are being resolved now.
void AddPluginWithDepends(const PluginList& plugins, const std::string& name,
                          std::set<std::string>& resolving, std::set<std::string>& done,
                          std::vector<std::string>& order) {
   if (done.count(name)) return;
   if (!resolving.insert(name).second) {
      throw InvalidStateException(
          MessageFormatter::ASPrint("Cyclic dependency detected for plugin: %1", name));
   }
   for (const auto& [listed, depends] : plugins) {
      if (listed != name) continue;
      for (const std::string& dependency : depends) {
         bool known = false;
         for (const auto& other : plugins) known = known || other.first == dependency;
         if (!known) {
            throw InvalidStateException(MessageFormatter::ASPrint(
                "Missing dependency [%1] for plugin [%2]", dependency, name));
         }
         AddPluginWithDepends(plugins, dependency, resolving, done, order);
      }
      break;
   }
   resolving.erase(name);
   done.insert(name);
   order.push_back(name);
}

std::string ExecutableDirectory() {
   char buffer[PATH_MAX];
   ssize_t n = readlink("/proc/self/exe", buffer, sizeof(buffer) - 1);
   if (n <= 0) return ".";
   std::string path(buffer, static_cast<size_t>(n));
   size_t slash = path.rfind('/');
   return slash == std::string::npos ? "." : path.substr(0, slash == 0 ? 1 : slash);
}

std::string RealPath(const std::string& path) {
   char buffer[PATH_MAX];
   return realpath(path.c_str(), buffer) ? std::string(buffer) : path;
}

}  // namespace

void OrderPlugins(const PluginList& plugins, std::vector<std::string>& order) {
   std::set<std::string> resolving, done;
   order.clear();
   for (const auto& plugin : plugins) AddPluginWithDepends(plugins, plugin.first, resolving, done, order);
}

void AppImpl::LoadPlugin(const std::string& name, const std::string& path, Ref<Plugin>& out) {
   Ref<System::SharedLibrary> library;
   System::OpenSharedLibrary(path, library);
   void* entry = library->FindSymbol(kPluginEntrySymbol);
   if (!entry) entry = library->FindSymbol(kPluginEntrySymbolOld);
   if (!entry) throw NotFoundException("No plugin entry symbol in " + path);
   // The entry resolved to a copy outside the library: the plug-in was linked in.
   Dl_info where;
   if (dladdr(entry, &where) && where.dli_fname && RealPath(where.dli_fname) != RealPath(path)) {
      PELMORA_LOG_INFO(_logger.Get(), "Plugin %1 statically linked", name);
   }
   Ref<Plugin> plugin(reinterpret_cast<PluginEntryFunction>(entry)());
   if (!plugin) throw InvalidStateException("Plugin entry of " + name + " returned nothing");
   System::Synchronized lock(this);
   if (_plugins.count(name)) throw AlreadyExistsException(name);
   _plugins[name] = std::make_pair(plugin, library);
   _pluginOrder.push_back(name);
   out = plugin;
}

void AppImpl::GetPlugins(PluginMap& out) {
   System::Synchronized lock(this);
   out = _plugins;
}

void AppImpl::LoadPluginLogged(const std::string& name, const std::string& path,
                               const std::string& baseDirectory) {
   Logger* log = _logger.Get();
   PELMORA_LOG_INFO(log, "Trying %1", name);
   std::string absolute = path[0] == '/' ? path : baseDirectory + "/" + path;
   PELMORA_LOG_INFO(log, "Plugin %1 path: %2", name, path);
   PELMORA_LOG_INFO(log, "Plugin %1 absolute path: %2", name, absolute);
   Ref<Plugin> plugin;
   try {
      LoadPlugin(name, path, plugin);
   } catch (const FileIONotFoundException&) {
      if (absolute == path) throw;
      PELMORA_LOG_INFO(log, "NotFound, reload: Plugin %1 absolute path: %2", name, absolute);
      LoadPlugin(name, absolute, plugin);
   }
   PELMORA_LOG_INFO(log, "Loaded plugin %1", name);
}

void AppImpl::LoadPlugins() {
   Logger* log = _logger.Get();
   Ref<Config::View> view;
   {
      System::Synchronized lock(this);
      view = _view;
   }
   if (!view) throw NotInitializedException("Application", "configuration");
   std::string executableDirectory = ExecutableDirectory();
   PELMORA_LOG_INFO(log, "Executable directory: %1", executableDirectory);
   std::string baseDirectory = executableDirectory;
   PluginList plugins;
   std::map<std::string, std::string> paths;
   try {
      view->Get("plugins/baseDirectory", &baseDirectory);
      std::vector<std::string> names;
      view->GetChildNames("plugins", names);
      for (const std::string& name : names) {
         if (name == "baseDirectory") continue;
         const std::string key = "plugins/" + name;
         bool enable = true;
         view->Get(key + "/enable", &enable);
         if (!enable) continue;
         std::string path = "lib" + name + ".so";
         view->Get(key + "/path", &path);
         std::vector<std::string> dependencyKeys, depends;
         view->GetChildNames(key + "/depends", dependencyKeys);
         for (const std::string& dependencyKey : dependencyKeys) {
            std::string dependency;
            if (view->Get(key + "/depends/" + dependencyKey, &dependency) && !dependency.empty()) {
               depends.push_back(dependency);
            }
         }
         plugins.emplace_back(name, depends);
         paths[name] = path;
      }
   } catch (const Exception& e) {
      PELMORA_LOG_ERROR(log, "Encountered errors while reading plugins: %1", e.GetMessage());
      return;
   }
   PELMORA_LOG_INFO(log, "Plugin base directory: %1", baseDirectory);
   std::vector<std::string> order;
   try {
      OrderPlugins(plugins, order);
   } catch (const InvalidStateException& e) {
      PELMORA_LOG_ERROR(log, "%1", e.GetMessage());
      return;
   }
   for (const std::string& name : order) {
      try {
         LoadPluginLogged(name, paths[name], baseDirectory);
      } catch (const Exception& e) {
         PELMORA_LOG_ERROR(log, "Failed to load plugin %1: %2", name, e.GetMessage());
      }
   }
}

void AppImpl::InitPlugins() {
   PluginMap plugins;
   std::vector<std::string> order;
   {
      System::Synchronized lock(this);
      plugins = _plugins;
      order = _pluginOrder;
   }
   for (const std::string& name : order) plugins[name].first->Init();
}

void AppImpl::StartPlugins() {
   PluginMap plugins;
   std::vector<std::string> order;
   {
      System::Synchronized lock(this);
      plugins = _plugins;
      order = _pluginOrder;
   }
   for (const std::string& name : order) plugins[name].first->Start();
}

// Reverse load order, so a plug-in stops before those it depends on. Each object goes
// before its library: its code lives there.
void AppImpl::ShutdownPlugins() {
   PluginMap plugins;
   std::vector<std::string> order;
   {
      System::Synchronized lock(this);
      plugins.swap(_plugins);
      order.swap(_pluginOrder);
   }
   for (auto it = order.rbegin(); it != order.rend(); ++it) {
      auto& entry = plugins[*it];
      try {
         entry.first->Shutdown();
      } catch (const Exception& e) {
         PELMORA_LOG_ERROR(_logger.Get(), "Plugin %1 failed to shut down: %2", *it, e.GetMessage());
      }
      entry.first.Reset();
      entry.second.Reset();
   }
}

}  // namespace Pelmora::Service
