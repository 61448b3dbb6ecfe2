#include "pelmora/http/httpSvc.h"
#include "pelmora/service/logMacros.h"
#include "src/http/httpLog.h"

namespace Pelmora::Http {

void RequestHandlerMixin::Unsupported(const char* verb, Request* request, Response* response) {
   PELMORA_LOG_WARNING(GetHttpLogger(), "%1: HTTP method %2 not supported for URI %3", "UnimplementedRequestHandler",
                       verb, request->GetPath());
   response->SetStatusCode(ResponseCode::BadRequest);
   response->Complete();
}

void RequestHandlerMixin::HandleDelete(Request* request, Response* response) { Unsupported("DELETE", request, response); }
void RequestHandlerMixin::HandlePost(Request* request, Response* response) { Unsupported("POST", request, response); }
void RequestHandlerMixin::HandleHead(Request* request, Response* response) { Unsupported("HEAD", request, response); }
void RequestHandlerMixin::HandleGet(Request* request, Response* response) { Unsupported("GET", request, response); }
void RequestHandlerMixin::HandlePut(Request* request, Response* response) { Unsupported("PUT", request, response); }

}  // namespace Pelmora::Http
