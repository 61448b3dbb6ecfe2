#pragma once
// The system factory creates the operating-system backed objects of the library.
// One process-wide instance, alive until exit; thread-safe.

#include "pelmora/object/ref.h"
#include "pelmora/system/backtrace.h"

namespace Pelmora::System {

class SystemFactory {
public:
   // Captures the calling thread's stack, leaving out the `skipFrames` innermost frames
   // above the caller of CreateBacktrace.
   virtual void CreateBacktrace(int skipFrames, Ref<Backtrace>& out) = 0;

protected:
   ~SystemFactory() = default;
};

SystemFactory* GetSystemFactory();

}  // namespace Pelmora::System
