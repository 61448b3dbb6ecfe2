// Fuzzes the Range and If-None-Match fields of file requests: no input is fatal, a
// served range always lies inside the file, and a list naming "*" matches every tag.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "src/http/conditional.h"

using namespace Pelmora::Http;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   if (size < 8) return 0;
   // The first eight bytes pick the file size, the rest is the field.
   long long fileSize;
   std::memcpy(&fileSize, data, sizeof fileSize);
   fileSize &= (1LL << 50) - 1;
   std::string field(reinterpret_cast<const char*>(data) + 8, size - 8);

   ByteRange range = ParseRange(field, fileSize);
   if (range.kind == ByteRange::PART &&
       (range.first < 0 || range.first > range.last || range.last >= fileSize)) {
      abort();
   }
   if (range.kind == ByteRange::PART && fileSize == 0) abort();

   // Whatever the list holds, "*" appended to it matches.
   if (!TagListMatches(field + ",*", "\"1-2-3.4\"")) abort();
   return 0;
}
