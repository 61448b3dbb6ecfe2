#pragma once
// The fair thread pool: priority levels with reserved slots over a Boost.Asio I/O service
// that dispatches one HandleWork per signal that work may be waiting. The pool object is
// the lock of its priority table. A pool lives until it is shut down and waited for:
// its queues, timers and threads keep it referenced until then.

#include <bitset>
#include <map>
#include <memory>
#include <set>
#include <string>

#if defined(__SANITIZE_THREAD__)
// Asio's fences are outside what ThreadSanitizer models; its handlers synchronise
// through the service's mutex, which it does model.
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>

#include "pelmora/perfCounter/lwStats.h"
#include "pelmora/service/config.h"
#include "pelmora/service/logger.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/threadPool.h"
#include "pelmora/system/threadPoolWorkBinder.h"
#include "src/pool/priorityInfo.h"
#include "src/pool/workQueueImpl.h"

namespace Pelmora::System {

class PollScheduler;
class TimerItem;

// The pool's logger, "ThreadPool".
Service::Logger* GetPoolLogger();

class ThreadPoolFair : public virtual ThreadPool,
                       public virtual ThreadPoolWorkBinder,
                       public LockableObjectImpl {
public:
   static constexpr int kLevels = WorkQueueSpec::PL_END + 1;
   static constexpr long long kShrinkPeriodMicroseconds = 10000000;

   // Per pool thread, in its TLS under the pool's key.
   class TlsInfo : public ObjectImpl {
   public:
      ThreadPoolFair* _pool = nullptr;
      WorkQueueImpl* _queue = nullptr;
      uint8_t _working = 0;
      uint8_t _exit = 0;
      bool _worker = false;  // started by the pool (may retire when shrinking)
   };

   // `shrinkPeriodMicroseconds` is the shrink timer's period; only tests shorten it.
   ThreadPoolFair(Service::Config::View* view, ThreadControl* threadControl,
                  long long shrinkPeriodMicroseconds = kShrinkPeriodMicroseconds);
   ~ThreadPoolFair() override;
   // Starts the shrink timer and, unless "initSingleThreaded", the first workers. Apart
   // from the constructor, so that no thread references a pool still being built.
   void Start();

   // ThreadPool
   void CreateSerialWorkQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) override;
   void CreateFairWorkQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) override;
   WorkQueue* GetDefaultIOQueue() override { return _defaultIOQueue.Get(); }
   WorkQueue* GetDefaultLongTaskQueue() override { return _defaultLongTaskQueue.Get(); }
   WorkQueue* GetMainThreadWorkQueue() override { return _mainThreadQueue.Get(); }
   WorkQueue* GetCurrentWorkQueue() override;
   void FindCompletionQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) override;
   void ScheduleWorkItem(const Functor<>& item) override;
   void ScheduleTimer(const Functor<>& callback, long long delayMicroseconds,
                      Ref<ScheduledItem>& out) override;
   void ScheduleIOCompletion(Exception* error, int bytes,
                             const Functor<void, Exception*, int>& callback) override;
   void SchedulePollable(int fd, ThreadControl::POLL_EVENT event, const Functor<>& callback,
                         Ref<ScheduledItem>& out) override;
   void ScheduleReadReady(int fd, const Functor<>& callback, Ref<ScheduledItem>& out) override;
   void ScheduleWriteReady(int fd, const Functor<>& callback, Ref<ScheduledItem>& out) override;
   bool CancelPollable(ScheduledItem* item) override;
   void EnlistThisThread() override;
   void DelistThisThread() override;
   void MainThreadRun() override;
   void ThreadRun() override;
   void RequestShutdown() override;
   bool IsShuttingDown() override { return _shuttingDown.load(std::memory_order_acquire); }
   bool WaitShutdown(long long timeoutMicroseconds) override;
   void GetConfig(ThreadPoolConfig& out) override;
   void SetConfig(const ThreadPoolConfig& config) override;
   void GetStats(PerfCounter::LwStatsBuilder& builder) override;
   using ObjectImpl::ToString;
   std::string ToString() const override;

   // ThreadPoolWorkBinder
   boost::asio::io_context& GetIoService() override { return _io; }

   // Signals that an item may be waiting: one HandleWork on the I/O service.
   void PostWork();
   // Under the pool lock: a level became runnable.
   void PriorityNonEmpty(int level);
   // The main-thread queue got an item.
   void MainQueueNonEmpty();
   // One handler: at most one item, then the levels refused a slot.
   void HandleWork();
   // Under the pool lock; `starved` when serving levels refused earlier.
   bool GetNextItem(bool starved, WorkItem& item, WorkQueueImpl*& queue);
   void HandleShrinkTimerTick();

   PoolLimits& GetLimits() { return _limits; }
   int GetThreadCount() const { return _threadCount.Read(); }
   int GetShrinkTicks() const { return _shrinkTicks.Read(); }
   int GetStarvedCount() const { return _starvedCount.load(); }
   PriorityInfo* GetPriorityInfo(int level) { return _priorities[level].get(); }
   bool IsLevelRunnable(int level) const { return _runnable.test(level); }
   int GetMostUrgentLevel() const { return _mostUrgent; }

   static Atomic<long long> postCount;
   static Atomic<long long> handleWorkCount;
   static Atomic<long long> retryCount;

