#pragma once
// The server side of one response on a connection: status and fields in a
// ResponseHeader, body bytes through a buffer that holds room in front for the header.
// A body that fits the buffer goes out with a Content-Length at Complete; a longer one
// goes out chunked when chunking is allowed, is sent sized when a length was preset, and
// is otherwise buffered whole up to the connection's maximum. A client that needs a
// Content-Length always gets its body buffered whole.
// Used by one connection at a time (the object is lockable for the connection's use).

#include <string>

#include "pelmora/http/header.h"
#include "pelmora/object/export.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/stream.h"

namespace Pelmora::Http {

struct PELMORA_EXPORT ClientCapabilities {
   bool needsContentLength = false;
   bool understandsChunking = true;
   bool canKeepAlive = true;
};

// What a response needs from the connection it answers on.
class PELMORA_EXPORT HttpConnection : public virtual Object {
public:
   virtual void GetClientCapabilities(ClientCapabilities& out) = 0;
   // The most body bytes a response may buffer whole; negative: no limit.
   virtual long long GetMaxBufferedResponseBytes() = 0;
   // The response went out; `keepAlive` tells whether the connection may be reused.
   virtual void ResponseCompleted(bool keepAlive) = 0;
   // A response is about to finish after its handler returns (a file still going out):
   // true when the connection then waits for ResponseFinished, false to have the response
   // finish before the handler gets control back.
   virtual bool DeferResponse() { return false; }
   // The deferred response went out whole (`error` null) or failed.
   virtual void ResponseFinished(Exception* error) { (void)error; }
};

class PELMORA_EXPORT Response : public virtual System::LockableObject {
public:
   virtual ResponseHeader& GetHeader() = 0;
   virtual void SetStatusCode(const ResponseCode::Info& info) = 0;
   // The body length, when known before the body is written; negative forgets it.
   virtual void SetContentLength(long long length) = 0;
   virtual void SetCacheResponse(bool cache) = 0;
   virtual void SetKeepAlive(bool keepAlive) = 0;
   virtual void SetChunkedEncodingAllowed(bool allowed = true) = 0;
   virtual void AddCookie(Cookie* cookie) = 0;
   // The session the response answers for (null when none) and whether the
   // connection's authenticated time-outs apply.
   virtual void SetSession(Object* session) = 0;
   virtual void GetSession(Ref<Object>& out) = 0;
   virtual void UseAuthenticatedTimeout(bool use) = 0;
   virtual bool IsUsingAuthenticatedTimeout() const = 0;

   // Body bytes. Exception "Response body length exceeds configured maximum, N, for a
   // client  that requires Content-Length" or "Write would exceeded maximum buffered
   // response size" when the body must be buffered whole and would pass the maximum;
   // InvalidStateException after Complete; the stream's failures.
   virtual void Write(const char* data, int length) = 0;
   // Sends what can be sent now (nothing while the body must be buffered whole).
   virtual void FlushToStream() = 0;
   // Ends the response. Calling it twice is a fault.
   virtual void Complete() = 0;
   // Sends `length` bytes of the open file `fd` from `offset` as the whole body with a
   // Content-Length, and ends the response. On a stream that sends files itself the bytes
   // go straight from the page cache, and what the stream cannot take at once goes out in
   // the background when the connection defers (on a descriptor of the response's own);
   // other streams get them read and written. Exception when the file ends early;
   // InvalidStateException when body bytes were written already.
   virtual void SendFile(int fd, long long offset, long long length) = 0;
   // Replaces whatever was written with an error answer and closes the connection after
   // it. IOException "Header already sent to client." when it is too late.
   virtual void SendError(const ResponseCode::Info& info) = 0;
   virtual void SendError(const ResponseCode::Info& info, const std::string& text) = 0;
   // "HTTP/1.1 100 Continue" before the header; InvalidStateException "Cannot send
   // continue -- not in state where output is valid." afterwards.
   virtual void SendContinue() = 0;
   // Ready for the next request on the connection.
   virtual void Reset() = 0;
   virtual void ResetStream(System::Stream* stream) = 0;
   virtual void Close() = 0;
   virtual bool IsHeaderSent() const = 0;
   virtual bool IsResponseComplete() const = 0;
   // Whether the response goes out over an encrypted stream.
   virtual bool IsSecure() const { return false; }
};

// A response written to `stream` for `connection`, which must outlive it.
PELMORA_EXPORT void CreateResponse(HttpConnection* connection, System::Stream* stream, Ref<Response>& out);

// The body buffer size of responses made from now on (default 8192; at least 64).
PELMORA_EXPORT void SetBufferSize(unsigned int size);
PELMORA_EXPORT unsigned int GetBufferSize();

}  // namespace Pelmora::Http
