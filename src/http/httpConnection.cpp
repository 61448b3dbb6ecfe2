#include <atomic>
#include <cstdio>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/system/streamFileSender.h"
#include "src/http/httpSvcImpl.h"
#include "src/http/sessionImpl.h"

namespace Pelmora::Http {

using Service::Logger;

namespace {

// 431 is not in the shared table; the server is the only one that sends it.
const ResponseCode::Info kHeaderFieldsTooLarge = {431, "Request Header Fields Too Large"};

// Passes everything to the accepted stream, counts the bytes going out and tells the
// connection when a read starts and ends, so that a client trickling a request (header
// or body) is caught by the request deadline.
class WatchedStream : public virtual System::Stream, public virtual System::FileSender, public ObjectImpl {
public:
   WatchedStream(System::Stream* inner, HttpConnectionImpl* connection) : _inner(inner), _connection(connection) {}

   bool CanSendFile() override {
      System::FileSender* sender = InnerSender();
      return sender != nullptr && sender->CanSendFile();
   }
   long long TrySendFile(int fd, long long offset, long long length) override {
      long long n = Sender()->TrySendFile(fd, offset, length);
      _written.fetch_add(n, std::memory_order_relaxed);
      return n;
   }
   void AsyncSendFile(int fd, long long offset, long long length,
                      const System::Functor<void, System::Stream*, Exception*, long long>& callback) override {
      Ref<WatchedStream> self(this);
      Sender()->AsyncSendFile(fd, offset, length, [self, callback](System::Stream*, Exception* e, long long n) {
         self->_written.fetch_add(n, std::memory_order_relaxed);
         callback(self.Get(), e, n);
      });
   }
   long long SendFile(int fd, long long offset, long long length) override {
      long long n = Sender()->SendFile(fd, offset, length);
      _written.fetch_add(n, std::memory_order_relaxed);
      return n;
   }

   // The wrapper's lock is the inner stream's: held across calls, which the analysis
   // cannot follow through the forwarding.
   void Lock() PELMORA_NO_THREAD_SAFETY_ANALYSIS override { _inner->Lock(); }
   void Unlock() PELMORA_NO_THREAD_SAFETY_ANALYSIS override { _inner->Unlock(); }
   bool IsLocked() const override { return _inner->IsLocked(); }
   void Wait() override { _inner->Wait(); }
   bool TimedWait(long long microseconds) override { return _inner->TimedWait(microseconds); }
   void Signal() override { _inner->Signal(); }
   void Broadcast() override { _inner->Broadcast(); }
   int WaitWrite() override { return _inner->WaitWrite(); }
   int WaitRead() override { return _inner->WaitRead(); }
   int TimedWaitWrite(long long microseconds) override { return _inner->TimedWaitWrite(microseconds); }
   int TimedWaitRead(long long microseconds) override { return _inner->TimedWaitRead(microseconds); }
   bool HasWriteCompleted() override { return _inner->HasWriteCompleted(); }
   bool HasReadCompleted() override { return _inner->HasReadCompleted(); }
   void SetReadTimeout(long long microseconds, Logger::LogLevel level, const char* message) override {
      _inner->SetReadTimeout(microseconds, level, message);
   }
   void SetWriteTimeout(long long microseconds, Logger::LogLevel level, const char* message) override {
      _inner->SetWriteTimeout(microseconds, level, message);
   }
   void GetBindingInfo(const std::type_info& type, Ref<System::BindingInfo>& local,
                       Ref<System::BindingInfo>& peer) override {
      _inner->GetBindingInfo(type, local, peer);
   }
   void CloseNoLock() override { _inner->CloseNoLock(); }
   int Write(const char* buffer, int length) override {
      _written.fetch_add(length, std::memory_order_relaxed);
      return _inner->Write(buffer, length);
   }
   void AsyncWrite(const char* buffer, int length,
                   const System::Functor<void, System::Stream*, Exception*>& callback) override {
      _written.fetch_add(length, std::memory_order_relaxed);
      Ref<WatchedStream> self(this);
      _inner->AsyncWrite(buffer, length, [self, callback](System::Stream*, Exception* e) { callback(self.Get(), e); });
   }
   int Read(char* buffer, int length) override {
      _connection->ReadBegins();
      int n;
      try {
         n = _inner->Read(buffer, length);
      } catch (...) {
         _connection->ReadEnds(0);
         throw;
      }
      _connection->ReadEnds(n);
      return n;
   }
   void AsyncRead(char* buffer, int length,
                  const System::Functor<void, System::Stream*, Exception*, int>& callback) override {
      Ref<WatchedStream> self(this);
      _connection->ReadBegins();
      try {
         _inner->AsyncRead(buffer, length, [self, callback](System::Stream*, Exception* e, int n) {
            self->_connection->ReadEnds(n);
            callback(self.Get(), e, n);
         });
      } catch (...) {
         _connection->ReadEnds(0);
         throw;
      }
   }
   void Close() override { _inner->Close(); }
   bool IsSecure() const override { return _inner->IsSecure(); }
   // Bytes handed to the stream for writing so far.
   long long Written() const { return _written.load(std::memory_order_relaxed); }

private:
   // The cross cast costs as much as a small request; most connections never send a file.
   System::FileSender* InnerSender() {
      if (!_senderKnown.load(std::memory_order_acquire)) {
         _sender.store(dynamic_cast<System::FileSender*>(_inner.Get()), std::memory_order_relaxed);
         _senderKnown.store(true, std::memory_order_release);
      }
      return _sender.load(std::memory_order_relaxed);
   }
   System::FileSender* Sender() {
      System::FileSender* sender = InnerSender();
      if (sender == nullptr) throw NotSupportedException();
      return sender;
   }