private:
   friend class TimerItem;

   void CreateQueueInt(const WorkQueueSpec& spec, WorkQueueImpl::Kind kind, Ref<WorkQueue>& out);
   PriorityInfo* InsertPriorityInfo(int level);
   void StartWorkers(int count);
   void RunWorkerThread();
   // Serves I/O handlers on the calling thread until shutdown or its exit flag.
   void ServeLoop(TlsInfo* info);
   TlsInfo* GetTlsInfo();
   TlsInfo* AttachThisThread(bool worker);
   void ThreadLeft(Atomic<int32_t>& counter);
   // A level was refused a slot; `refusedBefore` is how many were refused already.
   void LogUsage(int refusedBefore);
   void ScheduleShrinkTimer();
   void TimerDone(TimerItem* timer);
   // After every thread left: drops queued items and breaks the references back to the pool.
   void ReleaseAll();

   boost::asio::io_context _io;
   boost::asio::executor_work_guard<boost::asio::io_context::executor_type> _workGuard;
   Ref<Service::Config::View> _view;
   Ref<ThreadControl> _threadCtl;
   Service::Logger* _logger;
   PoolLimits _limits;
   Atomic<int32_t> _threadCount{0};
   Atomic<int32_t> _runnerCount{0};  // threads inside ThreadRun or MainThreadRun
   Atomic<int32_t> _shrinkTicks{0};
   Ref<TimerItem> _shrinkTimer;
   const long long _shrinkPeriod;
   std::string _threadNamePrefix;
   long long _stackSizeKb = 256;
   int _reservationRatio = 3;
   int _maxConcurrency = 2147483647;
   int _threadCountWarningThreshold = 2;
   bool _initSingleThreaded = false;
   int _maxFdsPerThread = 0;
   std::atomic<int> _threadCheckTimeSecs{600};
   std::unique_ptr<PriorityInfo> _priorities[kLevels];
   int _mostUrgent = kLevels;
   std::bitset<kLevels> _runnable;
   std::atomic<int> _starvedCount{0};  // changed under the pool lock, read without it
   std::map<std::string, Ref<WorkQueueImpl>> _queues;
   Ref<WorkQueueImpl> _defaultIOQueue;
   Ref<WorkQueueImpl> _defaultLongTaskQueue;
   Ref<WorkQueueImpl> _mainThreadQueue;
   Ref<PollScheduler> _pollScheduler;
   const int _tlsKey;  // of each thread's TlsInfo
   std::atomic<bool> _shuttingDown{false};
   bool _released = false;
   Ref<Mutex> _exitMutex;  // also guards _timers
   Ref<Condition> _exitCondition;
   std::set<TimerItem*> _timers;
};

}  // namespace Pelmora::System
