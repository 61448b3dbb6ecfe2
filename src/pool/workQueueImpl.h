#pragma once
// The work queue of the fair pool and its items. A queue keeps its pending items and its
// counts under its own lock, taken alone: it is released before the level hears of a new
// first item or of a completion.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <string>

#include "pelmora/object/atomic.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/workQueue.h"

namespace Pelmora::PerfCounter {
class LwStatsBuilder;
class Registry;
class RegistryItem;
}

namespace Pelmora::System {

class PriorityInfo;
class ThreadPoolFair;

// One pending item, held by value in its queue: items are too many and too short-lived to
// be reference-counted objects of their own.
class WorkItem {
public:
   WorkItem() = default;
   // `catchExceptions` selects the form that logs what escapes the item (see below).
   WorkItem(const Functor<>& function, bool catchExceptions)
       : _function(function), _catchExceptions(catchExceptions) {}

   void Run();
   explicit operator bool() const noexcept { return static_cast<bool>(_function); }
   bool operator!=(std::nullptr_t) const noexcept { return static_cast<bool>(_function); }
   // Drops the functor (and what it holds) at once.
   void Reset() noexcept { _function.Reset(); }

private:
   Functor<> _function;
   bool _catchExceptions = false;
};

// The catching form of a work item: logs what escapes at panic level and carries on.
struct WorkItemImplCatchEx {
   static void Run(const Functor<>& function);
};

// A work item of the form the process-wide switch selects.
WorkItem CreateWorkItem(const Functor<>& function);

class WorkQueueImpl : public virtual WorkQueue, public LockableObjectImpl {
public:
   enum Kind { KIND_FAIR = 0, KIND_SERIAL = 1 };

   // `level` is null for the main-thread queue, whose items only MainThreadRun takes.
   WorkQueueImpl(const WorkQueueSpec& spec, Kind kind, ThreadPoolFair* pool, PriorityInfo* level);

   const std::string& GetId() const override { return _id; }
   bool IsSerial() const override { return _kind == KIND_SERIAL; }
   int GetPriority() const override { return _priority; }
   void Enqueue(const Functor<>& item) override;
   int GetQueueSize() override;
   void GetCompletionQueue(Ref<WorkQueue>& out) override { out = this; }
   using ObjectImpl::ToString;
   std::string ToString() const override;

   void EnqueueItem(WorkItem&& item);
   // The fairness key among the queues of one level.
   int GetWeigth();
   int GetWeigthLocked() const;
   // Takes the first item; answers the items left (0 for a serial queue) and, when
   // `weight` is given, the queue's weight after the pop.
   int PopItem(WorkItem& item, int* weight = nullptr);
   // Its level is told after the queue lock is released.
   void ItemCompleted(long long elapsedMicroseconds);
   // Shutdown: drops every pending item and every later one, and hands over the
   // queue's reference to its pool (released by the caller, outside the queue).
   void Close(Ref<ThreadPoolFair>& pool);
   void GetStats(PerfCounter::LwStatsBuilder& builder);
   // Registers the queue's counters "/ThreadPool/Pelmora/WorkQueue/<id>/<value>" until
   // Close. A name taken already (a queue of the same id in another live pool) is logged
   // and the queue goes without counters. Called without any lock held.
   void PublishStats(PerfCounter::Registry* registry);
   // The five values in the order of kStatNames.
   void ReadStats(long long values[5]);
   static const char* const kStatNames[5];
   PriorityInfo* GetPriorityInfo() const { return _level; }

   static Atomic<long long> enqCount;
   static Atomic<long long> popCount;

private:
   const std::string _id;
   const Kind _kind;
   const int _itemWeight;
   const int _priority;
   ThreadPoolFair* const _pool;
   Ref<ThreadPoolFair> _keepPool;  // until Close: a queue in use keeps its pool
   std::atomic<bool> _closed{false};
   std::deque<WorkItem> _items;
   Ref<PerfCounter::RegistryItem> _statsItem;  // registered counters, until Close
   PriorityInfo* const _level;
   // Atomic, so that a fair queue counts a completion without its lock.
   std::atomic<int32_t> _executing{0};
   int32_t _dispatched = 0;  // since the queue last became non-empty
   // While the enqueuer that made the queue non-empty is still entering it into its
   // level, a handler posted for a later item would find nothing and be dropped; those
   // posts wait here and the announcing enqueuer sends them once the queue is in.
   int32_t _announcing = 0;
   int32_t _deferredPosts = 0;
   std::atomic<int64_t> _completed{0};
   std::atomic<int64_t> _executionMicroseconds{0};
};

}  // namespace Pelmora::System
