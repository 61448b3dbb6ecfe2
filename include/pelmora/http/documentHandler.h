#pragma once
// A RequestHandler serving files under document roots chosen by URL prefix, with
// sub-handlers (functors) for single paths. Paths holding "/../", even percent-encoded,
// are answered 404. Thread-safe once built; sub-handlers may be changed at any time.

#include <map>
#include <string>

#include "pelmora/http/httpSvc.h"
#include "pelmora/object/export.h"
#include "pelmora/system/functor.h"

namespace Pelmora::Http {

using URIHandler = System::Functor<void, Request*, Response*>;

class PELMORA_EXPORT DocumentHandler : public virtual RequestHandler {
public:
   // `path` is matched exactly (without query) before any file lookup.
   virtual void RegisterURIHandler(const std::string& path, const URIHandler& handler) = 0;
   virtual bool GetURIHandler(const std::string& path, URIHandler& out) = 0;
   virtual void UnregisterURIHandler(const std::string& path) = 0;
};

// The MIME type for `path` by its lower-cased extension; "application/octet-stream"
// when unknown.
PELMORA_EXPORT std::string GetMimeType(const std::string& path, Service::Logger* logger = nullptr);

// Serves `docroot` for every path. Chunked bodies when `view` (may be null) holds
// "pelmora/documentHandler/enableChunkedResponses" true.
PELMORA_EXPORT void CreateHTTPDocRequestHandler(const std::string& docroot, Service::Config::View* view,
                                                Ref<DocumentHandler>& out);
// Serves each root under its URL prefix ("/static" -> "/srv/www").
PELMORA_EXPORT void CreateHTTPDocRequestHandler(const std::map<std::string, std::string>& roots,
                                                Service::Config::View* view, Ref<DocumentHandler>& out);

}  // namespace Pelmora::Http
