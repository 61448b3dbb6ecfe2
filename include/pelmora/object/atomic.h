#pragma once
// Atomic<T> is the counter every reference count and statistic of the library uses:
// read-modify-write steps that return the value before the step, each followed by a
// full fence when the process-wide AtomicUseFence flag is set. Thread-safe.

#include <atomic>

#include "pelmora/object/export.h"

namespace Pelmora {

// Zero by default. When set, every atomic update of a count is followed by a full
// memory fence; the ordering of the atomic operations alone is already sufficient.
extern PELMORA_EXPORT std::atomic<unsigned char> AtomicUseFence;

inline void AtomicFenceIfRequested() {
   if (AtomicUseFence.load(std::memory_order_relaxed) != 0) {
#if defined(__SANITIZE_THREAD__)
      // ThreadSanitizer does not model standalone fences; a sequentially consistent
      // read-modify-write is a full fence it understands.
      static std::atomic<int> fence{0};
      fence.fetch_add(0, std::memory_order_seq_cst);
#else
      std::atomic_thread_fence(std::memory_order_seq_cst);
#endif
   }
}

template <class T>
class Atomic {
public:
   constexpr Atomic(T initial = T()) noexcept : _value(initial) {}
   Atomic(const Atomic&) = delete;
   Atomic& operator=(const Atomic&) = delete;

   T Read() const { return _value.load(std::memory_order_acquire); }
   void Write(T value) {
      _value.store(value, std::memory_order_release);
      AtomicFenceIfRequested();
   }
   // Each returns the value held before the update.
   T ReadInc() { return ReadAdd(T(1)); }
   T ReadDec() { return ReadAdd(T(-1)); }
   T ReadAdd(T delta) {
      T old = _value.fetch_add(delta, std::memory_order_acq_rel);
      AtomicFenceIfRequested();
      return old;
   }
   // Stores `desired` if the value is `expected`; otherwise loads the value into `expected`.
   bool CompareAndSwap(T& expected, T desired) {
      bool swapped = _value.compare_exchange_strong(expected, desired, std::memory_order_acq_rel);
      AtomicFenceIfRequested();
      return swapped;
   }

private:
   std::atomic<T> _value;
};

}  // namespace Pelmora
