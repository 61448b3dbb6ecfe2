#pragma once
// The implementations behind the system factory, one creation function each.

#include "pelmora/system/condition.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/rwLock.h"
#include "pelmora/system/thread.h"

namespace Pelmora::System {

void CreateMutexImpl(Ref<Mutex>& out);
void CreateConditionPosix(Ref<Condition>& out);
void CreateThreadControlPosix(Ref<ThreadControl>& out);
// `mode` as RWLockableObject::LockMode.
void CreateRWLockImpl(int mode, Ref<RWLock>& out);
// How many threads wait to write-lock or upgrade `lock`, one of the factory's; what a
// test waits on instead of guessing how long a thread takes to block.
int CountWaitingWriters(RWLock* lock);

}  // namespace Pelmora::System
