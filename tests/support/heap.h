#pragma once
// The heap in use, for tests that check memory is given back. The sanitizers' allocators
// do not report through mallinfo2: such tests skip under them (kHeapIsMeasured).

#include <malloc.h>

#include <cstddef>

namespace Pelmora::TestSupport {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kHeapIsMeasured = false;
#else
constexpr bool kHeapIsMeasured = true;
#endif

inline size_t HeapInUse() {
   struct mallinfo2 info = mallinfo2();
   return info.uordblks + info.hblkhd;
}

}  // namespace Pelmora::TestSupport
