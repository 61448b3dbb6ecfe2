#pragma once
// A Condition wakes threads waiting for a state change guarded by a caller's Mutex.
// Spurious and stolen wake-ups are filtered; a Signal with no waiter is forgotten.
// Time-outs run on the monotonic clock. WaitableObjectImpl is the base of objects that
// callers lock and wait on: its own Mutex (or a shared one) bound to a Condition. Thread-safe.

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/system/lockable.h"

namespace Pelmora::System {

class PELMORA_EXPORT Condition : public virtual Object {
public:
   // Waits until signalled. The caller holds `mutex`; it is held again on return,
   // also when an exception leaves.
   virtual void Wait(Mutex* mutex) = 0;
   // As Wait, for at most `microseconds` (negative: no limit); false on time-out.
   virtual bool TimedWait(Mutex* mutex, long long microseconds) = 0;
   // Wakes one current waiter; nothing when none waits.
   virtual void Signal() = 0;
   // Wakes every current waiter.
   virtual void Broadcast() = 0;
};

class PELMORA_EXPORT WaitableObject : public virtual Object {
public:
   // The caller holds the object's lock around Wait and TimedWait.
   virtual void Wait() = 0;
   virtual bool TimedWait(long long microseconds) = 0;
   virtual void Signal() = 0;
   virtual void Broadcast() = 0;
};

class PELMORA_EXPORT WaitableObjectImpl : public virtual WaitableObject, public LockableObjectImpl {
public:
   // A new mutex and condition from the system factory.
   WaitableObjectImpl();
   // Waits under `mutex`, shared with other objects.
   explicit WaitableObjectImpl(Mutex* mutex);

   void Wait() override;
   bool TimedWait(long long microseconds) override;
   void Signal() override;
   void Broadcast() override;

private:
   Ref<Condition> _condition;
};

}  // namespace Pelmora::System
