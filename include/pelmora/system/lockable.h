#pragma once
// A Mutex is the library's non-recursive lock: relocking it from the thread that holds it
// and unlocking it from another thread are panics, not deadlocks or silent errors.
// LockableObjectImpl is the base of objects that are themselves lockable; it owns one
// Mutex and forwards to it. Synchronized holds a lock for a scope. All thread-safe except
// a Synchronized guard, which belongs to the scope that made it.

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/object/threadAnnotations.h"

namespace Pelmora::System {

class PELMORA_EXPORT PELMORA_CAPABILITY("mutex") LockableObject : public virtual Object {
public:
   virtual void Lock() PELMORA_ACQUIRE() = 0;
   virtual void Unlock() PELMORA_RELEASE() = 0;
   // Whether the calling thread holds the lock; another thread holding it gives false.
   virtual bool IsLocked() const = 0;
};

class PELMORA_EXPORT Mutex : public virtual LockableObject {};

class PELMORA_EXPORT LockableObjectImpl : public virtual LockableObject, public ObjectImpl {
public:
   // With a new mutex from the system factory.
   LockableObjectImpl();
   // Shares `mutex` (an object locked together with another).
   explicit LockableObjectImpl(Mutex* mutex);

   void Lock() PELMORA_ACQUIRE() override;
   void Unlock() PELMORA_RELEASE() override;
   bool IsLocked() const override;

   Mutex* GetMutex() const { return _mutex.Get(); }

private:
   Ref<Mutex> _mutex;
};

// Locks `lockable` until the end of the scope.
class PELMORA_EXPORT PELMORA_SCOPED_CAPABILITY Synchronized {
public:
   explicit Synchronized(LockableObject* lockable) PELMORA_ACQUIRE(lockable) : _lockable(lockable) {
      _lockable->Lock();
   }
   ~Synchronized() PELMORA_RELEASE() { _lockable->Unlock(); }
   Synchronized(const Synchronized&) = delete;
   Synchronized& operator=(const Synchronized&) = delete;

private:
   LockableObject* _lockable;
};

}  // namespace Pelmora::System
