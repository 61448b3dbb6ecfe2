#include "src/http/requestScan.h"

#include <cstring>

#include "pelmora/http/header.h"

namespace Pelmora::Http {

int HeaderScanner::Scan(const char* data, int length) {
   // Line by line with memchr rather than byte by byte: this runs for every request.
   // A NUL fails the header only when it comes before the header's end (body bytes
   // read along with the header may hold any byte).
   const char* nul = static_cast<const char*>(std::memchr(data, '\0', static_cast<size_t>(length)));
   const int nulAt = nul != nullptr ? static_cast<int>(nul - data) : length;
   int i = 0;
   while (i < length) {
      const char* lf = static_cast<const char*>(std::memchr(data + i, '\n', static_cast<size_t>(length - i)));
      int stop = lf != nullptr ? static_cast<int>(lf - data) : length;
      if (nulAt < stop) throw MalformedHeaderException("invalid value 0 ");
      if (!_lineHasContent) {
         for (int j = i; j < stop; ++j) {
            if (data[j] != ' ' && data[j] != '\r') {
               if (!_contentSeen) _contentStart = _lineStart;
               _lineHasContent = true;
               _contentSeen = true;
               break;
            }
         }
      }
      if (lf == nullptr) break;
      if (!_lineHasContent && _contentSeen) {
         _scanned += stop + 1;
         return stop + 1;
      }
      _lineHasContent = false;
      _lineStart = _scanned + stop + 1;
      i = stop + 1;
   }
   _scanned += length;
   return -1;
}

void ChunkedBodyDecoder::Reset() {
   _phase = SIZE_LINE;
   _lineCharacters = 0;
   _chunkLeft = 0;
}

void ChunkedBodyDecoder::EndSizeLine() {
   // The size is the hexadecimal number that starts the line; an extension (";...") or
   // anything else after it is ignored.
   uint64_t size = 0;
   int digits = 0;
   for (int i = 0; i < _lineCharacters; ++i) {
      char c = _sizeLine[i];
      int digit;
      if (c >= '0' && c <= '9') digit = c - '0';
      else if (c >= 'a' && c <= 'f') digit = c - 'a' + 10;
      else if (c >= 'A' && c <= 'F') digit = c - 'A' + 10;
      else break;
      // More than 15 digits would overflow a signed 64-bit length somewhere downstream.
      if (++digits > 15) throw Exception("Malformed chunk header.");
      size = (size << 4) | static_cast<uint64_t>(digit);
   }
   if (digits == 0) throw Exception("Malformed chunk header.");
   _lineCharacters = 0;
   _chunkLeft = size;
   _phase = size == 0 ? TRAILER : DATA;
}

size_t ChunkedBodyDecoder::Decode(const char* in, size_t inLength, char* out, size_t outLength,
                                  size_t& produced) {
   produced = 0;
   size_t i = 0;
   while (i < inLength && _phase != DONE) {
      char c = in[i];
      switch (_phase) {
         case SIZE_LINE:
            if (c == '\n') {
               EndSizeLine();
            } else {
               if (_lineCharacters + 1 >= kMaxSizeLine) throw Exception("Malformed chunk header.");
               _sizeLine[_lineCharacters++] = c;
            }
            ++i;
            break;
         case DATA: {
            if (produced == outLength) return i;
            size_t take = inLength - i;
            if (take > outLength - produced) take = outLength - produced;
            if (take > _chunkLeft) take = static_cast<size_t>(_chunkLeft);
            std::memcpy(out + produced, in + i, take);
            produced += take;
            i += take;
            _chunkLeft -= take;
            if (_chunkLeft == 0) _phase = DATA_CR;
            break;
         }
         case DATA_CR:
            // The line end after chunk data; a bare LF is taken too.
            if (c == '\r') {
               _phase = DATA_LF;
            } else if (c == '\n') {
               _phase = SIZE_LINE;
            } else {
               throw Exception("Malformed chunk header.");
            }
            ++i;
            break;
         case DATA_LF:
            if (c != '\n') throw Exception("Malformed chunk header.");
            _phase = SIZE_LINE;
            ++i;
            break;
         case TRAILER:
            if (c == '\n') {
               if (_lineCharacters == 0) _phase = DONE;
               _lineCharacters = 0;
            } else if (c != '\r') {
               if (++_lineCharacters > kMaxTrailerLine) throw Exception("Malformed chunk header.");
            }
            ++i;
            break;
         case DONE:
            break;
      }
   }
   return i;
}

}  // namespace Pelmora::Http
