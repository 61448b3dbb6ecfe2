#include "tools/pelmorad/options.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace Pelmora::Daemon {

namespace {

int ParsePort(const std::string& text) {
   char* end = nullptr;
   errno = 0;
   long value = std::strtol(text.c_str(), &end, 10);
   if (text.empty() || *end != '\0' || errno != 0 || value < 0 || value > 65535) {
      throw UsageError("--port wants a number from 0 to 65535, not '" + text + "'");
   }
   return static_cast<int>(value);
}

}  // namespace

const char* GetUsageText() {
   return "usage: pelmorad [options]\n"
          "Runs the management daemon in the foreground until SIGTERM or Ctrl-C.\n"
          "With no options it serves its status page on http://127.0.0.1:8080/ from the\n"
          "configuration compiled into it.\n"
          "\n"
          "  --config FILE            settings that override the compiled-in defaults, key\n"
          "                           by key (XML, flat or properties; .gz: compressed)\n"
          "  --listen ADDRESS         address to listen on (pelmorad/http/address)\n"
          "  --port N                 port to listen on, 0 for any free one (pelmorad/http/port)\n"
          "  --state-dir DIR          where the log file and other state go (pelmorad/stateDir)\n"
          "  --print-default-config   write the compiled-in defaults as an XML configuration\n"
          "  --version                print the version\n"
          "  --help                   print this text\n"
          "\n"
          "SIGHUP re-reads a changed configuration file and reopens the log files.\n";
}

Options ParseOptions(int argc, const char* const* argv) {
   Options options;
   bool actionGiven = false;
   auto setAction = [&](Options::Action action, const std::string& flag) {
      if (actionGiven && options.action != action) {
         throw UsageError(flag + " cannot be combined with another of --help, --version, "
                                 "--print-default-config");
      }
      actionGiven = true;
      options.action = action;
   };
   for (int i = 1; i < argc; ++i) {
      std::string arg = argv[i];
      std::string value;
      bool inlineValue = false;
      if (arg.rfind("--", 0) == 0) {
         size_t eq = arg.find('=');
         if (eq != std::string::npos) {
            value = arg.substr(eq + 1);
            arg.resize(eq);
            inlineValue = true;
         }
      }
      auto takeValue = [&]() -> std::string {
         if (inlineValue) return value;
         if (i + 1 >= argc) throw UsageError(arg + " needs a value");
         return argv[++i];
      };
      auto noValue = [&] {
         if (inlineValue) throw UsageError(arg + " takes no value");
      };
      if (arg == "--config") {
         options.configFile = takeValue();
         if (options.configFile.empty()) throw UsageError("--config needs a file name");
      } else if (arg == "--listen") {
         options.listen = takeValue();
         if (options.listen.empty()) throw UsageError("--listen needs an address");
      } else if (arg == "--port") {
         options.port = ParsePort(takeValue());
      } else if (arg == "--state-dir") {
         options.stateDir = takeValue();
         if (options.stateDir.empty()) throw UsageError("--state-dir needs a directory");
      } else if (arg == "--help" || arg == "-h") {
         noValue();
         setAction(Options::Action::kHelp, arg);
      } else if (arg == "--version") {
         noValue();
         setAction(Options::Action::kVersion, arg);
      } else if (arg == "--print-default-config") {
         noValue();
         setAction(Options::Action::kPrintDefaultConfig, arg);
      } else if (arg.rfind("-", 0) == 0) {
         throw UsageError("unknown option " + arg + " (see --help)");
      } else {
         throw UsageError("unexpected argument '" + arg + "' (see --help)");
      }
   }
   return options;
}

}  // namespace Pelmora::Daemon
