#include "pelmora/http/request.h"

#include <algorithm>
#include <chrono>
#include <climits>
#include <condition_variable>
#include <cstring>
#include <memory>
#include <mutex>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "src/http/requestScan.h"

namespace Pelmora::Http {

namespace {

class RequestImpl : public virtual Request, public ObjectImpl {
public:
   explicit RequestImpl(System::Stream* stream) : _stream(stream) {}

   int GetMethod() const override { return _header.GetMethod(); }
   int GetHttpVersion() const override { return _header.GetHttpVersion(); }
   const std::string& GetPath() const override { return _header.GetPath(); }
   bool GetKeepAlive() const override { return _keepAlive; }
   long long GetContentLength() const override { return _header.GetContentLength(); }
   bool GetContentLength(long long& length) const override { return _header.GetContentLength(length); }
   bool IsChunkedEncoded() const override { return _chunked; }
   bool IsContinueExpected() const override;
   void GetCookieList(RefList<Cookie>& out) const override { _header.GetCookieList(out); }
   const RequestHeader& GetHeader() const override { return _header; }

   void AsyncReadHeader(const HeaderCallback& callback) override;
   int Read(char* buffer, int length) override;
   void AsyncRead(char* buffer, unsigned int length, const ReadCallback& callback) override;
   void ResetStream(System::Stream* stream) override;
   void SetMaxBodyBytes(long long limit) override { _maxBody = limit; }
   void Close() override { _stream->Close(); }

private:
   // Header reading.
   void StartHeaderRead();
   void HeaderReadDone(Exception* error, int count);
   // True when the header read has ended (the callback has run).
   bool ScanPending();
   void FinishHeader(Exception* error, bool gotRequest);

   // Body reading. The answer that needs no stream read: bytes placed, 0 at the end of
   // the body, -1 when the stream must be read first.
   int TryReadBuffered(char* buffer, int length);
   bool IsBodyComplete() const { return _chunked ? _decoder.IsDone() : _bodyLeft == 0; }
   void ContinueAsyncRead();
   void AsyncReadDone(Exception* error, int count);
   void FinishRead(Exception* error, int count);
   [[noreturn]] void ThrowBodyCutShort();

