#pragma once
// Guards that hold several locks at once. They lock in ascending address order, the
// library's one rule for holding several locks, so two guards filled with the same locks
// in any order cannot deadlock each other. Unlock releases in reverse order and empties
// the guard; refill it before locking again. The guard does not own the locks (they must
// outlive it) and belongs to one thread; the destructor unlocks a guard still locked.

#include <vector>

#include "pelmora/object/export.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/rwLock.h"

namespace Pelmora::System {

class PELMORA_EXPORT MultiSynchronized {
public:
   MultiSynchronized() = default;
   ~MultiSynchronized();
   MultiSynchronized(const MultiSynchronized&) = delete;
   MultiSynchronized& operator=(const MultiSynchronized&) = delete;

   void AddLockable(LockableObject* lockable);
   void Lock();
   void Unlock();

private:
   std::vector<LockableObject*> _lockables;
   bool _isLocked = false;
};

class PELMORA_EXPORT MultiReadWriteSynchronized {
public:
   MultiReadWriteSynchronized() = default;
   ~MultiReadWriteSynchronized();
   MultiReadWriteSynchronized(const MultiReadWriteSynchronized&) = delete;
   MultiReadWriteSynchronized& operator=(const MultiReadWriteSynchronized&) = delete;

   void AddLockable(RWLockableObject* lockable);
   void ReadLock();
   void WriteLock();
   void Unlock();

private:
   std::vector<RWLockableObject*> _lockables;
   bool _isLocked = false;
};

}  // namespace Pelmora::System
