#include "pelmora/http/response.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <memory>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/object/weak.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/system/streamFileSender.h"
#include "src/http/charBuffer.h"
#include "src/http/httpLog.h"

namespace Pelmora::Http {

namespace {

std::atomic<unsigned int> sBufferSize{8192};

// Room in front of the body for the status line and fields (larger headers are written
// ahead of the body instead) and for a chunk-size line.
constexpr size_t kPrependReserve = 512;
// Room behind the body for a chunk's CR LF and the terminal chunk.
constexpr size_t kTrailerRoom = 16;
// No configured maximum: a whole-buffered body may still not pass this.
constexpr size_t kUnlimitedBuffered = size_t(1) << 40;

const char kTerminalChunk[] = "0\r\n\r\n";

// Too long for a short string: made once rather than for every response.
const std::string kTransferEncoding = "Transfer-Encoding";

enum ResponseState {
   RESPONSE_BUFFERING,              // header unsent, body collecting
   RESPONSE_ACCEPT_WRITE_CHUNKED,   // header sent, body going out in chunks
   RESPONSE_ACCEPT_WRITE_SIZED,     // header sent with a preset Content-Length
   RESPONSE_COMPLETE,
};

// Weakly linkable so that its connection can refer to it without keeping it alive.
class ResponseImpl : public virtual Response, public WeakLinkableImpl<System::LockableObjectImpl> {
public:
   ResponseImpl(HttpConnection* connection, System::Stream* stream) : _connection(connection), _stream(stream) {}

   ResponseHeader& GetHeader() override { return _header; }
   void SetStatusCode(const ResponseCode::Info& info) override { _header.SetResponseCode(info); }
   void SetContentLength(long long length) override { _presetContentLength = length < 0 ? -1 : length; }
   void SetCacheResponse(bool cache) override { _header.SetCacheResponse(cache); }
   void SetKeepAlive(bool keepAlive) override { _header.SetKeepAlive(keepAlive); }
   void SetChunkedEncodingAllowed(bool allowed) override { _chunkingAllowed = allowed; }
   void AddCookie(Cookie* cookie) override { _header.AddCookie(cookie); }
   void SetSession(Object* session) override { _session = session; }
   void GetSession(Ref<Object>& out) override { out = _session; }
   void UseAuthenticatedTimeout(bool use) override { _authenticatedTimeout = use; }
   bool IsUsingAuthenticatedTimeout() const override { return _authenticatedTimeout; }

   void Write(const char* data, int length) override;
   void FlushToStream() override;
   void Complete() override;
   void SendFile(int fd, long long offset, long long length) override;
   void SendError(const ResponseCode::Info& info) override;
   void SendError(const ResponseCode::Info& info, const std::string& text) override;
   void SendContinue() override;
   void Reset() override;
   void ResetStream(System::Stream* stream) override { _stream = stream; }
   void Close() override { _stream->Close(); }
   bool IsHeaderSent() const override { return _headerSent; }
   bool IsResponseComplete() const override { return _currState == RESPONSE_COMPLETE; }
   bool IsSecure() const override { return _stream->IsSecure(); }

private:
   void PrepareToWrite();
   void VerifyBufferedResponseLength(size_t adding);
   // The buffer is full and more body is coming: send it, or keep all of it.
   void MakeRoom();
   void StartChunked();
   // Puts the header in front of the buffered bytes, or on the wire when it does not fit.
   void PrependHeader();
   void FrameBufferedChunk();
   void WriteChunk();
   void WriteSized(bool lastBlock);
   void CopyFile(int fd, long long offset, long long length);
   size_t BodyRoom() const;

