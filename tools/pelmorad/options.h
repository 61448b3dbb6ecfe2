#pragma once
// pelmorad's command line. Parsing never exits: a bad flag is a UsageError whose text is
// the one line the program prints before exiting with status 2.

#include <stdexcept>
#include <string>

namespace Pelmora::Daemon {

class UsageError : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

struct Options {
   enum class Action { kRun, kHelp, kVersion, kPrintDefaultConfig };
   Action action = Action::kRun;
   std::string configFile;
   // Empty, or -1: as the configuration says.
   std::string listen;
   int port = -1;
   std::string stateDir;
};

// Flags take their value as the next argument or after "=" ("--port 8081", "--port=8081").
Options ParseOptions(int argc, const char* const* argv);
const char* GetUsageText();

}  // namespace Pelmora::Daemon
