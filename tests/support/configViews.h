#pragma once
// Small readers and scratch views of configurations, shared by the tests.

#include <string>
#include <utility>
#include <vector>

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

// A view of `subtree` in a scratch configuration holding `values`: settings for one test.
inline Ref<Service::Config::View> ScratchView(const std::string& subtree,
                                              const std::vector<std::pair<std::string, std::string>>& values) {
   Ref<Service::Config> config;
   Service::CreateScratchConfig(config);
   Ref<Service::Config::View> view;
   config->GetView(subtree, view);
   for (const auto& [key, value] : values) view->Set(key, value.c_str());
   return view;
}

}  // namespace Pelmora::TestSupport
