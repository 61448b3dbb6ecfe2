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

}  // namespace Pelmora::System
