#pragma once
// Work queues of the thread pool. A WorkQueue runs the functors posted to it on the
// pool's workers at its priority level: a serial queue runs one item at a time in posting
// order, a fair queue lets its items run side by side. ScheduledItem is the handle of a
// timer or a descriptor wait, used to cancel it. Queues and items are thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/system/functor.h"

namespace Pelmora::System {

struct PELMORA_EXPORT WorkQueueSpec {
   // Priority levels: PL_BEGIN is the most urgent.
   enum { PL_BEGIN = 0, PL_END = 25 };

   WorkQueueSpec() = default;
   WorkQueueSpec(std::string queueId, int level, int weight = 1)
       : id(std::move(queueId)), priority(level), itemWeight(weight) {}

   std::string id;
   int priority = 10;
   // How heavily each running item counts against the queue among its level's queues.
   int itemWeight = 1;
};

class PELMORA_EXPORT WorkQueue : public virtual Object {
public:
   virtual const std::string& GetId() const = 0;
   virtual bool IsSerial() const = 0;
   virtual int GetPriority() const = 0;
   // Queues `item` to run on a pool thread. After the pool shut down the item is dropped.
   virtual void Enqueue(const Functor<>& item) = 0;
   // Items waiting (not yet running).
   virtual int GetQueueSize() = 0;
   // The queue on which completions of I/O started by this queue's items run.
   virtual void GetCompletionQueue(Ref<WorkQueue>& out) = 0;
};

class PELMORA_EXPORT ScheduledItem : public virtual Object {
public:
   // Stops the callback from running; false when it already ran, runs now, or was
   // cancelled before.
   virtual bool Cancel() = 0;
   virtual bool IsCancelled() const = 0;
};

}  // namespace Pelmora::System
