#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <strings.h>

#include <algorithm>
#include <cstdio>
#include <mutex>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/documentHandler.h"
#include "pelmora/http/url.h"
#include "pelmora/service/logMacros.h"
#include "src/http/conditional.h"
#include "src/http/cookieImpl.h"
#include "src/http/httpLog.h"

namespace Pelmora::Http {

namespace {

const std::map<std::string, std::string>& MimeTable() {
   static const std::map<std::string, std::string> table = {
       {"txt", "text/plain"},
       {"html", "text/html"},
       {"htm", "text/html"},
       {"xsd", "text/xml"},
       {"wsdl", "text/xml"},
       {"xml", "text/xml"},
       {"xsl", "text/xml"},
       {"jpeg", "image/jpeg"},
       {"jpg", "image/jpeg"},
       {"gif", "image/gif"},
       {"svg", "image/svg+xml"},
       {"ttf", "application/font-sfnt"},
       {"woff", "application/font-woff"},
       {"exe", "application/octet-stream"},
       {"pdf", "application/pdf"},
       {"css", "text/css"},
       {"doc", "application/msword"},
       {"ico", "image/x-icon"},
       {"png", "image/png"},
       {"js", "application/javascript"},
   };
   return table;
}

// Whether `path` climbs out of its root: "/../" or a trailing "/..", as sent, decoded once
// or decoded twice (a client may hide the dots as %2e or %252e).
bool ClimbsOut(const std::string& path) {
   std::string forms[3] = {path, DecodeURLHexValues(path), ""};
   forms[2] = DecodeURLHexValues(forms[1]);
   for (std::string& form : forms) {
      std::replace(form.begin(), form.end(), '\\', '/');
      if (form.find("/../") != std::string::npos) return true;
      if (form.size() >= 3 && form.compare(form.size() - 3, 3, "/..") == 0) return true;
      if (form == "..") return true;
   }
   return false;
}

// The validator of a file's current contents: inode, size and modification time, so a
// file replaced or rewritten in place gets a new one.
std::string EntityTag(const struct stat& info) {
   char text[96];
   std::snprintf(text, sizeof text, "\"%llx-%llx-%llx.%lx\"", static_cast<unsigned long long>(info.st_ino),
                 static_cast<unsigned long long>(info.st_size), static_cast<unsigned long long>(info.st_mtim.tv_sec),
                 static_cast<long>(info.st_mtim.tv_nsec));
   return text;
}

class DocumentHandlerImpl : public virtual DocumentHandler, public RequestHandlerMixin, public ObjectImpl {
public:
   DocumentHandlerImpl(const std::map<std::string, std::string>& roots, Service::Config::View* view)
       : _roots(roots) {
      if (view != nullptr) view->Get("pelmora/documentHandler/enableChunkedResponses", &_chunked);
      std::string list;
      for (const auto& [prefix, root] : _roots) list += (list.empty() ? "" : ", ") + prefix + "=" + root;
      PELMORA_LOG_INFO(GetHttpLogger(), "HTTP server created with docroots %1, chunked responses enabled: %2", list,
                       _chunked);
   }

   void HandleGet(Request* request, Response* response) override { HandleGetOrHead(request, response, false); }
   void HandleHead(Request* request, Response* response) override { HandleGetOrHead(request, response, true); }

   void RegisterURIHandler(const std::string& path, const URIHandler& handler) override {
      std::lock_guard<std::mutex> lock(_mutex);
      _uriHandlers[path] = handler;
   }
   bool GetURIHandler(const std::string& path, URIHandler& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      auto found = _uriHandlers.find(path);
      if (found == _uriHandlers.end()) return false;
      out = found->second;
      return true;
   }
   void UnregisterURIHandler(const std::string& path) override {
      std::lock_guard<std::mutex> lock(_mutex);
      _uriHandlers.erase(path);
   }

private:
   // The root serving `path` (longest prefix ending at a segment boundary) and the rest
   // of the path below it.
   bool LookupDocRoot(const std::string& path, std::string& root, std::string& rest) const {
      size_t best = 0;
      bool found = false;
      for (const auto& [prefix, dir] : _roots) {
         if (path.compare(0, prefix.size(), prefix) != 0) continue;
         bool boundary = prefix.empty() || prefix.back() == '/' || path.size() == prefix.size() ||
                         path[prefix.size()] == '/';
         if (!boundary || (found && prefix.size() < best)) continue;
         best = prefix.size();
         found = true;
         root = dir;
         rest = path.substr(prefix.size());
      }
      if (found && (rest.empty() || rest[0] != '/')) rest = "/" + rest;
      return found;
   }

