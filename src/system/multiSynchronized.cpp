// Guards over several locks, taken in ascending address order.

#include "pelmora/system/multiSynchronized.h"

#include <algorithm>
#include <functional>

#include "pelmora/exception/panic.h"

namespace Pelmora::System {

namespace {

template <class T>
void SortByAddress(std::vector<T*>& lockables) {
   std::sort(lockables.begin(), lockables.end(), std::less<T*>());
}

}  // namespace

MultiSynchronized::~MultiSynchronized() {
   if (_isLocked) Unlock();
}

void MultiSynchronized::AddLockable(LockableObject* lockable) {
   PELMORA_VERIFY(!_isLocked);
   _lockables.push_back(lockable);
}

// A set of locks known only at run time is beyond the static analysis.
void MultiSynchronized::Lock() PELMORA_NO_THREAD_SAFETY_ANALYSIS {
   PELMORA_VERIFY(!_isLocked);
   SortByAddress(_lockables);
   for (LockableObject* lockable : _lockables) lockable->Lock();
   _isLocked = true;
}

void MultiSynchronized::Unlock() PELMORA_NO_THREAD_SAFETY_ANALYSIS {
   PELMORA_VERIFY(_isLocked);
   for (auto it = _lockables.rbegin(); it != _lockables.rend(); ++it) (*it)->Unlock();
   _lockables.clear();
   _isLocked = false;
}

MultiReadWriteSynchronized::~MultiReadWriteSynchronized() {
   if (_isLocked) Unlock();
}

void MultiReadWriteSynchronized::AddLockable(RWLockableObject* lockable) {
   PELMORA_VERIFY(!_isLocked);
   _lockables.push_back(lockable);
}

void MultiReadWriteSynchronized::ReadLock() PELMORA_NO_THREAD_SAFETY_ANALYSIS {
   PELMORA_VERIFY(!_isLocked);
   SortByAddress(_lockables);
   for (RWLockableObject* lockable : _lockables) lockable->ReadLock();
   _isLocked = true;
}

void MultiReadWriteSynchronized::WriteLock() PELMORA_NO_THREAD_SAFETY_ANALYSIS {
   PELMORA_VERIFY(!_isLocked);
   SortByAddress(_lockables);
   for (RWLockableObject* lockable : _lockables) lockable->WriteLock();
   _isLocked = true;
}

void MultiReadWriteSynchronized::Unlock() PELMORA_NO_THREAD_SAFETY_ANALYSIS {
   PELMORA_VERIFY(_isLocked);
   for (auto it = _lockables.rbegin(); it != _lockables.rend(); ++it) (*it)->Unlock();
   _lockables.clear();
   _isLocked = false;
}

}  // namespace Pelmora::System
