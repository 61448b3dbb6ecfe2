// Conditions over a POSIX condition variable with an internal mutex of their own. The
// counts of waiters and granted wake-ups decide who may return, so spurious wake-ups
// and wake-ups taken by a later waiter are waited out, and a Signal with nobody waiting
// leaves nothing behind.

#include <errno.h>
#include <pthread.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <climits>
#include <cstdint>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "src/internal/nativeMutex.h"
#include "src/system/systemImpl.h"

namespace Pelmora::System {

namespace {

constexpr long long kMicrosPerSecond = 1000000;

long long MonotonicMicros() {
   timespec now;
   clock_gettime(CLOCK_MONOTONIC, &now);
   return now.tv_sec * kMicrosPerSecond + now.tv_nsec / 1000;
}

// The real-time instant `micros` from now: the clock of a condition variable with
// default attributes.
timespec RealtimeAfter(long long micros) {
   timespec at;
   clock_gettime(CLOCK_REALTIME, &at);
   at.tv_sec += micros / kMicrosPerSecond;
   at.tv_nsec += (micros % kMicrosPerSecond) * 1000;
   if (at.tv_nsec >= 1000000000) {
      at.tv_sec += 1;
      at.tv_nsec -= 1000000000;
   }
   return at;
}

class ConditionPosix : public virtual Condition, public ObjectImpl {
public:
   ConditionPosix() {
      int error = pthread_cond_init(&_condition, nullptr);
      if (error != 0) throw SystemException(error);
   }
   ~ConditionPosix() override { pthread_cond_destroy(&_condition); }

   void Wait(Mutex* mutex) override { WaitFor(mutex, -1); }
   bool TimedWait(Mutex* mutex, long long microseconds) override {
      return WaitFor(mutex, microseconds);
   }

   // With nobody waiting there is nothing to grant, so the internal mutex is not needed:
   // a waiter registers before it releases the caller's mutex, so a signaller that changed
   // the state under that mutex sees every waiter that could have missed the change.
   void Signal() override {
      if (_waitingThreads.load(std::memory_order_acquire) == 0) return;
      NativeSynchronized lock(_mutex);
      int64_t waiting = _waitingThreads.load(std::memory_order_relaxed);
      _expectedWakeups = std::min(_expectedWakeups + 1, waiting);
      if (waiting > 0) pthread_cond_signal(&_condition);
   }

   void Broadcast() override {
      if (_waitingThreads.load(std::memory_order_acquire) == 0) return;
      NativeSynchronized lock(_mutex);
      int64_t waiting = _waitingThreads.load(std::memory_order_relaxed);
      _expectedWakeups = waiting;
      if (waiting > 0) pthread_cond_broadcast(&_condition);
   }

private:
   // Holds the waiter's place from entering the wait until every way out: the caller's
   // mutex is released only while the internal one is held, so no Signal can slip in
   // between, and taken back only after the internal one is released, so the two are
   // never taken in the opposite order.
   class PELMORA_SCOPED_CAPABILITY WaitScope {
   public:
      WaitScope(ConditionPosix& condition, Mutex* mutex) PELMORA_ACQUIRE(condition._mutex)
          : _condition(condition), _mutex(mutex) {
         _condition.EnterWait();
         _mutex->Unlock();
      }
      ~WaitScope() PELMORA_RELEASE() {
         _condition.LeaveWait();
         _mutex->Lock();
      }
      WaitScope(const WaitScope&) = delete;
      WaitScope& operator=(const WaitScope&) = delete;

   private:
      ConditionPosix& _condition;
      Mutex* _mutex;
   };

   void EnterWait() PELMORA_ACQUIRE(_mutex) {
      _mutex.Lock();
      _waitingThreads.fetch_add(1, std::memory_order_release);
   }
   void LeaveWait() PELMORA_RELEASE(_mutex) {
      PELMORA_VERIFY(_waitingThreads > 0);
      PELMORA_VERIFY(_expectedWakeups < _waitingThreads);
      _waitingThreads.fetch_sub(1, std::memory_order_relaxed);
      _mutex.Unlock();
   }

   bool ConsumeWakeup() PELMORA_REQUIRES(_mutex) {
      if (_expectedWakeups <= 0) return false;
      --_expectedWakeups;
      return true;
   }

   bool WaitFor(Mutex* mutex, long long microseconds) {
      PELMORA_VERIFY(mutex->IsLocked());
      WaitScope scope(*this, mutex);
      if (microseconds < 0) {
         do {
            int error = _mutex.WaitOn(&_condition);
            if (error != 0) throw SystemException(error);
         } while (!ConsumeWakeup());
         return true;
      }
      // The deadline is kept on the monotonic clock and each pass waits for the rest of it
      // on the condition variable's real-time clock: a pass cut short by the wall clock
      // jumping forward is followed by another. A backward jump stretches the current pass.
      long long start = MonotonicMicros();
      long long deadline = microseconds > LLONG_MAX - start ? LLONG_MAX : start + microseconds;
      long long remaining = microseconds;
      for (;;) {
         timespec at = RealtimeAfter(remaining);
         int error = _mutex.WaitOn(&_condition, &at);
         if (error != 0 && error != ETIMEDOUT) throw SystemException(error);
         if (ConsumeWakeup()) return true;
         remaining = deadline - MonotonicMicros();
         if (remaining < 0) return false;
      }
   }

   NativeMutex _mutex;
   pthread_cond_t _condition;
   // 0 <= _expectedWakeups <= _waitingThreads, both changed under _mutex only.
   std::atomic<int64_t> _waitingThreads{0};
   int64_t _expectedWakeups PELMORA_GUARDED_BY(_mutex) = 0;
};

}  // namespace

void CreateConditionPosix(Ref<Condition>& out) {
   out = new ConditionPosix();
}

}  // namespace Pelmora::System
