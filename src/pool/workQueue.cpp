// Work queues and work items of the fair pool.

#include <atomic>
#include <exception>
#include <typeinfo>
#include <utility>

#include "pelmora/exception/panic.h"
#include "pelmora/exception/throwable.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/perfCounter/counter.h"
#include "pelmora/perfCounter/lwStats.h"
#include "pelmora/perfCounter/registry.h"
#include "pelmora/service/logMacros.h"
#include "src/pool/priorityInfo.h"
#include "src/pool/threadPoolFair.h"
#include "src/pool/workQueueImpl.h"

namespace Pelmora::System {

namespace {

std::atomic<bool> sCatchWorkItemExceptions{false};

}  // namespace

void SetCatchWorkItemExceptions(bool catchThem) { sCatchWorkItemExceptions.store(catchThem); }
bool GetCatchWorkItemExceptions() { return sCatchWorkItemExceptions.load(); }

void WorkItem::Run() {
   if (_catchExceptions) {
      WorkItemImplCatchEx::Run(_function);
   } else {
      _function();
   }
}

void WorkItemImplCatchEx::Run(const Functor<>& function) {
   try {
      function();
   } catch (const Throwable& e) {
      PELMORA_LOG_PANIC(GetPoolLogger(), "Worker: Unhandled exception:\n%1",
                        e.GetMessage() + "\n" + e.Where());
   } catch (const std::exception& e) {
      PELMORA_LOG_PANIC(GetPoolLogger(), "Worker: Unhandled exception:\n%1, %2", typeid(e).name(),
                        e.what());
   } catch (...) {
      PELMORA_LOG_PANIC(GetPoolLogger(), "Worker: Unhandled exception of unknown type");
   }
}

WorkItem CreateWorkItem(const Functor<>& function) {
   return WorkItem(function, sCatchWorkItemExceptions.load(std::memory_order_relaxed));
}

Atomic<long long> WorkQueueImpl::enqCount;
Atomic<long long> WorkQueueImpl::popCount;

WorkQueueImpl::WorkQueueImpl(const WorkQueueSpec& spec, Kind kind, ThreadPoolFair* pool,
                             PriorityInfo* level)
    : _id(spec.id), _kind(kind), _itemWeight(spec.itemWeight), _priority(spec.priority),
      _pool(pool), _keepPool(pool), _level(level) {}

void WorkQueueImpl::Enqueue(const Functor<>& item) { EnqueueItem(CreateWorkItem(item)); }

void WorkQueueImpl::EnqueueItem(WorkItem&& item) {
   // A closed queue may have outlived its pool: it looks no further.
   if (_closed.load(std::memory_order_acquire) || _pool->IsShuttingDown()) return;
   bool first;
   bool announce;
   {
      Synchronized lock(this);
      enqCount.ReadInc();
      _items.push_back(std::move(item));
      first = _items.size() == 1;
      if (first) _dispatched = 0;
      // A serial queue with its item running re-enters its level on completion.
      announce = first && !(_kind == KIND_SERIAL && _executing > 0);
      if (announce && _level) {
         ++_announcing;
      } else if (!first && _kind == KIND_FAIR && _announcing > 0) {
         ++_deferredPosts;
         return;
      }
   }
   if (!_level) {
      _pool->MainQueueNonEmpty();
   } else if (announce) {
      _level->QueueNonEmpty(this);
      int32_t deferred = 0;
      {
         Synchronized lock(this);
         // The last of overlapping announcements sends them.
         if (--_announcing == 0) std::swap(deferred, _deferredPosts);
      }
      for (int32_t i = 0; i < deferred; ++i) _pool->PostWork();
   } else if (!first && _kind == KIND_FAIR) {
      _pool->PostWork();
   }
}

int WorkQueueImpl::GetQueueSize() {
   Synchronized lock(this);
   return static_cast<int>(_items.size());
}

int WorkQueueImpl::GetWeigth() {
   Synchronized lock(this);
   return GetWeigthLocked();
}

int WorkQueueImpl::GetWeigthLocked() const {
   // A queue that just received work goes ahead of those already being served.
   int executing = _executing.load(std::memory_order_relaxed);
   if (executing == 0) return _dispatched == 0 ? -1 : 0;
   return executing * _itemWeight;
}

int WorkQueueImpl::PopItem(WorkItem& item, int* weight) {
   Synchronized lock(this);
   popCount.ReadInc();
   PELMORA_VERIFY(!_items.empty());
   item = std::move(_items.front());
   _items.pop_front();
   _executing.fetch_add(1, std::memory_order_relaxed);
   ++_dispatched;
   if (weight) *weight = GetWeigthLocked();
   return _kind == KIND_SERIAL ? 0 : static_cast<int>(_items.size());
}

void WorkQueueImpl::ItemCompleted(long long elapsedMicroseconds) {
   auto count = [this, elapsedMicroseconds] {
      _executing.fetch_sub(1, std::memory_order_relaxed);
      _completed.fetch_add(1, std::memory_order_relaxed);
      _executionMicroseconds.fetch_add(elapsedMicroseconds, std::memory_order_relaxed);
   };
   bool reenter = false;
   if (_kind == KIND_SERIAL) {
      // Enqueue decides under the lock whether completion re-announces the queue.
      Synchronized lock(this);
      count();
      reenter = !_items.empty();
   } else {
      count();
   }
   if (_level) _level->ItemCompleted(this, reenter);
}

void WorkQueueImpl::Close(Ref<ThreadPoolFair>& pool) {
   std::deque<WorkItem> dropped;
   Ref<PerfCounter::RegistryItem> stats;
   {
      Synchronized lock(this);
      _closed.store(true, std::memory_order_release);
      dropped.swap(_items);
      pool = std::move(_keepPool);
      stats = std::move(_statsItem);
   }
   // Outside the queue lock: the registry collects values under its own lock, then ours.
   if (stats) stats->Unregister();
}

const char* const WorkQueueImpl::kStatNames[5] = {"QueueSize", "currentConcurrency", "ExecutionCount",
                                                  "TotalExecionCount", "TotalExecutionTime"};

void WorkQueueImpl::ReadStats(long long values[5]) {
   Synchronized lock(this);
   values[0] = static_cast<long long>(_items.size());
   values[1] = _executing;
   values[2] = _dispatched;
   values[3] = _completed;
   values[4] = _executionMicroseconds;
}

namespace {

// Reads a queue's counters for the registry; holds the queue until it unregisters at Close.
class QueueStatsPublisher : public virtual PerfCounter::GroupPublisher, public ObjectImpl {
public:
   explicit QueueStatsPublisher(WorkQueueImpl* queue) : _queue(queue) {}
   void CollectValues(RefVector<PerfCounter::Metadata>& metadata,
                      std::vector<PerfCounter::Value>& values) override {
      long long read[5];
      _queue->ReadStats(read);
      values.clear();
      for (size_t i = 0; i < metadata.size() && i < 5; ++i) values.emplace_back(read[i]);
   }

private:
   const Ref<WorkQueueImpl> _queue;
};

}  // namespace

void WorkQueueImpl::PublishStats(PerfCounter::Registry* registry) {
   RefVector<PerfCounter::Metadata> metadata;
   for (int i = 0; i < 5; ++i) {
      auto type = i < 2 ? PerfCounter::Metadata::TYPE_GAUGE : PerfCounter::Metadata::TYPE_COUNTER;
      metadata.push_back(new PerfCounter::Metadata(
          "/ThreadPool/Pelmora/WorkQueue/" + _id + "/" + kStatNames[i], type));
   }
   Ref<PerfCounter::RegistryItem> item;
   try {
      registry->RegisterGroup(metadata, new QueueStatsPublisher(this), item);
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(GetPoolLogger(), "WorkQueue.%1 publishes no counters: %2", _id, e.GetMessage());
      return;
   }
   {
      Synchronized lock(this);
      if (!_closed.load(std::memory_order_acquire)) {
         _statsItem = item;
         return;
      }
   }
   item->Unregister();  // closed meanwhile
}

void WorkQueueImpl::GetStats(PerfCounter::LwStatsBuilder& builder) {
   long long size, executing, dispatched, completed, time;
   {
      Synchronized lock(this);
      size = static_cast<long long>(_items.size());
      executing = _executing;
      dispatched = _dispatched;
      completed = _completed;
      time = _executionMicroseconds;
   }
   // Statistics keys take an upper-case letter after every "/" and quote free text, so the
   // id is quoted and the running count is capitalised here; the registry's counters keep
   // the names exactly (PublishStats).
   PerfCounter::CounterFactory counter;
   builder.Push("ThreadPool");
   builder.Push("Pelmora");
   builder.Push("WorkQueue", _id);
   builder.Insert("QueueSize", size, counter);
   builder.Insert("CurrentConcurrency", executing, counter);
   builder.Insert("ExecutionCount", dispatched, counter);
   builder.Insert("TotalExecionCount", completed, counter);
   builder.Insert("TotalExecutionTime", time, counter);
   for (int i = 0; i < 3; ++i) builder.Pop();
}

std::string WorkQueueImpl::ToString() const {
   return MessageFormatter::ASPrint("WorkQueue.%1, type = %2, priority = %3 , itemWeight = %4", _id,
                                    _kind == KIND_SERIAL ? "serial" : "fair", _priority, _itemWeight);
}

}  // namespace Pelmora::System
