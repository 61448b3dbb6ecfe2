// pelmora-config: reads, changes, converts and checks configuration files in the XML, flat
// and properties syntaxes, plain or gzip-compressed. A changed file is replaced whole
// (written beside it, synced, renamed over it), so a crash leaves the old file or the new.

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <functional>
#include <libgen.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/gzip.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"
#include "pelmora/service/config.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

const char kUsage[] =
    "Usage: pelmora-config [--syntax xml|flat|properties] COMMAND FILE [ARGUMENTS]\n"
    "Reads and changes configuration files: XML, flat (key = \"value\") or properties\n"
    "(key = value), plain or gzip-compressed. The syntax follows the name (.xml,\n"
    ".properties, anything else flat; a trailing .gz is skipped) unless --syntax says.\n"
    "\n"
    "Commands:\n"
    "  get FILE PATH          print the value at PATH (a/b[id]/c)\n"
    "  set FILE PATH VALUE    set the value at PATH, creating FILE if needed\n"
    "  unset FILE PATH        remove PATH and its subtree\n"
    "  convert FILE --to xml|flat|properties [--gzip] [--output OUT]\n"
    "                         write FILE in another syntax to OUT (default: standard output)\n"
    "  check FILE             exit 0 when FILE reads without error\n"
    "  --help                 print this text\n"
    "\n"
    "Errors are one line on standard error. Exit status: 0 success, 1 failure or value not\n"
    "set, 2 wrong usage.\n";

enum class Syntax { kXml, kFlat, kProperties };

class UsageError {};

bool EndsWith(const std::string& text, const std::string& tail) {
   return text.size() >= tail.size() && text.compare(text.size() - tail.size(), tail.size(), tail) == 0;
}

Syntax ParseSyntax(const std::string& name) {
   if (name == "xml") return Syntax::kXml;
   if (name == "flat") return Syntax::kFlat;
   if (name == "properties") return Syntax::kProperties;
   throw UsageError();
}

Syntax SyntaxOfName(std::string path) {
   if (EndsWith(path, ".gz")) path.resize(path.size() - 3);
   if (EndsWith(path, ".xml")) return Syntax::kXml;
   if (EndsWith(path, ".properties")) return Syntax::kProperties;
   return Syntax::kFlat;
}

[[noreturn]] void ThrowErrno(const std::string& what, const std::string& path) {
   int error = errno;
   throw SystemException(error, what + " " + path + ": " + std::strerror(error));
}

// The whole file; false when it does not exist.
bool ReadFile(const std::string& path, std::string& out) {
   int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
   if (fd < 0) {
      if (errno == ENOENT) return false;
      ThrowErrno("Failed to open read file", path);
   }
   out.clear();
   char buffer[65536];
   for (;;) {
      ssize_t n = ::read(fd, buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) {
         ::close(fd);
         ThrowErrno("Failed to read", path);
      }
      if (n == 0) break;
      out.append(buffer, size_t(n));
   }
   ::close(fd);
   return true;
}

// Replaces `path` whole: a crash leaves either the old file or the new one.
void WriteFileSafely(const std::string& path, const std::string& bytes) {
   std::string temp = path + ".tmp";
   struct stat old;
   mode_t mode = ::stat(path.c_str(), &old) == 0 ? (old.st_mode & 07777) : 0644;
   int fd = ::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
   if (fd < 0) ThrowErrno("Failed to create", temp);
   size_t done = 0;
   while (done < bytes.size()) {
      ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
         ::close(fd);
         ::unlink(temp.c_str());
         ThrowErrno("Failed to write", temp);
      }
      done += size_t(n);
   }
   if (::fsync(fd) != 0 || ::close(fd) != 0) {
      ::unlink(temp.c_str());
      ThrowErrno("Failed to write", temp);
   }
   if (::rename(temp.c_str(), path.c_str()) != 0) {
      ::unlink(temp.c_str());
      ThrowErrno("Failed to replace " + path + " with", temp);
   }
   std::string copy = path;
   int dir = ::open(::dirname(copy.data()), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
   if (dir >= 0) {
      ::fsync(dir);
      ::close(dir);
   }
}