   static void Answer(Response* response, const ResponseCode::Info& info) {
      std::string body = std::to_string(info.code) + " " + info.reasonPhrase + "\n";
      response->SetStatusCode(info);
      response->GetHeader().SetContentType("text/plain");
      response->Write(body.data(), static_cast<int>(body.size()));
      response->Complete();
   }

   void NotFound(Request* request, Response* response, const char* method) {
      PELMORA_LOG_VERBOSE(GetHttpLogger(), "Sent NotFound response for %1 %2", method, request->GetPath());
      Answer(response, ResponseCode::NotFound);
   }

   void HandleGetOrHead(Request* request, Response* response, bool isHead) {
      const char* method = isHead ? "HEAD" : "GET";
      std::string path = request->GetPath();
      size_t query = path.find_first_of("?#");
      if (query != std::string::npos) path.resize(query);
      URIHandler sub;
      if (GetURIHandler(path, sub)) {
         sub(request, response);
         return;
      }
      std::string root, rest;
      if (!LookupDocRoot(path, root, rest) || ClimbsOut(path)) return NotFound(request, response, method);
      std::string file = root + DecodeURLHexValues(rest);
      if (ClimbsOut(file) || file.find('\0') != std::string::npos) return NotFound(request, response, method);
      struct stat info;
      if (::stat(file.c_str(), &info) != 0) return NotFound(request, response, method);
      if (S_ISDIR(info.st_mode)) {
         // A directory named without its slash is redirected so that relative links in its
         // index resolve inside it; with the slash its index.html is served.
         if (path.empty() || path.back() != '/') {
            PELMORA_LOG_VERBOSE(GetHttpLogger(), "Sent redirect response for %1 %2 (from %3)", method, path, file);
            response->GetHeader().SetField("Location", path + "/");
            Answer(response, ResponseCode::MovedPermanently);
            return;
         }
         file += "index.html";
         if (::stat(file.c_str(), &info) != 0 || !S_ISREG(info.st_mode)) return NotFound(request, response, method);
      }
      if (!S_ISREG(info.st_mode)) return NotFound(request, response, method);
      if (::access(file.c_str(), R_OK) != 0) {
         PELMORA_LOG_VERBOSE(GetHttpLogger(), "Sent Forbidden response for %1 %2 (from %3)", method, path, file);
         Answer(response, ResponseCode::Forbidden);
         return;
      }
      int fd = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
      if (fd < 0) return NotFound(request, response, method);
      struct Closer {
         int fd;
         ~Closer() { ::close(fd); }
      } closer{fd};
      const RequestHeader& asked = request->GetHeader();
      ResponseHeader& header = response->GetHeader();
      std::string tag = EntityTag(info);
      std::string modified = HttpDateFormatter(static_cast<long long>(info.st_mtim.tv_sec) * 1000000).ToString();
      header.SetContentType(GetMimeType(file));
      header.SetField("ETag", tag);
      header.SetField("Last-Modified", modified);
      header.SetField("Accept-Ranges", "bytes");
      if (NotModified(asked, tag, info)) {
         response->SetStatusCode(ResponseCode::NotModified);
         response->SetContentLength(info.st_size);
         response->Complete();
         PELMORA_LOG_VERBOSE(GetHttpLogger(), "Sent NotModified response for %1 %2 (from %3)", method, path, file);
         return;
      }
      ByteRange range;
      std::string rangeField, ifRange;
      if (asked.GetField("Range", rangeField) &&
          (!asked.GetField("If-Range", ifRange) || ifRange == tag || ifRange == modified))
         range = ParseRange(rangeField, info.st_size);
      if (range.kind == ByteRange::UNSATISFIABLE) {
         header.SetField("Content-Range", "bytes */" + std::to_string(info.st_size));
         PELMORA_LOG_VERBOSE(GetHttpLogger(), "Sent RequestedRangeNotSatisfiable response for %1 %2 (from %3)",
                             method, path, file);
         Answer(response, ResponseCode::RequestedRangeNotSatisfiable);
         return;
      }
      long long offset = 0, length = info.st_size;
      if (range.kind == ByteRange::PART) {
         offset = range.first;
         length = range.last - range.first + 1;
         response->SetStatusCode(ResponseCode::PartialContent);
         header.SetField("Content-Range", "bytes " + std::to_string(range.first) + "-" + std::to_string(range.last) +
                                              "/" + std::to_string(info.st_size));
      }
      bool chunked = _chunked && request->GetHttpVersion() > 271 && range.kind == ByteRange::WHOLE;
      response->SetChunkedEncodingAllowed(chunked);
      response->SetContentLength(length);
      if (isHead) {
         response->Complete();
         PELMORA_LOG_TRIVIA(GetHttpLogger(), "Sent response for HEAD %1 (from %2)", path, file);
         return;
      }
      if (!chunked) {
         // Sized answers leave the page cache without a copy where the stream allows.
         response->SendFile(fd, offset, length);
         PELMORA_LOG_TRIVIA(GetHttpLogger(), "Sent response for %1 %2 (from %3)", method, path, file);
         return;
      }
      std::vector<char> buffer(65536);
      for (;;) {
         ssize_t n = ::read(fd, buffer.data(), buffer.size());
         if (n < 0) {
            if (errno == EINTR) continue;
            throw SystemException(errno);
         }
         if (n == 0) break;
         response->Write(buffer.data(), static_cast<int>(n));
      }
      response->Complete();
      PELMORA_LOG_TRIVIA(GetHttpLogger(), "Sent response for %1 %2 (from %3)", method, path, file);
   }

