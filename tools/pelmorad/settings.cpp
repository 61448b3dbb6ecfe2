#include "tools/pelmorad/settings.h"

#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "pelmora/exception/throwable.h"
#include "pelmora/io/gzip.h"
#include "pelmora/io/readers.h"
#include "tools/pelmorad/embedded.h"

namespace Pelmora::Daemon {

namespace {

bool EndsWith(const std::string& text, const std::string& suffix) {
   return text.size() >= suffix.size() &&
          text.compare(text.size() - suffix.size(), suffix.size(), suffix) == 0;
}

std::string ReadWholeFile(const std::string& path) {
   std::ifstream in(path, std::ios::binary);
   if (!in) throw ConfigError("cannot read configuration " + path + ": " + std::strerror(errno));
   std::ostringstream text;
   text << in.rdbuf();
   return text.str();
}

std::string Gunzip(const std::string& bytes, const std::string& path) {
   Ref<StringReader> source;
   CreateStringReader(bytes.data(), static_cast<int>(bytes.size()), source);
   Ref<Reader> reader;
   CreateGzippedFileReader(source.Get(), path, reader);
   std::string out;
   char buffer[16384];
   int n;
   while ((n = reader->Read(buffer, sizeof buffer)) > 0) out.append(buffer, static_cast<size_t>(n));
   reader->Close();
   return out;
}

// Compressed flat and properties files are read once into memory: the configuration
// keeps a reference to its text, so the text lives as long as the process.
std::string& KeepText(std::string text) {
   static std::string* const kept = new std::string();
   *kept = std::move(text);
   return *kept;
}

void OpenFile(const std::string& path, Ref<Service::Config>& out) {
   // Opening a file that is not there reads as an empty configuration in some syntaxes;
   // a named file must exist.
   std::error_code error;
   if (!std::filesystem::is_regular_file(path, error)) {
      throw ConfigError("cannot read configuration " + path + ": " +
                        (std::filesystem::exists(path, error) ? "not a regular file"
                                                              : "no such file"));
   }
   const bool gzip = EndsWith(path, ".gz");
   const std::string name = gzip ? path.substr(0, path.size() - 3) : path;
   if (EndsWith(name, ".xml")) {
      Service::CreateXmlFileConfig(name, -1, gzip ? Service::kConfigFlagGzip : 0, out);
   } else if (!gzip) {
      if (EndsWith(name, ".properties")) {
         Service::CreatePropertiesFileConfig(path, -1, out);
      } else {
         Service::CreateFlatFileConfig(path, -1, out);
      }
   } else if (EndsWith(name, ".properties")) {
      // Properties are read from files only: through a private temporary copy.
      std::string text = Gunzip(ReadWholeFile(path), path);
      char scratch[] = "/tmp/pelmorad-configXXXXXX";
      int fd = ::mkstemp(scratch);
      if (fd < 0) throw ConfigError("cannot read configuration " + path + ": " + std::strerror(errno));
      bool written = ::write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
      ::close(fd);
      try {
         if (!written) throw ConfigError("cannot read configuration " + path + ": short write");
         Service::CreatePropertiesFileConfig(scratch, static_cast<int>(text.size()) + 1, out);
      } catch (...) {
         ::unlink(scratch);
         throw;
      }
      ::unlink(scratch);
   } else {
      Service::CreateFlatStringConfig(KeepText(Gunzip(ReadWholeFile(path), path)), out);
   }
}

std::string GetOr(Service::Config::View* view, const std::string& key, const std::string& fallback) {
   std::string value;
   if (view->Get(key, &value) && !value.empty()) return value;
   return fallback;
}

std::string Environment(const char* name) {
   const char* value = std::getenv(name);
   // systemd may list several directories separated by ':'; the first is ours.
   std::string text = value ? value : "";
   return text.substr(0, text.find(':'));
}

std::string MakeDirectory(const std::string& path, const char* what) {
   std::error_code error;
   std::filesystem::path absolute = std::filesystem::absolute(path, error);
   if (!error) std::filesystem::create_directories(absolute, error);
   if (error) throw ConfigError(std::string("cannot create the ") + what + " " + path + ": " + error.message());
   return absolute.lexically_normal().string();
}

}  // namespace

std::string GetDefaultConfigText() {
   const EmbeddedFile* file = FindEmbeddedFile("defaults.xml");
   return std::string(reinterpret_cast<const char*>(file->data), file->size);
}

void LoadConfiguration(const Options& options, Ref<Service::Config>& out, std::string& stateDirOut) {
   Ref<Service::Config> config;
   try {
      if (options.configFile.empty()) {
         Service::CreateScratchConfig(config);
      } else {
         OpenFile(options.configFile, config);
      }
      // The defaults config reads its text now and is dropped once copied.
      std::string defaultsText = GetDefaultConfigText();
      Ref<Service::Config> defaults;
      Service::CreateXmlStringConfig(defaultsText, defaults);
      Ref<Service::Config::View> defaultsView;
      defaults->GetMainView(defaultsView);
      Service::SetConfigDefaults(config.Get(), defaultsView.Get());
   } catch (const Exception& e) {
      throw ConfigError("cannot read configuration " + options.configFile + ": " + e.GetMessage());
   }
   Ref<Service::Config::View> view, fallback;
   config->GetMainView(view);
   config->GetDefaultsMainView(fallback);
   std::string stateDir = options.stateDir;
   if (stateDir.empty()) stateDir = GetOr(view.Get(), "pelmorad/stateDir", Environment("STATE_DIRECTORY"));
   if (stateDir.empty()) stateDir = "pelmorad-state";
   stateDir = MakeDirectory(stateDir, "state directory");
   fallback->Set("pelmorad/stateDir", stateDir);
   std::string logDir = GetOr(view.Get(), "log/directory", Environment("LOGS_DIRECTORY"));
   if (logDir.empty()) logDir = stateDir + "/log";
   // An empty value in the file (the printed defaults have one) means the default too,
   // which lives in the defaults tree: the empty one would hide it.
   std::string given;
   if (view->Get("log/directory", &given) && given.empty()) view->Unset("log/directory");
   fallback->Set("log/directory", MakeDirectory(logDir, "log directory"));
   out = config;
   stateDirOut = stateDir;
}

}  // namespace Pelmora::Daemon
