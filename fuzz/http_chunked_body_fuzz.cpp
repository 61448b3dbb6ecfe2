// Fuzzes the chunked request-body decoder with input and output in pieces (the first two
// bytes pick their sizes): consumption and output stay within bounds, the body is the
// same whatever the pieces, and only "Malformed chunk header." may leave.

#include <cstdint>
#include <cstdlib>
#include <string>

#include "pelmora/exception/throwable.h"
#include "src/http/requestScan.h"

using namespace Pelmora;
using namespace Pelmora::Http;

namespace {

// The body decoded, or a marker for a refused frame; `consumed` counts input taken.
std::string DecodeAll(const char* in, size_t length, size_t piece, size_t outPiece, size_t& consumed) {
   ChunkedBodyDecoder decoder;
   std::string body;
   char out[256];
   consumed = 0;
   try {
      while (consumed < length && !decoder.IsDone()) {
         size_t n = piece < length - consumed ? piece : length - consumed;
         size_t produced = 0;
         size_t used = decoder.Decode(in + consumed, n, out, outPiece, produced);
         if (used > n || produced > outPiece) abort();
         if (used == 0 && produced == 0) abort();  // no progress with room on both sides
         body.append(out, produced);
         consumed += used;
      }
   } catch (const Exception& e) {
      if (e.GetMessage() != "Malformed chunk header.") abort();
      return "<refused>";
   }
   if (!decoder.IsDone()) body += "<open>";
   return body;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   if (size < 2) return 0;
   size_t piece = data[0] % 64 + 1;
   size_t outPiece = data[1] % 255 + 1;
   const char* in = reinterpret_cast<const char*>(data + 2);
   size_t length = size - 2;
   size_t consumedA = 0, consumedB = 0;
   std::string a = DecodeAll(in, length, piece, outPiece, consumedA);
   std::string b = DecodeAll(in, length, length ? length : 1, 256, consumedB);
   if (a != b) abort();
   if (a != "<refused>" && consumedA != consumedB) abort();
   return 0;
}
