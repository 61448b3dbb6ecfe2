#pragma once
// The library's mutex: an operating-system mutex that knows its owner, so that the
// mistakes which would otherwise deadlock or corrupt state end in a panic instead.
// Declared here so that the locks built on it call it directly.

#include "pelmora/exception/panic.h"
#include "pelmora/system/lockable.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora::System {

class MutexImpl final : public virtual Mutex, public ObjectImpl {
public:
   void Lock() PELMORA_ACQUIRE() override {
      PELMORA_VERIFY(!_mutex.IsLocked());
      _mutex.LockNotHeld();
   }
   void Unlock() PELMORA_RELEASE() override {
      PELMORA_VERIFY(_mutex.IsLocked());
      _mutex.Unlock();
   }
   bool IsLocked() const override { return _mutex.IsLocked(); }

private:
   NativeMutex _mutex;
};

}  // namespace Pelmora::System