   char _area[kHeaderAreaSize];
   Ref<System::Stream> _stream;
   RequestHeader _header;
   HeaderScanner _scanner;
   int _used = 0;              // bytes in the area
   int _scanned = 0;           // of which the scan has seen
   int _leftover = 0;          // first body byte not handed out yet
   int _leftoverCount = 0;
   long long _bodyLeft = 0;    // of a sized body
   long long _bodyDecoded = 0; // of a chunked body
   long long _maxBody = -1;
   bool _chunked = false;
   bool _keepAlive = true;
   bool _headerDone = false;
   ChunkedBodyDecoder _decoder;
   HeaderCallback _headerCallback;
   ReadCallback _readCallback;
   char* _readBuffer = nullptr;
   int _readLength = 0;
};

bool RequestImpl::IsContinueExpected() const {
   std::string expect;
   if (!_header.GetField("Expect", expect)) return false;
   static const char kContinue[] = "100-continue";
   if (expect.size() != sizeof kContinue - 1) return false;
   for (size_t i = 0; i < expect.size(); ++i) {
      char c = expect[i];
      if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
      if (c != kContinue[i]) return false;
   }
   return true;
}

void RequestImpl::AsyncReadHeader(const HeaderCallback& callback) {
   _headerCallback = callback;
   // Bytes of a pipelined request may already hold a whole header.
   if (_used > _scanned && ScanPending()) return;
   StartHeaderRead();
}

void RequestImpl::StartHeaderRead() {
   Ref<RequestImpl> self(this);
   try {
      _stream->AsyncRead(_area + _used, kHeaderAreaSize - _used,
                         [self](System::Stream*, Exception* error, int count) { self->HeaderReadDone(error, count); });
   } catch (Exception& e) {
      FinishHeader(&e, false);
   }
}

void RequestImpl::HeaderReadDone(Exception* error, int count) {
   if (error != nullptr) {
      FinishHeader(error, false);
      return;
   }
   if (count <= 0) {
      if (_used == 0) {
         FinishHeader(nullptr, false);
      } else {
         Exception closed(MessageFormatter::ASPrint("The HTTP client closed the stream prematurely after %1 bytes.", _used));
         FinishHeader(&closed, false);
      }
      return;
   }
   _used += count;
   if (!ScanPending()) StartHeaderRead();
}

bool RequestImpl::ScanPending() {
   try {
      int found = _scanner.Scan(_area + _scanned, _used - _scanned);
      if (found < 0) {
         _scanned = _used;
         if (_used == kHeaderAreaSize) throw MalformedHeaderException("Request header unexpectedly large");
         return false;
      }
      int end = _scanned + found;
      _scanned = end;
      int start = _scanner.ContentStart();
      _header.FromString(_area + start, static_cast<size_t>(end - start));
      _leftover = end;
      _leftoverCount = _used - end;
      _chunked = _header.IsChunkedTransferEncoding();
      _keepAlive = _header.GetKeepAlive();
      _bodyLeft = _chunked ? 0 : std::max(_header.GetContentLength(), 0LL);
      _decoder.Reset();
      _headerDone = true;
   } catch (Exception& e) {
      FinishHeader(&e, false);
      return true;
   }
   FinishHeader(nullptr, true);
   return true;
}

void RequestImpl::FinishHeader(Exception* error, bool gotRequest) {
   HeaderCallback callback = std::move(_headerCallback);
   _headerCallback.Reset();
   if (callback) callback(this, error, gotRequest);
}

void RequestImpl::ThrowBodyCutShort() {
   throw Exception("The HTTP client closed the stream before the end of the request body.");
}

int RequestImpl::TryReadBuffered(char* buffer, int length) {
   if (!_headerDone || length <= 0) return 0;
   if (_chunked) {
      while (!_decoder.IsDone()) {
         if (_leftoverCount == 0) return -1;
         size_t produced = 0;
         size_t used = _decoder.Decode(_area + _leftover, static_cast<size_t>(_leftoverCount), buffer,
                                       static_cast<size_t>(length), produced);
         _leftover += static_cast<int>(used);
         _leftoverCount -= static_cast<int>(used);
         if (produced > 0) {
            _bodyDecoded += static_cast<long long>(produced);
            if (_maxBody >= 0 && _bodyDecoded > _maxBody) throw RequestBodyTooLargeException(_maxBody);
            return static_cast<int>(produced);
         }
      }
      return 0;
   }
   if (_bodyLeft == 0) return 0;
   if (_leftoverCount == 0) return -1;
   int take = static_cast<int>(std::min<long long>({static_cast<long long>(length), _bodyLeft,
                                                    static_cast<long long>(_leftoverCount)}));
   std::memcpy(buffer, _area + _leftover, static_cast<size_t>(take));
   _leftover += take;
   _leftoverCount -= take;
   _bodyLeft -= take;
   return take;
}

int RequestImpl::Read(char* buffer, int length) {
   for (;;) {
      int ready = TryReadBuffered(buffer, length);
      if (ready >= 0) return ready;
      if (_chunked) {
         // The area is free once the header is parsed; chunk framing is decoded from it.
         int count = _stream->Read(_area, kHeaderAreaSize);
         if (count <= 0) ThrowBodyCutShort();
         _leftover = 0;
         _leftoverCount = count;
         continue;
      }
      // A sized body goes straight to the caller, never past its end: what follows it
      // belongs to the next request.
      int want = static_cast<int>(std::min<long long>(length, _bodyLeft));
      int count = _stream->Read(buffer, want);
      if (count <= 0) ThrowBodyCutShort();
      _bodyLeft -= count;
      return count;
   }
}

void RequestImpl::AsyncRead(char* buffer, unsigned int length, const ReadCallback& callback) {
   _readCallback = callback;
   _readBuffer = buffer;
   _readLength = static_cast<int>(std::min<unsigned int>(length, INT_MAX));
   ContinueAsyncRead();
}

void RequestImpl::ContinueAsyncRead() {
   try {
      int ready = TryReadBuffered(_readBuffer, _readLength);
      if (ready >= 0) {
         FinishRead(nullptr, ready);
         return;
      }
      Ref<RequestImpl> self(this);
      auto done = [self](System::Stream*, Exception* error, int count) { self->AsyncReadDone(error, count); };
      if (_chunked) {
         _stream->AsyncRead(_area, kHeaderAreaSize, done);
      } else {
         _stream->AsyncRead(_readBuffer, static_cast<int>(std::min<long long>(_readLength, _bodyLeft)), done);
      }
   } catch (Exception& e) {
      FinishRead(&e, 0);
   }
}

void RequestImpl::AsyncReadDone(Exception* error, int count) {
   if (error != nullptr) {
      FinishRead(error, 0);
      return;
   }
   try {
      if (count <= 0) ThrowBodyCutShort();
   } catch (Exception& e) {
      FinishRead(&e, 0);
      return;
   }
   if (_chunked) {
      _leftover = 0;
      _leftoverCount = count;
      ContinueAsyncRead();
   } else {
      _bodyLeft -= count;
      FinishRead(nullptr, count);
   }
}

void RequestImpl::FinishRead(Exception* error, int count) {
   ReadCallback callback = std::move(_readCallback);
   _readCallback.Reset();
   if (callback) callback(this, error, count);
}

void RequestImpl::ResetStream(System::Stream* stream) {
   bool keep = stream == _stream.Get() && _headerDone && IsBodyComplete() && _leftoverCount > 0;
   if (keep) {
      std::memmove(_area, _area + _leftover, static_cast<size_t>(_leftoverCount));
      _used = _leftoverCount;
   } else {
      _used = 0;
   }
   _stream = stream;
   _scanned = 0;
   _scanner.Reset();
   _header.ClearHeader();
   _leftover = 0;
   _leftoverCount = 0;
   _bodyLeft = 0;
   _bodyDecoded = 0;
   _chunked = false;
   _keepAlive = true;
   _headerDone = false;
   _decoder.Reset();
}

}  // namespace

void CreateRequest(System::Stream* stream, Ref<Request>& out) { out = new RequestImpl(stream); }

struct RequestWaiter::State {
   std::mutex mutex;
   std::condition_variable done;
   bool complete = false;
   bool gotRequest = false;
   std::unique_ptr<Exception> error;
};

RequestWaiter::RequestWaiter() : _state(new State()) {}

RequestWaiter::~RequestWaiter() { delete _state; }

Request::HeaderCallback RequestWaiter::Callback() {
   return [this](Request* request, Exception* error, bool gotRequest) { Complete(request, error, gotRequest); };
}

void RequestWaiter::Complete(Request*, Exception* error, bool gotRequest) {
   std::lock_guard<std::mutex> lock(_state->mutex);
   _state->error.reset(error != nullptr ? error->Clone() : nullptr);
   _state->gotRequest = gotRequest;
   _state->complete = true;
   _state->done.notify_all();
}

bool RequestWaiter::Wait(long long timeoutMicroseconds) {
   std::unique_lock<std::mutex> lock(_state->mutex);
   if (timeoutMicroseconds < 0) {
      _state->done.wait(lock, [this] { return _state->complete; });
   } else if (!_state->done.wait_for(lock, std::chrono::microseconds(timeoutMicroseconds),
                                     [this] { return _state->complete; })) {
      throw TimeoutException("Operation timed out");
   }
   if (_state->error) _state->error->Throw();
   return _state->gotRequest;
}

}  // namespace Pelmora::Http
