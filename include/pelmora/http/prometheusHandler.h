#pragma once
// A RequestHandler that serves a counter registry in the Prometheus text format, version
// 0.0.4, for scrapers. Register it at the path they ask for, usually "/metrics". GET
// answers with the export, written into the response piece by piece (chunked to clients
// that take it); HEAD with the length GET would send; other verbs 405 with
// "Allow: GET, HEAD". Thread-safe: concurrent scrapes each read the registry.

#include "pelmora/http/httpSvc.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/perfCounter/registry.h"

namespace Pelmora::Http {

// The content type of the answer.
constexpr const char* kPrometheusContentType = "text/plain; version=0.0.4; charset=utf-8";

// A handler exporting `registry`; null: the process's registry (GetCounterRegistry).
PELMORA_EXPORT void CreatePrometheusRequestHandler(PerfCounter::Registry* registry, Ref<RequestHandler>& out);

}  // namespace Pelmora::Http
