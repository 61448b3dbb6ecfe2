#pragma once
// The thread-state board and its process-wide registry. The owner thread changes the
// board between a raise of the begin counter and a matching store of the end counter;
// a reader copies the end counter, the cells, then the begin counter, and keeps the copy
// only when the two agree, so the writer never waits for a reader.

#include <atomic>
#include <bit>
#include <cstdint>
#include <map>

#include "pelmora/system/threadState.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora::System {

// The free cells, ordered by index, as a bit set: Add and Remove never allocate.
class FreeCellSet {
public:
   static constexpr unsigned kEnd = THREAD_STATE_MAXIMUM_MESSAGES;

   bool empty() const { return _bits == 0; }
   unsigned size() const { return static_cast<unsigned>(std::popcount(_bits)); }
   // The lowest free index, end() when none.
   unsigned begin() const {
      return empty() ? kEnd : static_cast<unsigned>(std::countr_zero(_bits));
   }
   unsigned end() const { return kEnd; }
   unsigned find(unsigned index) const {
      return index < kEnd && (_bits >> index) & 1u ? index : kEnd;
   }
   void insert(unsigned index) { _bits |= 1u << index; }
   void erase(unsigned index) { _bits &= ~(1u << index); }

private:
   uint32_t _bits = (1u << THREAD_STATE_MAXIMUM_MESSAGES) - 1;
};

class ThreadStateImpl : public WeakLinkableImpl<>, public ThreadState {
public:
   static constexpr unsigned kTextSize = 256;

   explicit ThreadStateImpl(long long threadId) : _threadId(threadId) {}
   ~ThreadStateImpl() override;

   unsigned Add(const char* text) override;
   void Remove(unsigned index) override;
   bool CopyState(std::list<std::string>& messages, int attempts) const override;

   unsigned GetOverflow() const { return _overflow; }

private:
   struct Cell {
      std::atomic<uint32_t> order{0};  // 0: free; otherwise rises with every Add
      std::atomic<char> text[kTextSize];
   };

   uint32_t BeginChange();
   void EndChange(uint32_t change) { _endChange.store(change, std::memory_order_release); }

   Cell _memory[THREAD_STATE_MAXIMUM_MESSAGES];
   unsigned int _overflow = 0;
   uint32_t _orderCounter = 0;
   FreeCellSet _freePointers;
   std::atomic<uint32_t> _beginChange{0};
   std::atomic<uint32_t> _endChange{0};
   const long long _threadId;
};

class ThreadStateRegistry {
public:
   // The process's registry, never destroyed: boards die with threads until exit.
   static ThreadStateRegistry& GetInstance();

   void Add(long long threadId, ThreadState* state);
   // Forgets `state` unless the id already belongs to a newer board.
   void Remove(long long threadId, const ThreadState* state);
   void CopyThreadStates(std::map<long long, std::list<std::string>>& result, int attempts);

private:
   NativeMutex _mutex;
   std::map<long long, WeakRef<ThreadState>> _states PELMORA_GUARDED_BY(_mutex);
};

}  // namespace Pelmora::System
