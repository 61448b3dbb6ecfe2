#pragma once
// CopyShort copies a piece of a length known only at run time with at most two
// overlapping moves per size class, inline. The pieces of a log line are mostly under
// 32 bytes, where a call to the C library's memcpy costs more than the copy itself.

#include <cstddef>
#include <cstring>

namespace Pelmora::Internal {

inline void CopyShort(char* to, const char* from, size_t length) {
   if (length >= 16) {
      if (length > 32) {
         std::memcpy(to, from, length);
         return;
      }
      std::memcpy(to, from, 16);
      std::memcpy(to + length - 16, from + length - 16, 16);
   } else if (length >= 8) {
      std::memcpy(to, from, 8);
      std::memcpy(to + length - 8, from + length - 8, 8);
   } else if (length >= 4) {
      std::memcpy(to, from, 4);
      std::memcpy(to + length - 4, from + length - 4, 4);
   } else if (length > 0) {
      to[0] = from[0];
      to[length / 2] = from[length / 2];
      to[length - 1] = from[length - 1];
   }
}

}  // namespace Pelmora::Internal