   HttpConnection* _connection;
   Ref<System::Stream> _stream;
   ResponseHeader _header;
   std::unique_ptr<CharBuffer> _buffer;
   // The fixed buffer of the last response, kept by Reset for the next one on the connection.
   std::unique_ptr<CharBuffer> _spareBuffer;
   bool _bufferFixed = false;
   ResponseState _currState = RESPONSE_BUFFERING;
   bool _prepared = false;
   bool _headerSent = false;
   bool _chunkingAllowed = false;
   bool _needsContentLength = false;
   bool _clientChunks = true;
   // The body no longer fits one buffer and has nowhere to go but a larger one.
   bool _bufferingWhole = false;
   size_t _bufferSize = 0;
   long long _presetContentLength = -1;
   Ref<Object> _session;
   bool _authenticatedTimeout = false;
};

void ResponseImpl::PrepareToWrite() {
   ClientCapabilities capabilities;
   _connection->GetClientCapabilities(capabilities);
   // Per-response lines are trivia: the in-memory log keeps verbose ones, and formatting
   // them for every response costs more than the rest of a small answer.
   PELMORA_LOG_TRIVIA(GetHttpLogger(),
                       "HTTP Response: Client: NeedsContentLength: %1 UnderstandsChunking: %2 CanKeepAlive: %3 "
                       "(PresetContentLength %4)",
                       capabilities.needsContentLength, capabilities.understandsChunking,
                       capabilities.canKeepAlive, _presetContentLength);
   _needsContentLength = capabilities.needsContentLength;
   _clientChunks = capabilities.understandsChunking;
   _bufferSize = GetBufferSize();
   if (_needsContentLength) {
      long long max = _connection->GetMaxBufferedResponseBytes();
      _buffer.reset(new DynamicCharBuffer(max >= 0 ? static_cast<size_t>(max) : kUnlimitedBuffered, kPrependReserve));
   } else if (_spareBuffer && _spareBuffer->Capacity() == _bufferSize + kTrailerRoom) {
      _buffer = std::move(_spareBuffer);
      _buffer->Clear();
   } else {
      _buffer.reset(new FixedCharBuffer(_bufferSize + kTrailerRoom, kPrependReserve));
   }
   _bufferFixed = !_needsContentLength;
   std::string connection;
   if (!_header.GetField("Connection", connection)) _header.SetKeepAlive(capabilities.canKeepAlive);
   _prepared = true;
}

size_t ResponseImpl::BodyRoom() const {
   if (_needsContentLength || _bufferingWhole) return _buffer->Free();
   size_t filled = _buffer->Filled();
   return filled >= _bufferSize ? 0 : _bufferSize - filled;
}

void ResponseImpl::VerifyBufferedResponseLength(size_t adding) {
   long long max = _connection->GetMaxBufferedResponseBytes();
   if (max < 0 || static_cast<long long>(_buffer->Filled() + adding) <= max) return;
   if (_needsContentLength) {
      throw Exception(MessageFormatter::ASPrint(
         "Response body length exceeds configured maximum, %1, for a client  that requires Content-Length", max));
   }
   throw Exception("Write would exceeded maximum buffered response size");
}

void ResponseImpl::Write(const char* data, int length) {
   if (IsResponseComplete()) throw InvalidStateException("Response already complete");
   if (length <= 0) return;
   if (!_prepared) PrepareToWrite();
   size_t left = static_cast<size_t>(length);
   if (_needsContentLength || _bufferingWhole) {
      VerifyBufferedResponseLength(left);
   }
   while (left > 0) {
      size_t room = BodyRoom();
      if (room == 0) {
         MakeRoom();
         if (_bufferingWhole) VerifyBufferedResponseLength(left);
         continue;
      }
      size_t take = room < left ? room : left;
      size_t taken = _buffer->Append(data, take);
      data += taken;
      left -= taken;
   }
}

void ResponseImpl::MakeRoom() {
   switch (_currState) {
      case RESPONSE_ACCEPT_WRITE_CHUNKED:
         WriteChunk();
         return;
      case RESPONSE_ACCEPT_WRITE_SIZED:
         WriteSized(false);
         return;
      case RESPONSE_BUFFERING:
         break;
      case RESPONSE_COMPLETE:
         PELMORA_NOT_REACHED();
   }
   if (_chunkingAllowed && _clientChunks) {
      StartChunked();
      WriteChunk();
   } else if (_presetContentLength >= 0) {
      _header.SetContentLength(_presetContentLength);
      _currState = RESPONSE_ACCEPT_WRITE_SIZED;
      PrependHeader();
      WriteSized(false);
   } else {
      // Nowhere to send the body yet: keep all of it in a buffer that grows.
      long long max = _connection->GetMaxBufferedResponseBytes();
      std::unique_ptr<CharBuffer> larger(
         new DynamicCharBuffer(max >= 0 ? static_cast<size_t>(max) : kUnlimitedBuffered, kPrependReserve));
      char piece[4096];
      _buffer->Flip();
      for (size_t n; (n = _buffer->Get(piece, sizeof piece)) > 0;) larger->Append(piece, n);
      _buffer = std::move(larger);
      _bufferFixed = false;
      _bufferingWhole = true;
   }
}

void ResponseImpl::StartChunked() {
   PELMORA_LOG_VERBOSE(GetHttpLogger(), "HTTP Response: Setting chunking to %1", true);
   _header.RemoveField("Content-Length");
   _header.SetTransferEncoding("chunked");
   _currState = RESPONSE_ACCEPT_WRITE_CHUNKED;
}

void ResponseImpl::PrependHeader() {
   std::string head = _header.ToString();
   size_t headLen = head.size();
   PELMORA_VERIFY(headLen > 0);
   PELMORA_LOG_TRIVIA(GetHttpLogger(), "HTTP Response: Header size is %1", headLen);
   if (headLen <= _buffer->PrependPosition()) {
      size_t numWritten = _buffer->Prepend(head.data(), headLen);
      PELMORA_VERIFY(numWritten == headLen);
   } else {
      size_t numWritten = static_cast<size_t>(_stream->Write(head.data(), static_cast<int>(headLen)));
      PELMORA_VERIFY(headLen == numWritten);
   }
   _headerSent = true;
}

// Wraps the buffered bytes, if any, as one chunk: size line in front, CR LF behind.
void ResponseImpl::FrameBufferedChunk() {
   size_t dataLen = _buffer->Filled();
   if (dataLen > 0) {
      char sizeLine[24];
      int lineLen = snprintf(sizeLine, sizeof sizeLine, "%lX\r\n", static_cast<unsigned long>(dataLen));
      size_t numWritten = _buffer->Prepend(sizeLine, static_cast<size_t>(lineLen));
      PELMORA_VERIFY(numWritten == static_cast<size_t>(lineLen));
      const size_t footerLen = 2;
      numWritten = _buffer->Append("\r\n", footerLen);
      PELMORA_VERIFY(numWritten == footerLen);
   }
}

void ResponseImpl::WriteChunk() {
   PELMORA_VERIFY(_currState == RESPONSE_ACCEPT_WRITE_CHUNKED);
   FrameBufferedChunk();
   if (!_headerSent) PrependHeader();
   _buffer->WriteTo(_stream.Get());
}

void ResponseImpl::WriteSized(bool lastBlock) {
   PELMORA_VERIFY(!lastBlock || _currState != RESPONSE_ACCEPT_WRITE_CHUNKED);
   if (!_headerSent) PrependHeader();
   _buffer->WriteTo(_stream.Get());
}

void ResponseImpl::FlushToStream() {
   if (IsResponseComplete() || !_prepared) return;
   if (_needsContentLength || _bufferingWhole) return;
   if (_currState == RESPONSE_BUFFERING) {
      if (_chunkingAllowed && _clientChunks) {
         StartChunked();
      } else if (_presetContentLength >= 0) {
         _header.SetContentLength(_presetContentLength);
         _currState = RESPONSE_ACCEPT_WRITE_SIZED;
      } else {
         return;
      }
   }
   if (_currState == RESPONSE_ACCEPT_WRITE_CHUNKED) {
      WriteChunk();
   } else {
      WriteSized(false);
   }
}

void ResponseImpl::Complete() {
   PELMORA_VERIFY(!IsResponseComplete());
   if (!_prepared) PrepareToWrite();
   switch (_currState) {
      case RESPONSE_BUFFERING:
         _header.RemoveField(kTransferEncoding);
         // A preset length with no body written answers HEAD: it tells the length GET would send.
         _header.SetContentLength(_buffer->Filled() == 0 && _presetContentLength > 0
                                      ? _presetContentLength
                                      : static_cast<long long>(_buffer->Filled()));
         WriteSized(true);
         break;
      case RESPONSE_ACCEPT_WRITE_CHUNKED: {
         // The last data chunk and the terminal chunk leave in one write.
         FrameBufferedChunk();
         const int terminalChunkLen = sizeof kTerminalChunk - 1;
         size_t numWritten = _buffer->Append(kTerminalChunk, terminalChunkLen);
         PELMORA_VERIFY(numWritten == (size_t)terminalChunkLen);
         _buffer->WriteTo(_stream.Get());
         break;
      }
      case RESPONSE_ACCEPT_WRITE_SIZED:
         WriteSized(true);
         break;
      case RESPONSE_COMPLETE:
         PELMORA_NOT_REACHED();
   }
   _currState = RESPONSE_COMPLETE;
   _connection->ResponseCompleted(_header.GetKeepAlive());
}

void ResponseImpl::SendFile(int fd, long long offset, long long length) {
   if (IsResponseComplete()) throw InvalidStateException("Response already complete");
   if (_headerSent || (_prepared && _buffer->Filled() > 0)) throw InvalidStateException("Body already written");
   if (offset < 0 || length < 0) throw InvalidArgumentException("negative file offset or length");
   auto* sender = dynamic_cast<System::FileSender*>(_stream.Get());
   if (sender == nullptr || !sender->CanSendFile() || length == 0) {
      CopyFile(fd, offset, length);
      return;
   }
   if (!_prepared) PrepareToWrite();
   _header.RemoveField(kTransferEncoding);
   _header.SetContentLength(length);
   std::string head = _header.ToString();
   _stream->Write(head.data(), static_cast<int>(head.size()));
   _headerSent = true;
   _currState = RESPONSE_ACCEPT_WRITE_SIZED;
   long long sent = sender->TrySendFile(fd, offset, length);
   if (sent < length) {
      int own = _connection->DeferResponse() ? ::fcntl(fd, F_DUPFD_CLOEXEC, 0) : -1;
      if (own < 0) {
         sent += sender->SendFile(fd, offset + sent, length - sent);
      } else {
         // The rest goes out on the stream's I/O service; the connection carries on
         // when it is done.
         long long left = length - sent;
         Ref<ResponseImpl> self(this);
         Ref<HttpConnection> connection(_connection);
         _currState = RESPONSE_COMPLETE;
         _connection->ResponseCompleted(_header.GetKeepAlive());
         try {
            sender->AsyncSendFile(own, offset + sent, left,
                                  [self, connection, own, left](System::Stream*, Exception* error, long long n) {
                                     ::close(own);
                                     if (error == nullptr && n < left) {
                                        Exception shorter("File ended before its length");
                                        connection->ResponseFinished(&shorter);
                                     } else {
                                        connection->ResponseFinished(error);
                                     }
                                  });
         } catch (Exception& e) {
            ::close(own);
            connection->ResponseFinished(&e);
         }
         return;
      }
   }
   if (sent < length) throw Exception("File ended before its length");
   _currState = RESPONSE_COMPLETE;
   _connection->ResponseCompleted(_header.GetKeepAlive());
}

// The file's bytes through the body buffer, for streams that cannot send files.
void ResponseImpl::CopyFile(int fd, long long offset, long long length) {
   SetContentLength(length);
   std::vector<char> piece(std::min<long long>(std::max<long long>(length, 1), 65536));
   while (length > 0) {
      ssize_t n = ::pread(fd, piece.data(), static_cast<size_t>(std::min<long long>(length, piece.size())),
                          static_cast<off_t>(offset));
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) throw SystemException(errno);
      if (n == 0) throw Exception("File ended before its length");
      Write(piece.data(), static_cast<int>(n));
      offset += n;
      length -= n;
   }
   Complete();
}

void ResponseImpl::SendError(const ResponseCode::Info& info) {
   SendError(info, MessageFormatter::ASPrint("%1 %2\n", info.code, info.reasonPhrase));
}

void ResponseImpl::SendError(const ResponseCode::Info& info, const std::string& text) {
   if (_headerSent) throw IOException("Header already sent to client.");
   if (IsResponseComplete()) throw InvalidStateException("Response already complete");
   // Whatever body was collected is dropped; the error is the whole answer.
   if (_prepared) {
      _buffer.reset();
      _prepared = false;
      _bufferingWhole = false;
   }
   _presetContentLength = -1;
   _header.RemoveField(kTransferEncoding);
   _header.SetResponseCode(info);
   _header.SetKeepAlive(false);
   _header.SetContentType("text/plain", "utf-8");
   Write(text.data(), static_cast<int>(text.size()));
   Complete();
}

void ResponseImpl::SendContinue() {
   if (_headerSent || IsResponseComplete()) {
      throw InvalidStateException("Cannot send continue -- not in state where output is valid.");
   }
   std::string line = MessageFormatter::ASPrint("%1 %2 %3\r\n\r\n", "HTTP/1.1", ResponseCode::Continue.code,
                                                ResponseCode::Continue.reasonPhrase);
   _stream->Write(line.data(), static_cast<int>(line.size()));
}

void ResponseImpl::Reset() {
   _header.ClearHeader();
   if (_bufferFixed && _buffer) _spareBuffer = std::move(_buffer);
   _buffer.reset();
   _bufferFixed = false;
   _currState = RESPONSE_BUFFERING;
   _prepared = false;
   _headerSent = false;
   _chunkingAllowed = false;
   _needsContentLength = false;
   _clientChunks = true;
   _bufferingWhole = false;
   _presetContentLength = -1;
   _session.Reset();
   _authenticatedTimeout = false;
}

}  // namespace

void CreateResponse(HttpConnection* connection, System::Stream* stream, Ref<Response>& out) {
   out = new ResponseImpl(connection, stream);
}

void SetBufferSize(unsigned int size) { sBufferSize.store(size < 64 ? 64 : size); }

unsigned int GetBufferSize() { return sBufferSize.load(); }

}  // namespace Pelmora::Http