   Ref<System::Stream> _inner;
   // The inner stream's side, when it has one; found on first use.
   std::atomic<System::FileSender*> _sender{nullptr};
   std::atomic<bool> _senderKnown{false};
   std::atomic<long long> _written{0};
   HttpConnectionImpl* _connection;  // owns this stream
};

std::string StreamName(System::Stream* stream) {
   char text[32];
   std::snprintf(text, sizeof text, "%p", static_cast<const void*>(stream));
   return text;
}

const char* MethodName(int method) {
   switch (method) {
      case RequestHeader::GET: return "GET";
      case RequestHeader::HEAD: return "HEAD";
      case RequestHeader::POST: return "POST";
      case RequestHeader::PUT: return "PUT";
      case RequestHeader::DELETE: return "DELETE";
      default: return "OTHER";
   }
}

}  // namespace

HttpConnectionImpl::HttpConnectionImpl(HttpSvcImpl* svc, System::Stream* stream) : _svc(svc) {
   _stream = new WatchedStream(stream, this);
   _logger = svc->GetConnectionLogger();
   CreateRequest(_stream.Get(), _request);
   _request->SetMaxBodyBytes(svc->GetConfig().maxRequestBodyBytes);
   CreateResponse(this, _stream.Get(), _response);
}

const HttpSvcConfig& HttpConnectionImpl::GetHttpSvcConfig() const { return _svc->GetConfig(); }

long long HttpConnectionImpl::GetReadTimeout() const {
   return _authenticated ? GetHttpSvcConfig().authenticatedReadTimeout : GetHttpSvcConfig().defaultReadTimeout;
}

long long HttpConnectionImpl::GetMaxBufferedResponseBytes() { return GetHttpSvcConfig().maxBufferedResponseBytes; }

void HttpConnectionImpl::ReadBegins() {
   std::lock_guard<std::mutex> lock(_mutex);
   ++_readsPending;
}

void HttpConnectionImpl::ReadEnds(int count) {
   std::lock_guard<std::mutex> lock(_mutex);
   --_readsPending;
   if (count > 0 && _state == WAITING && !_haveFirstByte) {
      _haveFirstByte = true;
      _firstByte = std::chrono::steady_clock::now();
   }
}

bool HttpConnectionImpl::IsIdle() {
   std::lock_guard<std::mutex> lock(_mutex);
   return _state == WAITING && !_haveFirstByte;
}

bool HttpConnectionImpl::IsOverdue(std::chrono::steady_clock::time_point now, long long limit) {
   std::lock_guard<std::mutex> lock(_mutex);
   // The deadline runs from the first byte of a request until its header is in and,
   // while the handler waits for body bytes, until the body is in as well.
   return _haveFirstByte && (_state == WAITING || (_state == BUSY && _readsPending > 0)) &&
          now - _firstByte > std::chrono::microseconds(limit);
}

HttpConnectionImpl::State HttpConnectionImpl::GetState() {
   std::lock_guard<std::mutex> lock(_mutex);
   return _state;
}

void HttpConnectionImpl::Close(const char*) { _stream->Close(); }

void HttpConnectionImpl::Begin() { Next(); }

// Reads the next header. A read that completes before AsyncReadHeader returns is handled
// here in a loop rather than by recursion, so pipelined requests do not deepen the stack.
void HttpConnectionImpl::Next() {
   Ref<HttpConnectionImpl> self(this);
   for (;;) {
      {
         std::lock_guard<std::mutex> lock(_mutex);
         _state = WAITING;
         _haveFirstByte = false;
         _starting = true;
         _syncDone = false;
      }
      _request->AsyncReadHeader(
          [self](Request*, Exception* error, bool gotRequest) { self->HeaderDone(error, gotRequest); });
      std::unique_ptr<Exception> error;
      bool gotRequest;
      {
         std::lock_guard<std::mutex> lock(_mutex);
         _starting = false;
         if (!_syncDone) return;
         error = std::move(_syncError);
         gotRequest = _syncGot;
      }
      if (!Process(error.get(), gotRequest)) return;
   }
}

void HttpConnectionImpl::HeaderDone(Exception* error, bool gotRequest) {
   {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_starting) {
         _syncDone = true;
         _syncError.reset(error != nullptr ? error->Clone() : nullptr);
         _syncGot = gotRequest;
         return;
      }
   }
   if (Process(error, gotRequest)) Next();
}