bool IsGzip(const std::string& bytes) {
   return bytes.size() >= 2 && static_cast<unsigned char>(bytes[0]) == 0x1f &&
          static_cast<unsigned char>(bytes[1]) == 0x8b;
}

std::string Gunzip(const std::string& bytes, const std::string& name) {
   Ref<StringReader> source;
   CreateStringReader(bytes.data(), static_cast<int>(bytes.size()), source);
   Ref<Reader> reader;
   CreateGzippedFileReader(source.Get(), name, reader);
   std::string out;
   char buffer[65536];
   int n;
   while ((n = reader->Read(buffer, sizeof buffer)) > 0) out.append(buffer, size_t(n));
   reader->Close();
   return out;
}

std::string Gzip(const std::string& text, const std::string& name) {
   Ref<StringWriter> target;
   CreateStringWriter(target);
   Ref<Writer> writer;
   CreateGzippedFileWriter(target.Get(), name, writer);
   writer->Write(text.data(), static_cast<int>(text.size()));
   writer->Close();
   return target->GetString();
}

// A configuration over a string; `text` must outlive it.
void CreateConfig(Syntax syntax, std::string& text, Ref<Config>& out) {
   switch (syntax) {
      case Syntax::kXml: CreateXmlStringConfig(text, out); break;
      case Syntax::kFlat: CreateFlatStringConfig(text, out); break;
      case Syntax::kProperties: {
         // Properties are read from files only: go through a private temporary file.
         char name[] = "/tmp/pelmora-configXXXXXX";
         int fd = ::mkstemp(name);
         if (fd < 0) ThrowErrno("Failed to create", name);
         ::close(fd);
         try {
            WriteFileSafely(name, text);
            CreatePropertiesFileConfig(name, static_cast<int>(text.size()) + 1, out);
         } catch (...) {
            ::unlink(name);
            throw;
         }
         ::unlink(name);
         break;
      }
   }
}

// One configuration file as the tool sees it: its text, syntax and compression.
struct ConfigFile {
   std::string path;
   Syntax syntax = Syntax::kFlat;
   bool gzip = false;
   std::string text;
   Ref<Config> config;

   void Load(bool mayBeMissing) {
      std::string bytes;
      if (!ReadFile(path, bytes)) {
         if (!mayBeMissing) throw SystemException(ENOENT, "Failed to open read file " + path);
         gzip = EndsWith(path, ".gz");
      } else {
         gzip = IsGzip(bytes);
         text = gzip ? Gunzip(bytes, path) : bytes;
      }
      CreateConfig(syntax, text, config);
   }
};

// Copies every value that `from` sees under `prefix` into `to`.
void CopyTree(Config::View* from, Config::View* to, const std::string& prefix) {
   std::vector<std::string> names;
   from->GetChildNames(prefix, names);
   for (const std::string& name : names) {
      std::string path = prefix.empty() ? name : prefix + "/" + name;
      std::vector<std::string> children;
      from->GetChildNames(path, children);
      std::string value;
      if (!children.empty()) CopyTree(from, to, path);
      else if (from->Get(path, &value)) to->Set(path, value);
   }
}

// The text `config` writes in `syntax`.
std::string Serialize(Config* config, Syntax syntax) {
   std::string text;
   Ref<Config> out;
   if (syntax == Syntax::kProperties) {
      char name[] = "/tmp/pelmora-configXXXXXX";
      int fd = ::mkstemp(name);
      if (fd < 0) ThrowErrno("Failed to create", name);
      ::close(fd);
      try {
         CreatePropertiesFileConfig(name, out);
         Ref<Config::View> from, to;
         config->GetMainView(from);
         out->GetMainView(to);
         CopyTree(from.Get(), to.Get(), "");
         out->Flush();
         ReadFile(name, text);
      } catch (...) {
         ::unlink(name);
         throw;
      }
      ::unlink(name);
      return text;
   }
   CreateConfig(syntax, text, out);
   Ref<Config::View> from, to;
   config->GetMainView(from);
   out->GetMainView(to);
   CopyTree(from.Get(), to.Get(), "");
   out->Flush();
   return text;
}

