#pragma once
// The server side of one request on a connection: AsyncReadHeader reads and parses the
// request line and fields from the stream into a fixed 10240-byte area, then Read and
// AsyncRead hand out the body (sized or chunked), bytes that came with the header first.
// A request is used by one connection at a time; completions run on pool threads.
// Failures inside completions are handed to the callback as an Exception* that lives
// only for the call (Clone it to keep it).

#include <string>

#include "pelmora/http/header.h"
#include "pelmora/object/containers.h"
#include "pelmora/object/export.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/stream.h"

namespace Pelmora::Http {

// A chunked request body grew past the limit set with Request::SetMaxBodyBytes.
class PELMORA_EXPORT RequestBodyTooLargeException : public Exception {
public:
   explicit RequestBodyTooLargeException(long long limit)
       : Exception("Request body exceeds " + std::to_string(limit) + " bytes") {}
   PELMORA_EXCEPTION_CLONE(RequestBodyTooLargeException)
};

class PELMORA_EXPORT Request : public virtual Object {
public:
   // The request, the failure (null on success) and whether a request was read: false
   // with no failure when the peer closed an idle connection.
   using HeaderCallback = System::Functor<void, Request*, Exception*, bool>;
   // The request, the failure (null on success) and the body bytes placed (0: body ended).
   using ReadCallback = System::Functor<void, Request*, Exception*, int>;

   static constexpr int kHeaderAreaSize = 10240;

   virtual int GetMethod() const = 0;
   virtual int GetHttpVersion() const = 0;
   virtual const std::string& GetPath() const = 0;
   virtual bool GetKeepAlive() const = 0;
   virtual long long GetContentLength() const = 0;
   virtual bool GetContentLength(long long& length) const = 0;
   virtual bool IsChunkedEncoded() const = 0;
   // "Expect: 100-continue" came with the request.
   virtual bool IsContinueExpected() const = 0;
   virtual void GetCookieList(RefList<Cookie>& out) const = 0;
   virtual const RequestHeader& GetHeader() const = 0;

   // Reads the next request header; `callback` runs once, possibly before this returns.
   // Failures: MalformedHeaderException "invalid value 0 " and "Request header
   // unexpectedly large", Exception "The HTTP client closed the stream prematurely after
   // N bytes.", the parse failures of RequestHeader::FromString and those of the stream.
   virtual void AsyncReadHeader(const HeaderCallback& callback) = 0;
   // Body bytes into `buffer`, waiting for the stream when none are at hand; 0 at the end
   // of the body. Exception "Malformed chunk header." for a broken chunked body.
   virtual int Read(char* buffer, int length) = 0;
   // The most body bytes Read and AsyncRead hand out (negative: no limit); a chunked body
   // that goes past it fails with RequestBodyTooLargeException. A sized body is refused
   // by its length before it is read. Kept across ResetStream.
   virtual void SetMaxBodyBytes(long long limit) = 0;
   // As Read, completing through `callback`; `buffer` must live until then.
   virtual void AsyncRead(char* buffer, unsigned int length, const ReadCallback& callback) = 0;
   // Rearms the request for the next one on `stream`. Bytes that followed a fully read
   // body on the same stream (a pipelined request) are kept for the next header.
   virtual void ResetStream(System::Stream* stream) = 0;
   virtual void Close() = 0;
};

// A request reading from `stream`.
PELMORA_EXPORT void CreateRequest(System::Stream* stream, Ref<Request>& out);

// Turns the asynchronous header read into a blocking one: pass Callback() to
// AsyncReadHeader, then Wait. One read per waiter. Thread-safe.
class PELMORA_EXPORT RequestWaiter {
public:
   RequestWaiter();
   ~RequestWaiter();
   RequestWaiter(const RequestWaiter&) = delete;
   RequestWaiter& operator=(const RequestWaiter&) = delete;

   Request::HeaderCallback Callback();
   // Wakes the waiter with the outcome of the read.
   void Complete(Request* request, Exception* error, bool gotRequest);
   // Whether a request was read; rethrows the failure. A negative time-out waits without
   // limit; TimeoutException "Operation timed out" when it runs out.
   bool Wait(long long timeoutMicroseconds = -1);

private:
   struct State;
   State* _state;
};

}  // namespace Pelmora::Http
