// Reader/writer locks built from a mutex and two conditions, with each thread's holds
// kept in a map in its TLS. The map is what lets a reader re-enter without waiting
// behind a writer, catches recursive write locking, and answers Is...Locked without
// taking the lock.

#include <cstdint>
#include <utility>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/systemFactory.h"
#include "src/system/mutexImpl.h"
#include "src/system/systemImpl.h"
#include "src/system/threadPosix.h"

namespace Pelmora::System {

namespace {

class RWLockImpl;

// A thread's holds: lock -> read holds, or -1 for the write lock. A hash map with open
// addressing and linear probing; erasing shifts later entries back, so there are no
// tombstones and, once grown, locking never allocates.
class ThreadLocks {
public:
   using value_type = std::pair<const RWLockImpl*, int>;
   using iterator = value_type*;

   ThreadLocks() : _slots(kInitialCapacity) {}

   iterator end() const { return nullptr; }
   iterator find(const RWLockImpl* lock) const {
      if (_size == 0) return end();
      for (size_t i = Home(lock);; i = Next(i)) {
         if (_slots[i].first == lock) return const_cast<iterator>(&_slots[i]);
         if (_slots[i].first == nullptr) return end();
      }
   }
   // `lock` must not be present.
   iterator emplace(const RWLockImpl* lock, int count) {
      if ((_size + 1) * 2 > _slots.size()) Grow();
      size_t i = Home(lock);
      while (_slots[i].first != nullptr) i = Next(i);
      _slots[i] = {lock, count};
      ++_size;
      return &_slots[i];
   }
   void erase(iterator it) {
      size_t hole = static_cast<size_t>(it - _slots.data());
      for (size_t j = Next(hole); _slots[j].first != nullptr; j = Next(j)) {
         // An entry moves into the hole unless its home lies cyclically in (hole, j].
         size_t home = Home(_slots[j].first);
         bool stays = hole < j ? (hole < home && home <= j) : (hole < home || home <= j);
         if (stays) continue;
         _slots[hole] = _slots[j];
         hole = j;
      }
      _slots[hole] = {nullptr, 0};
      --_size;
   }
   size_t size() const { return _size; }

private:
   static constexpr size_t kInitialCapacity = 8;

   size_t Home(const RWLockImpl* lock) const {
      uint64_t bits = reinterpret_cast<uintptr_t>(lock) * 0x9E3779B97F4A7C15ull;
      return static_cast<size_t>(bits >> 32) & (_slots.size() - 1);
   }
   size_t Next(size_t i) const { return (i + 1) & (_slots.size() - 1); }

   void Grow() {
      std::vector<value_type> old(_slots.size() * 2);
      old.swap(_slots);
      _size = 0;
      for (const value_type& entry : old) {
         if (entry.first != nullptr) emplace(entry.first, entry.second);
      }
   }

   std::vector<value_type> _slots;  // capacity a power of two, at most half full
   size_t _size = 0;
};

class ThreadLocksHolder;

// The calling thread's holder, cached beside its TLS slot for the hot path (initial-exec:
// one load instead of a call; eight bytes of static TLS). Cleared when the slot releases it.
[[gnu::tls_model("initial-exec")]] thread_local ThreadLocksHolder* t_locksHolder = nullptr;

class ThreadLocksHolder : public ObjectImpl {
public:
   ~ThreadLocksHolder() override {
      if (t_locksHolder == this) t_locksHolder = nullptr;
   }
   ThreadLocks locks;
};

LazyTlsKey g_locksKey;

class MutexLock {
public:
   explicit MutexLock(MutexImpl& mutex) : _mutex(mutex) { _mutex.Lock(); }
   ~MutexLock() { _mutex.Unlock(); }
   MutexLock(const MutexLock&) = delete;
   MutexLock& operator=(const MutexLock&) = delete;

private:
   MutexImpl& _mutex;
};

ThreadLocks& FindThreadLocks() {
   TlsKey key = g_locksKey.Get();
   TlsObjects& tls = GetThisThreadPosix()->GetTlsObjects();
   ThreadLocksHolder* holder = dynamic_cast<ThreadLocksHolder*>(tls.Get(key));
   if (!holder) {
      holder = new ThreadLocksHolder();
      tls.Set(key, holder);
   }
   t_locksHolder = holder;
   return holder->locks;
}

ThreadLocks& ThisThreadLocks() {
   ThreadLocksHolder* holder = t_locksHolder;
   return holder ? holder->locks : FindThreadLocks();
}

class RWLockImpl : public virtual RWLock, public ObjectImpl {
public:
   explicit RWLockImpl(int mode) : _mode(mode == LOCK_MODE_WRITER_PRIORITY_LEGACY ? 1 : mode) {
      GetSystemFactory()->CreateCondition(_readCondition);
      GetSystemFactory()->CreateCondition(_writeCondition);
   }