void Save(ConfigFile& file) {
   std::string text = Serialize(file.config.Get(), file.syntax);
   WriteFileSafely(file.path, file.gzip ? Gzip(text, file.path) : text);
}

int Run(std::vector<std::string> args) {
   bool syntaxGiven = false;
   Syntax syntax = Syntax::kFlat;
   if (args.size() >= 2 && args[0] == "--syntax") {
      syntax = ParseSyntax(args[1]);
      syntaxGiven = true;
      args.erase(args.begin(), args.begin() + 2);
   }
   if (args.size() < 2) throw UsageError();
   const std::string command = args[0];
   ConfigFile file;
   file.path = args[1];
   file.syntax = syntaxGiven ? syntax : SyntaxOfName(file.path);
   Ref<Config::View> view;

   if (command == "get" && args.size() == 3) {
      file.Load(false);
      file.config->GetMainView(view);
      std::vector<std::string> children;
      view->GetChildNames(args[2], children);
      std::string value;
      if (!children.empty()) throw InvalidArgumentException("not a value: " + args[2]);
      if (!view->Get(args[2], &value)) {
         std::fprintf(stderr, "pelmora-config: not set: %s\n", args[2].c_str());
         return 1;
      }
      std::printf("%s\n", value.c_str());
      return 0;
   }
   if (command == "set" && args.size() == 4) {
      file.Load(true);
      file.config->GetMainView(view);
      view->Set(args[2], args[3]);
      Save(file);
      return 0;
   }
   if (command == "unset" && args.size() == 3) {
      file.Load(false);
      file.config->GetMainView(view);
      view->Unset(args[2]);
      Save(file);
      return 0;
   }
   if (command == "check" && args.size() == 2) {
      file.Load(false);
      return 0;
   }
   if (command == "convert") {
      bool gzip = false, toGiven = false;
      Syntax to = Syntax::kFlat;
      std::string output;
      for (size_t i = 2; i < args.size(); ++i) {
         if (args[i] == "--to" && i + 1 < args.size()) {
            to = ParseSyntax(args[++i]);
            toGiven = true;
         } else if (args[i] == "--gzip") {
            gzip = true;
         } else if (args[i] == "--output" && i + 1 < args.size()) {
            output = args[++i];
         } else {
            throw UsageError();
         }
      }
      if (!toGiven) throw UsageError();
      file.Load(false);
      std::string text = Serialize(file.config.Get(), to);
      if (gzip) text = Gzip(text, output.empty() ? "stdout" : output);
      if (!output.empty()) {
         WriteFileSafely(output, text);
      } else if (std::fwrite(text.data(), 1, text.size(), stdout) != text.size() || std::fflush(stdout) != 0) {
         throw SystemException(errno, "Failed to write to standard output");
      }
      return 0;
   }
   throw UsageError();
}

}  // namespace

int main(int argc, char** argv) {
   std::vector<std::string> args(argv + 1, argv + argc);
   if (args.size() == 1 && (args[0] == "--help" || args[0] == "-h")) {
      std::fputs(kUsage, stdout);
      return 0;
   }
   try {
      return Run(args);
   } catch (const UsageError&) {
      std::fputs(kUsage, stderr);
      return 2;
   } catch (const Throwable& e) {
      std::string message = e.GetMessage();
      for (char& c : message)
         if (c == '\n') c = ' ';
      std::fprintf(stderr, "pelmora-config: %s\n", message.c_str());
      return 1;
   }
}