   // Whether the client's copy is current: If-None-Match decides when present, else
   // If-Modified-Since (to the second, as dates are sent).
   static bool NotModified(const RequestHeader& asked, const std::string& tag, const struct stat& info) {
      std::string value;
      if (asked.GetField("If-None-Match", value)) return TagListMatches(value, tag);
      if (!asked.GetField("If-Modified-Since", value)) return false;
      long long since = ParseCookieDate(value);
      return since >= 0 && static_cast<long long>(info.st_mtim.tv_sec) <= since / 1000000;
   }

   std::map<std::string, std::string> _roots;
   bool _chunked = false;
   std::mutex _mutex;
   std::map<std::string, URIHandler> _uriHandlers;
};

}  // namespace

std::string GetMimeType(const std::string& path, Service::Logger* logger) {
   size_t dot = path.rfind('.');
   size_t slash = path.rfind('/');
   std::string extension;
   if (dot != std::string::npos && (slash == std::string::npos || dot > slash)) extension = path.substr(dot + 1);
   for (char& c : extension) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
   auto found = MimeTable().find(extension);
   if (found != MimeTable().end()) return found->second;
   PELMORA_LOG_TRIVIA(logger != nullptr ? logger : GetHttpLogger(), "Unknown file extension: %1", extension);
   return "application/octet-stream";
}

void CreateHTTPDocRequestHandler(const std::map<std::string, std::string>& roots, Service::Config::View* view,
                                 Ref<DocumentHandler>& out) {
   out = new DocumentHandlerImpl(roots, view);
}

void CreateHTTPDocRequestHandler(const std::string& docroot, Service::Config::View* view, Ref<DocumentHandler>& out) {
   CreateHTTPDocRequestHandler(std::map<std::string, std::string>{{"/", docroot}}, view, out);
}

}  // namespace Pelmora::Http