   void ReadLock() override {
      ThreadLocks& locks = ThisThreadLocks();
      auto it = locks.find(this);
      if (it != locks.end()) {
         // Already a reader: never wait, or a waiting writer would deadlock with us.
         {
            MutexLock lock(*_mutex);
            PELMORA_VERIFY(_status > 0);
            ++_status;
         }
         ++it->second;
         return;
      }
      {
         MutexLock lock(*_mutex);
         while (_status < 0 || _writerWaiting) _readCondition->Wait(_mutex.Get());
         ++_status;
      }
      locks.emplace(this, 1);
   }

   void WriteLock() override {
      ThreadLocks& locks = ThisThreadLocks();
      {
         MutexLock lock(*_mutex);
         if (_status != 0) {
            PELMORA_VERIFY(locks.find(this) == locks.end());
            ++_waitingWriters;
            while (_status != 0) {
               if (_mode == LOCK_MODE_WRITER_PRIORITY) _writerWaiting = 1;
               _writeCondition->Wait(_mutex.Get());
            }
            --_waitingWriters;
         }
         // The writer-waiting flag stays set until this writer unlocks or downgrades.
         _status = -1;
      }
      locks.emplace(this, -1);
   }

   void Unlock() override {
      ThreadLocks& locks = ThisThreadLocks();
      auto it = locks.find(this);
      PELMORA_VERIFY(it != locks.end());
      {
         MutexLock lock(*_mutex);
         if (_status > 0) {
            --_status;
            if (_status == 0) {
               _writeCondition->Signal();
            } else if (_upgradePending && _status == 1) {
               // Writers wait on the same condition: wake them all so the upgrader is among them.
               _writeCondition->Broadcast();
            }
         } else {
            _status = 0;
            _writerWaiting = 0;
            _upgradePending = 0;
            _writeCondition->Signal();
            _readCondition->Broadcast();
         }
      }
      if (it->second < 2) {
         locks.erase(it);
      } else {
         --it->second;
      }
   }

   bool UpgradeReadLock() override {
      ThreadLocks& locks = ThisThreadLocks();
      auto it = locks.find(this);
      PELMORA_VERIFY(it != locks.end() && it->second == 1);
      {
         MutexLock lock(*_mutex);
         // Two upgraders would each wait for the other's read hold to go.
         if (_upgradePending) return false;
         _upgradePending = 1;
         ++_waitingWriters;
         while (_status != 1) {
            if (_mode == LOCK_MODE_WRITER_PRIORITY) _writerWaiting = 1;
            _writeCondition->Wait(_mutex.Get());
         }
         --_waitingWriters;
         _upgradePending = 0;
         _status = -1;
      }
      it->second = -1;
      return true;
   }

   void DowngradeWriteLock() override {
      ThreadLocks& locks = ThisThreadLocks();
      auto it = locks.find(this);
      PELMORA_VERIFY(it != locks.end() && it->second == -1);
      {
         MutexLock lock(*_mutex);
         _status = 1;
         _writerWaiting = 0;
         _readCondition->Broadcast();
         _writeCondition->Signal();
      }
      it->second = 1;
   }

   bool IsReadLocked() const override {
      const ThreadLocks& locks = ThisThreadLocks();
      auto it = locks.find(this);
      return it != locks.end() && it->second >= 1;
   }
   bool IsWriteLocked() const override {
      const ThreadLocks& locks = ThisThreadLocks();
      auto it = locks.find(this);
      return it != locks.end() && it->second == -1;
   }
   bool IsUnlocked() const override {
      const ThreadLocks& locks = ThisThreadLocks();
      return locks.find(this) == locks.end();
   }

   int CountWaitingWriters() const {
      MutexLock lock(*_mutex);
      return _waitingWriters;
   }

private:
   // 1: a waiting writer or upgrader holds back new readers.
   const int _mode;
   // >0: read holds; -1: write-locked; 0: free. The flags and it are under _mutex.
   int32_t _status = 0;
   uint8_t _writerWaiting = 0;
   uint8_t _upgradePending = 0;
   // Writers and upgraders inside WriteLock or UpgradeReadLock that had to wait.
   int32_t _waitingWriters = 0;
   Ref<Condition> _readCondition;
   Ref<Condition> _writeCondition;
   // The factory's mutex type, held as such so that the short state changes call it directly.
   Ref<MutexImpl> _mutex = new MutexImpl();
};

}  // namespace

void CreateRWLockImpl(int mode, Ref<RWLock>& out) {
   out = new RWLockImpl(mode);
}

int CountWaitingWriters(RWLock* lock) {
   auto* impl = dynamic_cast<RWLockImpl*>(lock);
   PELMORA_VERIFY(impl != NULL);
   return impl->CountWaitingWriters();
}

}  // namespace Pelmora::System
