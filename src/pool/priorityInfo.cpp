// A priority level of the fair pool: slot reservation and the weight order of its queues.

#include "src/pool/priorityInfo.h"

#include <algorithm>

#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/service/logMacros.h"
#include "src/pool/threadPoolFair.h"
#include "src/pool/workQueueImpl.h"

namespace Pelmora::System {

std::atomic<int> PriorityInfo::sLowestCalculatedPriority{-1};

PriorityInfo::PriorityInfo(int level, int reservationRatio, PoolLimits* limits, ThreadPoolFair* pool)
    : _level(level), _reservationRatio(std::max(reservationRatio, 1)), _limits(limits), _pool(pool) {
   GetPoolLogger()->CreateLogger(MessageFormatter::ASPrint("PriorityInfo.%1", level), _logger);
}

int PriorityInfo::GetEffectiveReservation() {
   if (!_moreUrgent) return 1;
   int lowest = sLowestCalculatedPriority.load();
   if (_level > lowest) {
      {
         Synchronized neighbour(_moreUrgent);
         _cachedReservation = _moreUrgent->GetEffectiveReservation() + 1;
      }
      // A level whose reservation changed meanwhile lowered the mark; keep that.
      int seen = sLowestCalculatedPriority.load();
      while (seen < _level && !sLowestCalculatedPriority.compare_exchange_weak(seen, _level)) {
      }
   }
   return _localReservation + _cachedReservation;
}

void PriorityInfo::UpdateLocalReservation() {
   int local = _executing / _reservationRatio;
   if (local == _localReservation) return;
   _localReservation = local;
   int seen = sLowestCalculatedPriority.load();
   while (seen > _level && !sLowestCalculatedPriority.compare_exchange_weak(seen, _level)) {
   }
}

bool PriorityInfo::ReserveSlot() {
   int reservation = GetEffectiveReservation();
   int before = _limits->busyCount.ReadInc();
   if (_limits->maxThreads.load(std::memory_order_relaxed) > before + reservation) return true;
   _limits->busyCount.ReadDec();
   return false;
}

void PriorityInfo::Insert(WorkQueueImpl* queue) {
   if (_queues.get<byPtr>().count(queue)) return;
   InsertNew(queue, queue->GetWeigth());
}

void PriorityInfo::InsertNew(WorkQueueImpl* queue, int weight) {
   _queues.insert(Entry{weight, queue});
   ++_queueCount;
}

PriorityInfo::GetItemResult PriorityInfo::GetItem(WorkItem& item, WorkQueueImpl*& queue) {
   Synchronized lock(this);
   if (_queues.empty()) return NO_ITEM;
   if (!ReserveSlot()) return NO_SLOT;
   auto& weightIdx = _queues.get<byWeight>();
   auto it = weightIdx.begin();
   PELMORA_VERIFY(it != weightIdx.end());
   queue = it->queue;
   PELMORA_VERIFY(queue != NULL);
   weightIdx.erase(it);
   --_queueCount;
   int weight;
   int left = queue->PopItem(item, &weight);
   ++_executing;
   UpdateLocalReservation();
   // Behind the queues of equal weight, so equal queues take turns.
   if (left > 0) InsertNew(queue, weight);
   if (!_queues.empty()) return ITEM;
   return _memberQueueCount > 0 ? ITEM_LEVEL_EMPTY : ITEM_LEVEL_GONE;
}

void PriorityInfo::QueueNonEmpty(WorkQueueImpl* queue) {
   bool levelBecameNonEmpty;
   {
      Synchronized poolLock(_pool);
      {
         Synchronized lock(this);
         levelBecameNonEmpty = _queues.empty();
         Insert(queue);
      }
      if (levelBecameNonEmpty) _pool->PriorityNonEmpty(_level);
   }
   _pool->PostWork();
   if (levelBecameNonEmpty) PELMORA_LOG_TRIVIA(_logger.Get(), "Priority %1 becomming non empty.", _level);
}

void PriorityInfo::ItemCompleted(WorkQueueImpl* queue, bool reenter) {
   {
      Synchronized lock(this);
      --_executing;
      _limits->busyCount.ReadDec();
      UpdateLocalReservation();
   }
   if (reenter) QueueNonEmpty(queue);
}

}  // namespace Pelmora::System
