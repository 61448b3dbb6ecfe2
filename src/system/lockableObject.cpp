// The bases of objects that are themselves lockable, reader/writer lockable or waitable:
// each forwards to the lock or condition it holds.

#include "pelmora/system/condition.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/rwLock.h"
#include "pelmora/system/systemFactory.h"

namespace Pelmora::System {

LockableObjectImpl::LockableObjectImpl() {
   GetSystemFactory()->CreateMutex(_mutex);
}

LockableObjectImpl::LockableObjectImpl(Mutex* mutex) : _mutex(mutex) {}

void LockableObjectImpl::Lock() {
   _mutex->Lock();
}
void LockableObjectImpl::Unlock() {
   _mutex->Unlock();
}
bool LockableObjectImpl::IsLocked() const {
   return _mutex->IsLocked();
}

WaitableObjectImpl::WaitableObjectImpl() {
   GetSystemFactory()->CreateCondition(_condition);
}

WaitableObjectImpl::WaitableObjectImpl(Mutex* mutex) : LockableObjectImpl(mutex) {
   GetSystemFactory()->CreateCondition(_condition);
}

void WaitableObjectImpl::Wait() {
   _condition->Wait(GetMutex());
}
bool WaitableObjectImpl::TimedWait(long long microseconds) {
   return _condition->TimedWait(GetMutex(), microseconds);
}
void WaitableObjectImpl::Signal() {
   _condition->Signal();
}
void WaitableObjectImpl::Broadcast() {
   _condition->Broadcast();
}

RWLockableObjectImpl::RWLockableObjectImpl(int mode) {
   GetSystemFactory()->CreateRWLock(mode, _lock);
}

RWLockableObjectImpl::RWLockableObjectImpl(RWLock* lock) : _lock(lock) {}

void RWLockableObjectImpl::ReadLock() {
   _lock->ReadLock();
}
void RWLockableObjectImpl::WriteLock() {
   _lock->WriteLock();
}
void RWLockableObjectImpl::Unlock() {
   _lock->Unlock();
}
bool RWLockableObjectImpl::UpgradeReadLock() {
   return _lock->UpgradeReadLock();
}
void RWLockableObjectImpl::DowngradeWriteLock() {
   _lock->DowngradeWriteLock();
}
bool RWLockableObjectImpl::IsReadLocked() const {
   return _lock->IsReadLocked();
}
bool RWLockableObjectImpl::IsWriteLocked() const {
   return _lock->IsWriteLocked();
}
bool RWLockableObjectImpl::IsUnlocked() const {
   return _lock->IsUnlocked();
}

}  // namespace Pelmora::System
