#pragma once
// pelmorad's configuration: the defaults compiled into the binary, a file over them key by
// key, and the few places derived from them (the state and log directories).

#include <stdexcept>
#include <string>

#include "pelmora/object/ref.h"
#include "pelmora/service/config.h"
#include "tools/pelmorad/options.h"

namespace Pelmora::Daemon {

// A configuration that cannot be used; the text names the file and the reason.
class ConfigError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

// The compiled-in defaults as an XML configuration (packaging/pelmorad.conf.xml).
std::string GetDefaultConfigText();

// The embedded defaults with `options.configFile` (when given) over them. The syntax
// follows the name: *.xml XML, *.properties properties, anything else flat lines; a
// trailing ".gz" means gzip-compressed. The state directory (flag, then
// "pelmorad/stateDir", then $STATE_DIRECTORY, then ./pelmorad-state) and the log
// directory ("log/directory", then $LOGS_DIRECTORY, then <state>/log) are made absolute,
// created, and stored as defaults so that the application object finds them; the state
// directory is handed back. Compressed files are read once, at start.
void LoadConfiguration(const Options& options, Ref<Service::Config>& out, std::string& stateDir);

}  // namespace Pelmora::Daemon
