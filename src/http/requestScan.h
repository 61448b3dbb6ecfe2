#pragma once
// The two byte-level scanners of the request reader, apart from any stream so that they
// can be fed from memory: the end-of-header scan and the chunked body decoder. Both keep
// their state between calls, so input may arrive split anywhere. Not thread-safe.

#include <cstddef>
#include <cstdint>

namespace Pelmora::Http {

class HeaderScanner {
public:
   void Reset() {
      _lineHasContent = false;
      _contentSeen = false;
      _scanned = 0;
      _lineStart = 0;
      _contentStart = 0;
   }
   // Scans `length` new bytes. Returns the offset one past the LF that ends the header,
   // or -1 when the end is not among them. MalformedHeaderException "invalid value 0 "
   // for a NUL byte.
   int Scan(const char* data, int length);
   // Where the first line with content starts, counted over all bytes scanned since
   // Reset: the blank lines before it are not part of the header.
   int ContentStart() const { return _contentStart; }

private:
   bool _lineHasContent = false;
   bool _contentSeen = false;
   int _scanned = 0;
   int _lineStart = 0;
   int _contentStart = 0;
};

class ChunkedBodyDecoder {
public:
   // A size line (chunk extensions included) must end within this many characters.
   static constexpr int kMaxSizeLine = 512;
   // Trailer lines are skipped, but not without end.
   static constexpr int kMaxTrailerLine = 10240;

   void Reset();
   // Decodes from `in` into `out`. Returns the input bytes consumed (it stops at the end
   // of the body, so bytes of a following message stay with the caller); `produced` is
   // set to the body bytes written. Exception "Malformed chunk header." on a broken
   // frame.
   size_t Decode(const char* in, size_t inLength, char* out, size_t outLength, size_t& produced);
   bool IsDone() const { return _phase == DONE; }

private:
   enum Phase { SIZE_LINE, DATA, DATA_CR, DATA_LF, TRAILER, DONE };
   void EndSizeLine();

   Phase _phase = SIZE_LINE;
   int _lineCharacters = 0;
   char _sizeLine[kMaxSizeLine];
   uint64_t _chunkLeft = 0;
};

}  // namespace Pelmora::Http