void HttpConnectionImpl::InitClientCapabilities() {
   const RequestHeader& header = _request->GetHeader();
   std::string connection;
   bool hasConnection = header.GetField("Connection", connection);
   if (header.GetHttpVersion() < RequestHeader::kVersion11) {
      _capabilities.canKeepAlive = hasConnection && connection == "Keep-Alive";
      _capabilities.understandsChunking = false;
   } else {
      _capabilities.canKeepAlive = !(hasConnection && connection == "close");
      _capabilities.understandsChunking = true;
   }
   _capabilities.needsContentLength = false;
   std::string agent;
   if (!header.GetField("User-Agent", agent)) agent = "No-User-Agent";
   PELMORA_LOG_TRIVIA(_logger.Get(), "User agent is '%1'", agent);
   // A client sends the same agent on every request of a connection: the expressions
   // run once per agent, not per request.
   if (!_agentKnown || agent != _agent) {
      _agent = agent;
      _agentKnown = true;
      _svc->ClassifyAgent(agent, _agentNonChunking, _agentNeedsLength);
   }
   if (_agentNonChunking) {
      _capabilities.understandsChunking = false;
      PELMORA_LOG_VERBOSE(_logger.Get(), "User agent '%1' is non-chunking: %2", agent, true);
   }
   if (_agentNeedsLength) {
      _capabilities.needsContentLength = true;
      PELMORA_LOG_VERBOSE(_logger.Get(), "User agent '%1' needs Content-Length: %2", agent, true);
   }
}

// True when the next request should be read.
bool HttpConnectionImpl::Process(Exception* error, bool gotRequest) {
   auto stream = [this] { return StreamName(_stream.Get()); };
   if (error == nullptr && !gotRequest) {
      End();
      return false;
   }
   {
      std::lock_guard<std::mutex> lock(_mutex);
      _state = BUSY;
   }
   if (error == nullptr && !_svc->IsRunning()) {
      PELMORA_LOG_INFO(_logger.Get(), "Ignored pending request. State: %1", _svc->GetOpState());
      End();
      return false;
   }
   InitClientCapabilities();
   if (error != nullptr) {
      if (dynamic_cast<NotSupportedException*>(error) != nullptr) {
         PELMORA_LOG_WARNING(_logger.Get(), "HTTP parser failed: %1", *error);
         try {
            _response->SendError(ResponseCode::NotImplemented);
         } catch (const Exception&) {
         }
      } else if (dynamic_cast<MalformedHeaderException*>(error) != nullptr) {
         PELMORA_LOG_WARNING(_logger.Get(), "Ill-formed header on stream %1: %2", stream(), *error);
      } else if (_firstRequest) {
         PELMORA_LOG_INFO(_logger.Get(), "First read failed on stream %1: %2", stream(), *error);
      } else {
         PELMORA_LOG_INFO(_logger.Get(), "Connection lost while waiting for the next request on stream %1: %2",
                          stream(), *error);
      }
      End();
      return false;
   }
   _firstRequest = false;
   _completed = false;
   _deferred = false;
   if (GetHttpSvcConfig().accessLog) {
      _began = std::chrono::steady_clock::now();
      _writtenBefore = dynamic_cast<WatchedStream*>(_stream.Get())->Written();
   }
   bool next = Dispatch();
   if (_deferred) {
      std::lock_guard<std::mutex> lock(_mutex);
      if (!_deferredDone) {
         // ResponseFinished carries on once the rest of the answer is out.
         _awaitingDeferred = true;
         _nextAfterDeferred = next;
         return false;
      }
      next = next && !_deferredFailed;
   }
   return AfterResponse(next);
}

