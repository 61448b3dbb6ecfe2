#pragma once
// The system factory creates the operating-system backed objects of the library.
// One process-wide instance, alive until exit; thread-safe.

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/exception/backtrace.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/rwLock.h"
#include "pelmora/system/thread.h"

namespace Pelmora::System {

class PELMORA_EXPORT SystemFactory {
public:
   // Captures the calling thread's stack, leaving out the `skipFrames` innermost frames
   // above the caller of CreateBacktrace.
   virtual void CreateBacktrace(int skipFrames, Ref<Backtrace>& out) = 0;
   virtual void CreateMutex(Ref<Mutex>& out) = 0;
   virtual void CreateCondition(Ref<Condition>& out) = 0;
   // `mode` as RWLockableObject::LockMode.
   virtual void CreateRWLock(int mode, Ref<RWLock>& out) = 0;
   virtual void CreateThreadControl(Ref<ThreadControl>& out) = 0;

protected:
   ~SystemFactory() = default;
};

PELMORA_EXPORT SystemFactory* GetSystemFactory();

}  // namespace Pelmora::System
