#include "pelmora/http/prometheusHandler.h"

#include "pelmora/io/readerWriter.h"
#include "pelmora/perfCounter/prometheus.h"
#include "pelmora/service/logMacros.h"
#include "src/http/httpLog.h"

namespace Pelmora::Http {

namespace {

// Hands the export's pieces to the response, or only counts them (HEAD).
class ResponseWriter : public virtual Writer, public ObjectImpl {
public:
   explicit ResponseWriter(Response* response) : _response(response) {}
   void Write(const char* data, int length) override {
      if (_response != nullptr) _response->Write(data, length);
      _length += length;
   }
   void Close() override {}
   long long GetLength() const { return _length; }

private:
   Response* _response;
   long long _length = 0;
};

class PrometheusRequestHandler : public RequestHandlerMixin, public ObjectImpl {
public:
   explicit PrometheusRequestHandler(PerfCounter::Registry* registry) : _registry(registry) {}

   void HandleGet(Request*, Response* response) override {
      Prepare(response);
      Ref<ResponseWriter> writer = new ResponseWriter(response);
      PerfCounter::WritePrometheusText(GetRegistry(), writer.Get());
      response->Complete();
   }
   // The export is made to learn its length, and dropped.
   void HandleHead(Request*, Response* response) override {
      Prepare(response);
      Ref<ResponseWriter> counter = new ResponseWriter(nullptr);
      PerfCounter::WritePrometheusText(GetRegistry(), counter.Get());
      response->SetContentLength(counter->GetLength());
      response->Complete();
   }
   void HandlePost(Request* request, Response* response) override { NotAllowed("POST", request, response); }
   void HandlePut(Request* request, Response* response) override { NotAllowed("PUT", request, response); }
   void HandleDelete(Request* request, Response* response) override { NotAllowed("DELETE", request, response); }

private:
   PerfCounter::Registry* GetRegistry() const {
      return _registry ? _registry.Get() : PerfCounter::GetCounterRegistry();
   }
   static void Prepare(Response* response) {
      response->GetHeader().SetContentType(kPrometheusContentType);
      response->SetCacheResponse(false);
      response->SetChunkedEncodingAllowed(true);
   }
   static void NotAllowed(const char* verb, Request* request, Response* response) {
      PELMORA_LOG_VERBOSE(GetHttpLogger(), "Refused %1 %2: metrics are read with GET", verb, request->GetPath());
      response->SetStatusCode(ResponseCode::MethodNotAllowed);
      response->GetHeader().SetField("Allow", "GET, HEAD");
      response->Complete();
   }

   Ref<PerfCounter::Registry> _registry;
};

}  // namespace

void CreatePrometheusRequestHandler(PerfCounter::Registry* registry, Ref<RequestHandler>& out) {
   out = new PrometheusRequestHandler(registry);
}

}  // namespace Pelmora::Http
