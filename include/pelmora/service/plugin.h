#pragma once
// Plug-ins: shared libraries that add services to a program at start-up. The application
// loads those its configuration lists, dependencies first, and keeps each plug-in object
// with the library it came from until Exit, which shuts them down in reverse load order.
//
// Configuration: one child of "plugins" per plug-in, its tag the plug-in's name:
//   plugins/<name>/path        the library file; relative paths are taken from
//                              "plugins/baseDirectory" (default: the executable's directory)
//   plugins/<name>/depends/*   each child's value names a plug-in loaded before this one
//   plugins/<name>/enable      "false" skips the plug-in (default true)
// A library exports `extern "C" Pelmora::Service::Plugin* PelmoraPluginEntry()` (or the
// older name PluginEntry) returning a new plug-in object; the caller takes the first
// reference. Plug-in objects are used from the main thread only.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::System {

// A shared library opened with dlopen; closed when the last reference goes. Thread-safe.
class PELMORA_EXPORT SharedLibrary : public virtual Object {
public:
   virtual const std::string& GetPath() const = 0;
   // The address of `name`, or null when the library does not define it.
   virtual void* FindSymbol(const std::string& name) = 0;
};

// Opens `path` (resolving every symbol now, local to the library).
// FileIONotFoundException when the file does not exist; SystemException with the
// loader's text for any other failure.
PELMORA_EXPORT void OpenSharedLibrary(const std::string& path, Ref<SharedLibrary>& out);

}  // namespace Pelmora::System

namespace Pelmora::Service {

class PELMORA_EXPORT Plugin : public virtual Object {
public:
   // Every loaded plug-in is initialised before any is started.
   virtual void Init() = 0;
   virtual void Start() = 0;
   virtual void Shutdown() = 0;
};

using PluginEntryFunction = Plugin* (*)();
constexpr const char* kPluginEntrySymbol = "PelmoraPluginEntry";
constexpr const char* kPluginEntrySymbolOld = "PluginEntry";

}  // namespace Pelmora::Service
