// The thread-state board: fixed cells written by their thread, copied lock-free by others.

#include "src/system/threadState.h"

#include <time.h>

#include <algorithm>
#include <limits>
#include <utility>
#include <vector>

#include "pelmora/exception/panic.h"
#include "src/system/threadPosix.h"

namespace Pelmora::System {

const char THREAD_STATE_READFAILED_TOKEN[] = "Failed to read thread state";

namespace {

LazyTlsKey g_stateKey;

}  // namespace

ThreadStateImpl::~ThreadStateImpl() {
   ThreadStateRegistry::GetInstance().Remove(_threadId, this);
}

uint32_t ThreadStateImpl::BeginChange() {
   uint32_t change = _beginChange.load(std::memory_order_relaxed) + 1;
   _beginChange.store(change, std::memory_order_relaxed);
   return change;
}

unsigned ThreadStateImpl::Add(const char* text) {
   uint32_t change = BeginChange();
   unsigned index = THREAD_STATE_MAXIMUM_MESSAGES;
   if (!_freePointers.empty()) {
      index = _freePointers.begin();
      _freePointers.erase(index);
      Cell& cell = _memory[index];
      unsigned length = 0;
      if (text) {
         for (; length < kTextSize - 1 && text[length] != '\0'; ++length) {
            cell.text[length].store(text[length], std::memory_order_release);
         }
      }
      cell.text[length].store('\0', std::memory_order_release);
      cell.order.store(++_orderCounter, std::memory_order_release);
   } else {
      PELMORA_VERIFY(_overflow != std::numeric_limits<unsigned int>::max());
      ++_overflow;
   }
   EndChange(change);
   return index;
}

void ThreadStateImpl::Remove(unsigned index) {
   PELMORA_VERIFY(index <= THREAD_STATE_MAXIMUM_MESSAGES);
   PELMORA_VERIFY(index == THREAD_STATE_MAXIMUM_MESSAGES || _memory[index].order != 0);
   PELMORA_VERIFY(index == THREAD_STATE_MAXIMUM_MESSAGES ||
                  _freePointers.find(index) == _freePointers.end());
   uint32_t change = BeginChange();
   if (index == THREAD_STATE_MAXIMUM_MESSAGES) {
      PELMORA_VERIFY(_overflow);
      --_overflow;
   } else {
      _freePointers.insert(index);
      _memory[index].order.store(0, std::memory_order_release);
      if (_freePointers.size() == THREAD_STATE_MAXIMUM_MESSAGES) _orderCounter = 0;
   }
   EndChange(change);
}

bool ThreadStateImpl::CopyState(std::list<std::string>& messages, int attempts) const {
   struct Copy {
      uint32_t order;
      char text[kTextSize];
   };
   Copy copies[THREAD_STATE_MAXIMUM_MESSAGES];
   for (int attempt = 0; attempt < attempts; ++attempt) {
      if (attempt > 0) {
         timespec pause = {0, 1000};
         nanosleep(&pause, nullptr);
      }
      uint32_t end = _endChange.load(std::memory_order_acquire);
      for (unsigned i = 0; i < THREAD_STATE_MAXIMUM_MESSAGES; ++i) {
         copies[i].order = _memory[i].order.load(std::memory_order_acquire);
         if (copies[i].order == 0) continue;
         // A torn copy may lack its terminator; it is thrown away below anyway.
         unsigned n = 0;
         for (; n < kTextSize - 1; ++n) {
            char c = _memory[i].text[n].load(std::memory_order_acquire);
            if (c == '\0') break;
            copies[i].text[n] = c;
         }
         copies[i].text[n] = '\0';
      }
      // Cells are stored with release and loaded with acquire: a load that saw any part
      // of a change also sees the begin counter raised for it.
      if (_beginChange.load(std::memory_order_relaxed) != end) continue;

      std::vector<const Copy*> used;
      for (const Copy& copy : copies) {
         if (copy.order != 0) used.push_back(&copy);
      }
      std::sort(used.begin(), used.end(),
                [](const Copy* a, const Copy* b) { return a->order < b->order; });
      messages.clear();
      for (const Copy* copy : used) messages.emplace_back(copy->text);
      return true;
   }
   return false;
}

ThreadStateRegistry& ThreadStateRegistry::GetInstance() {
   static ThreadStateRegistry* const registry = new ThreadStateRegistry();
   return *registry;
}

void ThreadStateRegistry::Add(long long threadId, ThreadState* state) {
   NativeSynchronized lock(_mutex);
   _states[threadId] = state;
}

void ThreadStateRegistry::Remove(long long threadId, const ThreadState* state) {
   NativeSynchronized lock(_mutex);
   auto it = _states.find(threadId);
   if (it != _states.end() && state->HasLink(it->second.GetLink().Get())) _states.erase(it);
}

void ThreadStateRegistry::CopyThreadStates(std::map<long long, std::list<std::string>>& result,
                                           int attempts) {
   std::map<long long, WeakRef<ThreadState>> states;
   {
      NativeSynchronized lock(_mutex);
      states = _states;
   }
   for (const auto& [threadId, weak] : states) {
      Ref<ThreadState> state = weak.Promote();
      if (!state) continue;
      std::list<std::string> messages;
      std::list<std::string>& target = result[threadId];
      if (state->CopyState(messages, attempts)) {
         target.splice(target.end(), messages);
      } else {
         target.assign(1, THREAD_STATE_READFAILED_TOKEN);
      }
   }
}

ThreadState* GetThreadState() {
   TlsObjects& tls = GetThisThreadPosix()->GetTlsObjects();
   TlsKey key = g_stateKey.Get();
   if (Object* object = tls.Get(key)) return dynamic_cast<ThreadState*>(object);
   long long threadId = GetThreadId();
   Ref<ThreadStateImpl> state = new ThreadStateImpl(threadId);
   ThreadStateRegistry::GetInstance().Add(threadId, state.Get());
   tls.Set(key, state.Get());
   return state.Get();
}

unsigned AddThreadState(const char* text) {
   return GetThreadState()->Add(text);
}

void RemoveThreadState(unsigned index) {
   GetThreadState()->Remove(index);
}

void CopyThreadStates(std::map<long long, std::list<std::string>>& result, int attempts) {
   ThreadStateRegistry::GetInstance().CopyThreadStates(result, attempts);
}

}  // namespace Pelmora::System
