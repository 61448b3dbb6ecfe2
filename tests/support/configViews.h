#pragma once
// Small readers of a configuration's main tree, shared by the configuration tests.

#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"

namespace Pelmora::TestSupport {

inline Ref<Service::Config::View> MainView(Service::Config* config) {
   Ref<Service::Config::View> view;
   config->GetMainView(view);
   return view;
}

// The value at `path`, or "<absent>".
inline std::string Text(Service::Config* config, const std::string& path) {
   std::string value;
   return MainView(config)->Get(path, &value) ? value : "<absent>";
}

using StringFactory = void (*)(std::string&, Ref<Service::Config>&);

// The FileFormatException text `factory` raises for `text`, or "no exception".
inline std::string ParseError(StringFactory factory, std::string text) {
   Ref<Service::Config> config;
   try {
      factory(text, config);
   } catch (const FileFormatException& e) {
      return e.what();
   }
   return "no exception";
}

}  // namespace Pelmora::TestSupport
