#include "pelmora/http/chunkStreamDecoder.h"

#include "pelmora/service/logMacros.h"
#include "src/http/httpLog.h"

namespace Pelmora::Http {

namespace {

int HexDigit(char c) {
   if (c >= '0' && c <= '9') return c - '0';
   if (c >= 'a' && c <= 'f') return c - 'a' + 10;
   if (c >= 'A' && c <= 'F') return c - 'A' + 10;
   return -1;
}

}  // namespace

ChunkStreamDecoder::ChunkStreamDecoder(Service::Logger* logger) : _logger(logger) {}

void ChunkStreamDecoder::NewChunkStreamStarted() {
   _state = CHUNK_STREAM_HEADER;
   _chunkSize = 0;
   _sizeCharacters = 0;
   _lineLength = 0;
   _remaining = 0;
}

void ChunkStreamDecoder::Fail(const char* text) {
   _state = CHUNK_STREAM_FAILED;
   Service::Logger* logger = _logger ? _logger : GetHttpLogger();
   PELMORA_LOG_ERROR(logger, text);
}

void ChunkStreamDecoder::Fail(const char* format, char c) {
   _state = CHUNK_STREAM_FAILED;
   Service::Logger* logger = _logger ? _logger : GetHttpLogger();
   PELMORA_LOG_ERROR(logger, format, c);
}

int ChunkStreamDecoder::ProcessBuffer(const char* data, int length) {
   int i = 0;
   while (i < length) {
      char c = data[i];
      switch (_state) {
         case CHUNK_STREAM_HEADER: {
            ++_lineLength;
            int digit = HexDigit(c);
            if (digit >= 0) {
               if (++_sizeCharacters > kMaxSizeCharacters) {
                  Fail("Chunk encoding failure: Header line too long");
                  return -1;
               }
               _chunkSize = (_chunkSize << 4) | static_cast<uint64_t>(digit);
            } else if (c == '\r' || c == ';' || c == ' ' || c == '\t') {
               if (_sizeCharacters == 0) {
                  Fail("Chunk encoding failure: Empty chunk header");
                  return -1;
               }
               _state = c == '\r' ? CHUNK_STREAM_HEADER_SEEK_LF : CHUNK_STREAM_HEADER_SEEK_CR;
            } else {
               Fail("Chunk encoding failure: Encountered unexpected character '%1', expected chunk header", c);
               return -1;
            }
            break;
         }
         case CHUNK_STREAM_HEADER_SEEK_CR:
         case CHUNK_STREAM_HEADER_SEEK_LF:
            if (c == '\n' && _state == CHUNK_STREAM_HEADER_SEEK_LF) {
               _lineLength = 0;
               _sizeCharacters = 0;
               if (_chunkSize == 0) {
                  _state = CHUNK_STREAM_FINAL_TRAILER;
               } else {
                  _remaining = _chunkSize;
                  _state = CHUNK_STREAM_DATA;
               }
               break;
            }
            if (++_lineLength > kMaxLineLength) {
               Fail("Chunk encoding failure: Maximum chunk header line length exceeded");
               return -1;
            }
            _state = c == '\r' ? CHUNK_STREAM_HEADER_SEEK_LF : CHUNK_STREAM_HEADER_SEEK_CR;
            break;
         case CHUNK_STREAM_DATA: {
            uint64_t available = static_cast<uint64_t>(length - i);
            uint64_t take = available < _remaining ? available : _remaining;
            _remaining -= take;
            i += static_cast<int>(take);
            if (_remaining == 0) _state = CHUNK_STREAM_TRAILER_SEEK_CR;
            continue;
         }
         case CHUNK_STREAM_TRAILER_SEEK_CR:
            if (c != '\r') {
               Fail("Chunk encoding failure: Encountered unexpected character '%1', expected CR after chunk data", c);
               return -1;
            }
            _state = CHUNK_STREAM_TRAILER_SEEK_LF;
            break;
         case CHUNK_STREAM_TRAILER_SEEK_LF:
            if (c != '\n') {
               Fail("Chunk encoding failure: Encountered unexpected character '%1', expected LF after chunk data", c);
               return -1;
            }
            _chunkSize = 0;
            _lineLength = 0;
            _state = CHUNK_STREAM_HEADER;
            break;
         case CHUNK_STREAM_FINAL_TRAILER:
            if (c == '\n') {
               if (_lineLength == 0) {
                  _state = CHUNK_STREAM_DONE;
                  return i + 1;
               }
               _lineLength = 0;
            } else if (c != '\r') {
               if (++_lineLength > kMaxLineLength) {
                  Fail("Chunk encoding failure: Maximum chunk trailer line length exceeded");
                  return -1;
               }
            }
            break;
         case CHUNK_STREAM_DONE:
            return i;
         case CHUNK_STREAM_FAILED:
            return -1;
      }
      ++i;
   }
   return _state == CHUNK_STREAM_FAILED ? -1 : length;
}

}  // namespace Pelmora::Http