bool HttpConnectionImpl::DeferResponse() {
   std::lock_guard<std::mutex> lock(_mutex);
   _deferred = true;
   _deferredDone = false;
   _deferredFailed = false;
   _awaitingDeferred = false;
   return true;
}

void HttpConnectionImpl::ResponseFinished(Exception* error) {
   bool next;
   {
      std::lock_guard<std::mutex> lock(_mutex);
      _deferredFailed = error != nullptr;
      if (!_awaitingDeferred) {
         _deferredDone = true;
         return;
      }
      _awaitingDeferred = false;
      next = _nextAfterDeferred && error == nullptr;
   }
   if (error != nullptr)
      PELMORA_LOG_INFO(_logger.Get(), "Sending the response on stream %1 failed: %2", StreamName(_stream.Get()),
                       *error);
   if (AfterResponse(next)) Next();
}

// The access line, then the wait for the next request or the end of the connection.
bool HttpConnectionImpl::AfterResponse(bool next) {
   if (GetHttpSvcConfig().accessLog) {
      long long micros =
          std::chrono::duration_cast<std::chrono::microseconds>(std::chrono::steady_clock::now() - _began).count();
      Ref<System::BindingInfo> local, peer;
      _stream->GetBindingInfo(typeid(System::BindingInfo), local, peer);
      PELMORA_LOG_INFO(_logger.Get(), "%1 %2 %3 %4 %5 %6", MethodName(_request->GetMethod()), _request->GetPath(),
                       _response->GetHeader().GetResponseCode().code,
                       dynamic_cast<WatchedStream*>(_stream.Get())->Written() - _writtenBefore, micros,
                       peer ? peer->GetAddress() + ":" + std::to_string(peer->GetPort()) : std::string("-"));
   }
   if (next) next = FinishRequest();
   if (!next) End();
   return next;
}

