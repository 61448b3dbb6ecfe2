#pragma once
// One active priority level of the fair pool: the member queues that have items, ordered
// by their weight, the level's running items and the slots it keeps free for more urgent
// levels. Levels form a chain from the most urgent to the least. Lock order: the pool,
// then a level; a level locks its more urgent neighbour only to read its reservation.

#include <atomic>
#include <cstdint>

#include <boost/multi_index/hashed_index.hpp>
#include <boost/multi_index/member.hpp>
#include <boost/multi_index/ordered_index.hpp>
#include <boost/multi_index_container.hpp>

#include "pelmora/object/atomic.h"
#include "pelmora/service/logger.h"
#include "pelmora/system/lockable.h"

namespace Pelmora::System {

class ThreadPoolFair;
class WorkQueueImpl;
class WorkItem;

// Shared by the pool and every level.
struct PoolLimits {
   Atomic<int32_t> busyCount{0};  // execution slots taken
   std::atomic<int32_t> maxThreads{200};
   std::atomic<int32_t> minThreads{4};
};

class PriorityInfo : public LockableObjectImpl {
public:
   enum GetItemResult {
      NO_SLOT,
      ITEM,
      ITEM_LEVEL_EMPTY,
      ITEM_LEVEL_GONE,  // the index emptied and no member queue is left
      NO_ITEM,          // the level had no queue with items
   };

   PriorityInfo(int level, int reservationRatio, PoolLimits* limits, ThreadPoolFair* pool);

   int GetLevel() const { return _level; }
   // Under the pool lock: takes a slot and the first item of the lightest queue.
   GetItemResult GetItem(WorkItem& item, WorkQueueImpl*& queue);
   // `queue` got its first item (no lock held): enters the weight index, posts a handler.
   void QueueNonEmpty(WorkQueueImpl* queue);
   // An item of `queue` ended (no lock held); a serial queue with items re-enters.
   void ItemCompleted(WorkQueueImpl* queue, bool reenter);
   // Under the pool lock.
   void AddMemberQueue() { ++_memberQueueCount; }
   void RemoveMemberQueue() { --_memberQueueCount; }
   int GetMemberQueueCount() const { return _memberQueueCount; }
   // Slots this level leaves free for more urgent ones. Under this level's lock.
   int GetEffectiveReservation();
   int GetExecuting() const { return _executing; }
   int GetRunnableQueueCount() const { return _queueCount; }

   PriorityInfo* _moreUrgent = nullptr;
   PriorityInfo* _lessUrgent = nullptr;

   // Levels down to this one hold valid cached reservations.
   static std::atomic<int> sLowestCalculatedPriority;

private:
   struct Entry {
      int weight;
      WorkQueueImpl* queue;
   };
   struct byWeight {};
   struct byPtr {};
   using QueueIndex = boost::multi_index_container<
       Entry,
       boost::multi_index::indexed_by<
           boost::multi_index::ordered_non_unique<boost::multi_index::tag<byWeight>,
                                                  boost::multi_index::member<Entry, int, &Entry::weight>>,
           boost::multi_index::hashed_unique<boost::multi_index::tag<byPtr>,
                                             boost::multi_index::member<Entry, WorkQueueImpl*, &Entry::queue>>>>;

   bool ReserveSlot();
   void UpdateLocalReservation();
   // Entered at the back of the queues of equal weight.
   void Insert(WorkQueueImpl* queue);
   // The same for a queue known to be out of the index, with its weight taken already.
   void InsertNew(WorkQueueImpl* queue, int weight);

   const int _level;
   const int _reservationRatio;
   PoolLimits* const _limits;
   int _cachedReservation = 0;
   int _localReservation = 0;
   int32_t _executing = 0;
   QueueIndex _queues;
   int _queueCount = 0;
   ThreadPoolFair* const _pool;
   int _memberQueueCount = 0;
   Ref<Service::Logger> _logger;
};

}  // namespace Pelmora::System
