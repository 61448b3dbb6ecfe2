#pragma once
// A Backtrace holds the raw return addresses of a thread's stack, captured cheaply;
// symbol names are resolved (and demangled) only when its text is asked for.
// Immutable once captured; thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::System {

class PELMORA_EXPORT Backtrace : public virtual Object {
public:
   virtual int GetFrameCount() const = 0;
   virtual void* GetFrame(int index) const = 0;
   // One line per frame, "#<n> <address> <symbol>+<offset> (<module>)", starting at
   // `firstFrame` and holding at most `maxFrames` lines (negative: all).
   virtual std::string GetText(int firstFrame = 0, int maxFrames = -1) const = 0;
};

// The most frames a backtrace keeps.
constexpr int kMaxBacktraceFrames = 64;

// Captures the calling thread's stack with the C library's unwinder, leaving out this
// function and the `skipFrames` innermost frames of its caller.
PELMORA_EXPORT void CaptureBacktrace(int skipFrames, Ref<Backtrace>& out);

}  // namespace Pelmora::System
