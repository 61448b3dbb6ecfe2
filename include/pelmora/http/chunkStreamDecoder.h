#pragma once
// A ChunkStreamDecoder follows chunked transfer coding one byte at a time for a caller
// that passes the bytes on unchanged (a forwarder): it tells where a chunked message ends.
// Framing failures are logged, not thrown; the decoder then stays failed until rearmed.
// Not thread-safe.

#include <cstdint>

#include "pelmora/object/export.h"
#include "pelmora/service/logger.h"

namespace Pelmora::Http {

enum ChunkStreamState {
   CHUNK_STREAM_HEADER,             // reading the hexadecimal size
   CHUNK_STREAM_HEADER_SEEK_CR,     // skipping an extension up to the line's CR
   CHUNK_STREAM_HEADER_SEEK_LF,     // the size line's LF
   CHUNK_STREAM_DATA,               // inside chunk data
   CHUNK_STREAM_TRAILER_SEEK_CR,    // the CR after chunk data
   CHUNK_STREAM_TRAILER_SEEK_LF,    // the LF after chunk data
   CHUNK_STREAM_FINAL_TRAILER,      // trailer lines after the last chunk
   CHUNK_STREAM_DONE,               // the message has ended
   CHUNK_STREAM_FAILED,             // a failure was logged
};

class PELMORA_EXPORT ChunkStreamDecoder {
public:
   static constexpr int kMaxSizeCharacters = 18;
   static constexpr int kMaxLineLength = 10240;

   // Failures go to `logger`, or to the HTTP layer's logger when null.
   explicit ChunkStreamDecoder(Service::Logger* logger = nullptr);

   // Follows `length` bytes. Returns how many belong to the current message (fewer than
   // `length` only when it ended inside them), or -1 once a failure was logged.
   int ProcessBuffer(const char* data, int length);
   // Rearms the decoder for the next message.
   void NewChunkStreamStarted();

   ChunkStreamState GetState() const { return _state; }
   bool IsDone() const { return _state == CHUNK_STREAM_DONE; }
   bool HasFailed() const { return _state == CHUNK_STREAM_FAILED; }

private:
   void Fail(const char* text);
   void Fail(const char* format, char c);

   Service::Logger* _logger;
   ChunkStreamState _state = CHUNK_STREAM_HEADER;
   uint64_t _chunkSize = 0;
   int _sizeCharacters = 0;
   int _lineLength = 0;
   uint64_t _remaining = 0;
};

}  // namespace Pelmora::Http
