// Fuzzes the request-header path: the end-of-header scan over input fed in pieces (the
// first byte picks the piece size), then the header text through RequestHeader and, with
// the same bytes, ClientResponseHeader. Only the documented exceptions may leave.

#include <cstdint>
#include <cstdlib>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/header.h"
#include "src/http/requestScan.h"

using namespace Pelmora;
using namespace Pelmora::Http;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   if (size < 1) return 0;
   const size_t piece = data[0] % 32 + 1;
   const char* text = reinterpret_cast<const char*>(data + 1);
   const size_t length = size - 1 < 10240 ? size - 1 : 10240;
   HeaderScanner scanner;
   int end = -1;
   try {
      for (size_t at = 0; at < length && end < 0; at += piece) {
         size_t n = piece < length - at ? piece : length - at;
         int found = scanner.Scan(text + at, static_cast<int>(n));
         if (found >= 0) {
            if (found == 0 || static_cast<size_t>(found) > n) abort();
            end = static_cast<int>(at) + found;
         }
      }
   } catch (const MalformedHeaderException&) {
      return 0;
   }
   std::string header(text, end >= 0 ? static_cast<size_t>(end) : length);
   if (end >= 0 && header.back() != '\n') abort();
   try {
      RequestHeader request;
      request.FromString(header);
      if (request.GetMethod() == RequestHeader::UNKNOWN) abort();
      if (request.GetContentLength() < -1) abort();
      RefList<Cookie> cookies;
      request.GetCookieList(cookies);
      for (const Ref<Cookie>& cookie : cookies) {
         if (cookie->GetName().empty()) abort();
      }
   } catch (const NotSupportedException&) {
   } catch (const MalformedHeaderException&) {
   } catch (const NumberFormatException&) {
   }
   try {
      ClientResponseHeader response;
      response.FromString(header);
   } catch (const MalformedHeaderException&) {
   } catch (const NumberFormatException&) {
   }
   return 0;
}
