#pragma once
// Capturing the calling thread's backtrace with the C library's unwinder.

#include "pelmora/system/backtrace.h"

namespace Pelmora::System {

constexpr int kMaxBacktraceFrames = 64;

// Leaves out this function, its caller's `skipFrames` innermost frames excluded too.
void CaptureBacktrace(int skipFrames, Ref<Backtrace>& out);

}  // namespace Pelmora::System
