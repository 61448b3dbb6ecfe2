#pragma once
// The thread pool runs every piece of work of a process: functors posted to work queues,
// timer callbacks, I/O completions and descriptor waits, on a self-sizing set of worker
// threads. Priority levels run from WorkQueueSpec::PL_BEGIN (most urgent) to PL_END; the
// pool keeps threads free for more urgent levels, and queues of one level share their
// level fairly. One pool per process (GetThreadPool), alive until exit. Thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/config.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/thread.h"
#include "pelmora/system/workQueue.h"

namespace Pelmora {
class Exception;
namespace PerfCounter {
class LwStatsBuilder;
}
}  // namespace Pelmora

namespace Pelmora::System {

// The settings a running pool can report and take.
struct PELMORA_EXPORT ThreadPoolConfig {
   int minThreads = 4;
   int maxThreads = 200;
   int reservationRatio = 3;
   int maxConcurrency = 2147483647;
   int threadCountWarningThreshold = 2;
   int threadCheckTimeSecs = 600;
   bool catchWorkItemExceptions = false;
};

class PELMORA_EXPORT ThreadPool : public virtual Object {
public:
   // Throw InvalidStateException when a queue of `spec.id` exists; an empty id or a
   // priority outside PL_BEGIN..PL_END panics.
   virtual void CreateSerialWorkQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) = 0;
   virtual void CreateFairWorkQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) = 0;
   virtual WorkQueue* GetDefaultIOQueue() = 0;
   virtual WorkQueue* GetDefaultLongTaskQueue() = 0;
   // Its items run only on the thread inside MainThreadRun.
   virtual WorkQueue* GetMainThreadWorkQueue() = 0;
   // The queue whose item the calling thread runs; null outside an item.
   virtual WorkQueue* GetCurrentWorkQueue() = 0;
   // The queue called `spec.id`, created as a fair queue when there is none.
   virtual void FindCompletionQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) = 0;

   // On the default I/O queue.
   virtual void ScheduleWorkItem(const Functor<>& item) = 0;
   // Runs `callback` on the default I/O queue once `delayMicroseconds` have passed.
   virtual void ScheduleTimer(const Functor<>& callback, long long delayMicroseconds,
                              Ref<ScheduledItem>& out) = 0;
   // Calls `callback` on the default I/O queue with a copy of `error` (null for success)
   // and `bytes`; the copy lives until the callback returns.
   virtual void ScheduleIOCompletion(Exception* error, int bytes,
                                     const Functor<void, Exception*, int>& callback) = 0;
   // Runs `callback` once on the default I/O queue when `fd` is ready for `event`. The
   // descriptor must stay open until the callback ran or the wait was cancelled.
   virtual void SchedulePollable(int fd, ThreadControl::POLL_EVENT event,
                                 const Functor<>& callback, Ref<ScheduledItem>& out) = 0;
   virtual void ScheduleReadReady(int fd, const Functor<>& callback, Ref<ScheduledItem>& out) = 0;
   virtual void ScheduleWriteReady(int fd, const Functor<>& callback, Ref<ScheduledItem>& out) = 0;
   // As item->Cancel(); once it returns the descriptor is no longer polled.
   virtual bool CancelPollable(ScheduledItem* item) = 0;

   // Gives a thread the library did not start the pool's thread record, so that it may
   // post and ask for its current queue; Delist removes it.
   virtual void EnlistThisThread() = 0;
   virtual void DelistThisThread() = 0;
   // The calling (main) thread runs the main-thread queue until shutdown.
   virtual void MainThreadRun() = 0;
   // The calling thread serves the pool as one more worker until shutdown.
   virtual void ThreadRun() = 0;

   // Workers leave after the item they run; queued items are dropped.
   virtual void RequestShutdown() = 0;
   virtual bool IsShuttingDown() = 0;
   // Waits up to `timeoutMicroseconds` (negative: no limit) for every pool thread to
   // leave; true when none is left. After true no item runs any more and the queued
   // items are released.
   virtual bool WaitShutdown(long long timeoutMicroseconds) = 0;

   virtual void GetConfig(ThreadPoolConfig& out) = 0;
   // The reservation ratio applies to priority levels that become active later.
   virtual void SetConfig(const ThreadPoolConfig& config) = 0;
   // Per queue, under "ThreadPool/Pelmora/WorkQueue/" + id.
   virtual void GetStats(PerfCounter::LwStatsBuilder& builder) = 0;
};

// A pool configured from `view` (null: every default), on the platform's thread control.
PELMORA_EXPORT void CreateThreadPool(Service::Config::View* view, Ref<ThreadPool>& out);
// The process's pool; null until SetThreadPool. The application object sets it at start-up.
PELMORA_EXPORT ThreadPool* GetThreadPool();
// Keeps `pool` referenced until exit (or the next call); never released during static
// destruction, so late callers find a living object.
PELMORA_EXPORT void SetThreadPool(ThreadPool* pool);

// Whether an exception escaping a work item is logged and swallowed (true) or ends the
// process (false, the default).
PELMORA_EXPORT void SetCatchWorkItemExceptions(bool catchThem);
PELMORA_EXPORT bool GetCatchWorkItemExceptions();

}  // namespace Pelmora::System