// Runs the handler for the request just read; true when the connection stays open.
bool HttpConnectionImpl::Dispatch() {
   auto stream = [this] { return StreamName(_stream.Get()); };
   const HttpSvcConfig& config = GetHttpSvcConfig();
   const RequestHeader& header = _request->GetHeader();
   try {
      if (config.maxHeaderFields >= 0 && static_cast<long long>(header.GetFields().size()) > config.maxHeaderFields) {
         PELMORA_LOG_WARNING(_logger.Get(), "Request on stream %1 has %2 header fields, more than %3", stream(),
                             static_cast<long long>(header.GetFields().size()), config.maxHeaderFields);
         _response->SendError(kHeaderFieldsTooLarge);
         return false;
      }
      long long length = 0;
      if (config.maxRequestBodyBytes >= 0 && _request->GetContentLength(length) &&
          length > config.maxRequestBodyBytes) {
         PELMORA_LOG_WARNING(_logger.Get(), "Request body of %1 bytes on stream %2 exceeds %3", length, stream(),
                             config.maxRequestBodyBytes);
         _response->SendError(ResponseCode::RequestEntityTooLarge);
         return false;
      }
      const std::string& path = _request->GetPath();
      if (!IsValidUtf8(path)) {
         PELMORA_LOG_WARNING(_logger.Get(), "HTTP Transaction failed on stream %1 with error %2", stream(),
                             "Invalid UTF-8");
         _response->SendError(ResponseCode::BadRequest, "Invalid UTF-8");
         return false;
      }
      if (config.xFrameOptionsEnabled) _response->GetHeader().SetField("X-Frame-Options", config.xFrameOptions);
      Ref<RequestHandler> handler;
      if (_svc->FindHandler(path, handler)) PELMORA_LOG_TRIVIA(_logger.Get(), "ProcessRequest: using default handler");
      if (!handler) throw InvalidStateException("No RequestHandler has been set");
      switch (_request->GetMethod()) {
         case RequestHeader::GET: handler->HandleGet(_request.Get(), _response.Get()); break;
         case RequestHeader::HEAD: handler->HandleHead(_request.Get(), _response.Get()); break;
         case RequestHeader::POST: handler->HandlePost(_request.Get(), _response.Get()); break;
         case RequestHeader::PUT: handler->HandlePut(_request.Get(), _response.Get()); break;
         case RequestHeader::DELETE: handler->HandleDelete(_request.Get(), _response.Get()); break;
         default:
            PELMORA_LOG_WARNING(_logger.Get(), "Unknown method in HTTP parser");
            throw Exception("Unknown method in HTTP parser");
      }
      // A handler that wrote its answer without ending it still gets it sent.
      if (!_response->IsResponseComplete()) _response->Complete();
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(_logger.Get(), "HTTP Transaction failed on stream %1 with error %2", stream(), e);
      bool tooLarge = dynamic_cast<const RequestBodyTooLargeException*>(&e) != nullptr;
      if (!_response->IsHeaderSent() && !_response->IsResponseComplete()) {
         try {
            _response->SendError(tooLarge ? ResponseCode::RequestEntityTooLarge : ResponseCode::InternalServerError);
         } catch (const Exception&) {
         }
      }
      return false;
   }
   return _completed && _completedKeepAlive;
}

// After a kept-alive response: skip what the handler left of the body, rearm the
// time-outs for the wait between requests and reset the request and response.
bool HttpConnectionImpl::FinishRequest() {
   if (!_completed || !_completedKeepAlive) return false;
   bool hasBody = _request->IsChunkedEncoded() || _request->GetContentLength() > 0;
   if (hasBody) {
      try {
         // Uninitialised on the stack: usually the handler read the whole body and the
         // first Read returns 0, so this must cost nothing.
         char scratch[16384];
         long long left = GetHttpSvcConfig().maxRequestBodyBytes;
         for (int n; (n = _request->Read(scratch, static_cast<int>(sizeof scratch))) > 0;) {
            left -= n;
            if (GetHttpSvcConfig().maxRequestBodyBytes >= 0 && left < 0) return false;
         }
      } catch (const Exception& e) {
         PELMORA_LOG_INFO(_logger.Get(), "Failed to read request; stream: %1, error: %2", StreamName(_stream.Get()), e);
         return false;
      }
   }
   _authenticated = IsAuthenticatedResponse(_response.Get());
   const HttpSvcConfig& config = GetHttpSvcConfig();
   _stream->SetReadTimeout(GetReadTimeout(), Logger::LOG_INFO, "Timed out reading between HTTP requests.");
   _stream->SetWriteTimeout(_authenticated ? config.authenticatedWriteTimeout : config.defaultWriteTimeout,
                            Logger::LOG_INFO, "Timed out sending HTTP response.");
   _response->Reset();
   _request->ResetStream(_stream.Get());
   return _svc->IsRunning();
}

void HttpConnectionImpl::ResponseCompleted(bool keepAlive) {
   _completed = true;
   _completedKeepAlive = keepAlive && _capabilities.canKeepAlive;
   if (_completedKeepAlive) {
      PELMORA_LOG_TRIVIA(_logger.Get(), "ResponseCompleted(true)");
   } else {
      PELMORA_LOG_TRIVIA(_logger.Get(), "ResponseCompleted(false), request keep alive %1, closeStream %2",
                         _capabilities.canKeepAlive, true);
   }
}

void HttpConnectionImpl::End() {
   {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_state == CLOSED) return;
      _state = CLOSED;
   }
   _stream->Close();
   _request->Close();
   _response->Close();
   _svc->ConnectionEnded(this);
}

}  // namespace Pelmora::Http
