#pragma once
// NativeMutex is the operating-system mutex plus the identity of the thread holding it,
// used by value inside other objects. Not recursive; locking it twice from one thread
// and unlocking it from another thread are caught as broken invariants.
// NativeSynchronized locks one for the extent of a scope.

#include <pthread.h>
#include <time.h>

#include <atomic>

#include "pelmora/exception/panic.h"
#include "pelmora/object/threadAnnotations.h"

namespace Pelmora::System {

class PELMORA_CAPABILITY("mutex") NativeMutex {
public:
   NativeMutex() = default;
   NativeMutex(const NativeMutex&) = delete;
   NativeMutex& operator=(const NativeMutex&) = delete;
   ~NativeMutex() { pthread_mutex_destroy(&_mutex); }

   // The owner check comes first: relocking would otherwise hang in pthread_mutex_lock.
   void Lock() PELMORA_ACQUIRE() {
      PELMORA_VERIFY(!IsLocked());
      LockNotHeld();
   }
   // Lock for a caller that has checked already that it does not hold the mutex.
   void LockNotHeld() PELMORA_ACQUIRE() {
      int error = pthread_mutex_lock(&_mutex);
      PELMORA_VERIFY(0 == error);
      PELMORA_VERIFY(0 == _owner);
      _owner.store(pthread_self(), std::memory_order_relaxed);
   }
   void Unlock() PELMORA_RELEASE() {
      PELMORA_VERIFY(IsLocked());
      _owner.store(0, std::memory_order_relaxed);
      int error = pthread_mutex_unlock(&_mutex);
      PELMORA_VERIFY(0 == error);
   }
   // Whether the calling thread holds it.
   bool IsLocked() const { return _owner.load(std::memory_order_relaxed) == pthread_self(); }
   // Waits on `condition`, which releases the mutex meanwhile, until woken or (with a
   // deadline on the condition's clock) until then. The caller holds the mutex and holds
   // it again on return. Returns the system's result: 0, ETIMEDOUT or an error.
   int WaitOn(pthread_cond_t* condition, const timespec* deadline = nullptr) PELMORA_REQUIRES(this) {
      PELMORA_VERIFY(IsLocked());
      _owner.store(0, std::memory_order_relaxed);
      int result = deadline ? pthread_cond_timedwait(condition, &_mutex, deadline)
                            : pthread_cond_wait(condition, &_mutex);
      PELMORA_VERIFY(0 == _owner);
      _owner.store(pthread_self(), std::memory_order_relaxed);
      return result;
   }
   pthread_mutex_t* GetNativeHandle() { return &_mutex; }

private:
   pthread_mutex_t _mutex = PTHREAD_MUTEX_INITIALIZER;
   std::atomic<pthread_t> _owner{0};
};

class PELMORA_SCOPED_CAPABILITY NativeSynchronized {
public:
   explicit NativeSynchronized(NativeMutex& mutex) PELMORA_ACQUIRE(mutex) : _mutex(mutex) {
      _mutex.Lock();
   }
   ~NativeSynchronized() PELMORA_RELEASE() { _mutex.Unlock(); }
   NativeSynchronized(const NativeSynchronized&) = delete;
   NativeSynchronized& operator=(const NativeSynchronized&) = delete;

private:
   NativeMutex& _mutex;
};

}  // namespace Pelmora::System
