// The fair thread pool: workers on a Boost.Asio I/O service, the priority table with its
// reservations, growth and shrinking, timers, shutdown.

#include "src/pool/threadPoolFair.h"

#include <algorithm>
#include <chrono>
#include <mutex>
#include <utility>

#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/perfCounter/publishedMap.h"
#include "pelmora/perfCounter/registry.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/system/systemFactory.h"
#include "src/pool/pollScheduler.h"

namespace Pelmora::System {

namespace {

constexpr int kMinStackSizeKb = 32;
constexpr int kMaxStackSizeKb = 2048;
constexpr int kDefaultStackSizeKb = 256;

int ReadInt(Service::Config::View* view, const char* key, int value) {
   if (view) view->Get(key, &value);
   return value;
}

bool ReadBool(Service::Config::View* view, const char* key, bool value) {
   if (view) view->Get(key, &value);
   return value;
}

long long NowMicroseconds() {
   return std::chrono::duration_cast<std::chrono::microseconds>(
              std::chrono::steady_clock::now().time_since_epoch())
       .count();
}

// The record of the pool whose handlers the calling thread serves.
thread_local void* tServingInfo = nullptr;

enum TimerState { TIMER_WAITING = 0, TIMER_FIRED = 1, TIMER_CANCELLED = 2, TIMER_RUNNING = 3 };

}  // namespace

Service::Logger* GetPoolLogger() {
   // Alive until exit: workers may log during static destruction.
   static Service::Logger* logger = [] {
      Ref<Service::Logger> created;
      Service::GetDefaultLogger()->CreateLogger("ThreadPool", created);
      return created.Release();
   }();
   return logger;
}

// A timer on the I/O service. The asio timer is not safe for concurrent use, so starting
// and cancelling it take the item's own lock; the state decides, once, whether the
// callback runs.
class TimerItem : public virtual ScheduledItem, public ObjectImpl {
public:
   // `direct`: the callback runs inside the I/O handler instead of on the default queue.
   TimerItem(ThreadPoolFair* pool, const Functor<>& callback, bool direct)
       : _pool(pool), _timer(pool->_io), _callback(callback), _direct(direct) {}

   void Start(long long delayMicroseconds) {
      {
         Synchronized lock(_pool->_exitMutex.Get());
         if (_pool->IsShuttingDown()) {
            _state.store(TIMER_CANCELLED);
            return;
         }
         _pool->_timers.insert(this);
      }
      std::lock_guard<std::mutex> lock(_mutex);
      _timer.expires_after(std::chrono::microseconds(std::max(delayMicroseconds, 0LL)));
      Ref<TimerItem> self(this);
      _timer.async_wait([self](const boost::system::error_code& error) { self->Expired(error); });
   }

   bool Cancel() override {
      int expected = TIMER_WAITING;
      if (!_state.compare_exchange_strong(expected, TIMER_CANCELLED)) {
         expected = TIMER_FIRED;
         if (!_state.compare_exchange_strong(expected, TIMER_CANCELLED)) return false;
      }
      AbortWait();
      return true;
   }

   bool IsCancelled() const override { return _state.load() == TIMER_CANCELLED; }

   // Lets the pending wait complete at once (shutdown), whatever the state.
   void AbortWait() {
      std::lock_guard<std::mutex> lock(_mutex);
      _timer.cancel();
   }

private:
   void Expired(const boost::system::error_code& error) {
      _pool->TimerDone(this);
      if (error) return;
      int expected = TIMER_WAITING;
      if (!_state.compare_exchange_strong(expected, TIMER_FIRED)) return;
      if (_direct) {
         RunCallback();
         return;
      }
      Ref<TimerItem> self(this);
      _pool->_defaultIOQueue->Enqueue([self] { self->RunCallback(); });
   }

   void RunCallback() {
      int expected = TIMER_FIRED;
      if (_state.compare_exchange_strong(expected, TIMER_RUNNING)) _callback();
   }

   // Declared first: the asio timer goes before the pool whose service it uses.
   Ref<ThreadPoolFair> _pool;
   std::mutex _mutex;
   boost::asio::steady_timer _timer;
   Functor<> _callback;
   const bool _direct;
   std::atomic<int> _state{TIMER_WAITING};
};

Atomic<long long> ThreadPoolFair::postCount;
Atomic<long long> ThreadPoolFair::handleWorkCount;
Atomic<long long> ThreadPoolFair::retryCount;

ThreadPoolFair::ThreadPoolFair(Service::Config::View* view, ThreadControl* threadControl,
                               long long shrinkPeriodMicroseconds)
    : _workGuard(boost::asio::make_work_guard(_io)),
      _view(view),
      _threadCtl(threadControl),
      _logger(GetPoolLogger()),
      _shrinkPeriod(shrinkPeriodMicroseconds),
      _tlsKey(ReserveTlsKey()) {
   GetSystemFactory()->CreateMutex(_exitMutex);
   GetSystemFactory()->CreateCondition(_exitCondition);

   _maxConcurrency = ReadInt(view, "maxConcurrency", 2147483647);
   int minThreads = ReadInt(view, "minThreads", 4);
   int maxThreads = ReadInt(view, "maxThreads", 200);
   if (minThreads > maxThreads) {
      PELMORA_LOG_WARNING(_logger, "'%1'(%2) is greater than '%3'(%4)", "minThreads", minThreads,
                          "maxThreads", maxThreads);
   }
   _limits.minThreads.store(minThreads);
   _limits.maxThreads.store(maxThreads);
   _reservationRatio = ReadInt(view, "reservationRatio", 3);

   Ref<WorkQueue> created;
   CreateQueueInt(WorkQueueSpec("DefaultIOQueue", 10), WorkQueueImpl::KIND_FAIR, created);
   _defaultIOQueue = created.Cast<WorkQueueImpl>();
   CreateQueueInt(WorkQueueSpec("DefaultLongTaskQueue", 20), WorkQueueImpl::KIND_FAIR, created);
   _defaultLongTaskQueue = created.Cast<WorkQueueImpl>();
   _mainThreadQueue = new WorkQueueImpl(WorkQueueSpec("MainThreadQueue", 0), WorkQueueImpl::KIND_SERIAL,
                                        this, nullptr);
   for (WorkQueueImpl* queue : {_defaultIOQueue.Get(), _defaultLongTaskQueue.Get(), _mainThreadQueue.Get()})
      queue->PublishStats(PerfCounter::GetCounterRegistry());

   if (view) view->Get("threadNamePrefix", &_threadNamePrefix);
   int stackSizeKb = ReadInt(view, "ThreadStackSizeKb", kDefaultStackSizeKb);
   if (stackSizeKb == 0) {
      stackSizeKb = kDefaultStackSizeKb;
   } else if (stackSizeKb > kMaxStackSizeKb) {
      PELMORA_LOG_WARNING(_logger, "Stack size value %1 bigger than maxStackSize %2, Set to max",
                          stackSizeKb, kMaxStackSizeKb);
      stackSizeKb = kMaxStackSizeKb;
   } else if (stackSizeKb < kMinStackSizeKb) {
      PELMORA_LOG_WARNING(_logger, "Stack size value %1 smallerr than minStackSize %2, Set to min",
                          stackSizeKb, kMinStackSizeKb);
      stackSizeKb = kMinStackSizeKb;
   }
   _stackSizeKb = stackSizeKb;
   SetCatchWorkItemExceptions(ReadBool(view, "catchWorkItemExceptions", false));
   _threadCountWarningThreshold = ReadInt(view, "threadCountWarningThreshold", 2);
   _initSingleThreaded = ReadBool(view, "initSingleThreaded", false);
   _threadCheckTimeSecs.store(ReadInt(view, "ThreadCheckTimeSecs", 600));
   _maxFdsPerThread = ReadInt(view, "MaxFdsPerThread", 0);

   ThreadPoolFair* self = this;
   _pollScheduler = new PollScheduler(
       threadControl, [self](const Functor<>& callback) { self->_defaultIOQueue->Enqueue(callback); },
       _stackSizeKb, _threadNamePrefix + "poll");
}

void ThreadPoolFair::Start() {
   _threadCtl->OnThreadPoolStartup(_maxFdsPerThread);
   ScheduleShrinkTimer();
   if (!_initSingleThreaded) {
      int count = std::max(_limits.minThreads.load(), 1);
      _threadCount.ReadAdd(count);
      StartWorkers(count);
   }
   PELMORA_LOG_INFO(_logger, "Thread pool fair: Min threads, Max threads, Reservation ratio: %1, %2, %3",
                    _limits.minThreads.load(), _limits.maxThreads.load(), _reservationRatio);
   PELMORA_LOG_TRIVIA(_logger, "Thread pool launched");
}

ThreadPoolFair::~ThreadPoolFair() { ReleaseTlsKey(_tlsKey); }

void ThreadPoolFair::StartWorkers(int count) {
   Ref<ThreadPoolFair> self(this);
   for (int i = 0; i < count; ++i) {
      Ref<Thread> thread;
      try {
         _threadCtl->StartThread([self] { self->RunWorkerThread(); }, _stackSizeKb, thread);
      } catch (const Exception& e) {
         PELMORA_LOG_ERROR(_logger, "Cannot start a worker thread: %1", e.GetMessage());
         ThreadLeft(_threadCount);
      }
   }
}

ThreadPoolFair::TlsInfo* ThreadPoolFair::GetTlsInfo() {
   return dynamic_cast<TlsInfo*>(GetThisThread()->GetTls(_tlsKey));
}

ThreadPoolFair::TlsInfo* ThreadPoolFair::AttachThisThread(bool worker) {
   TlsInfo* info = GetTlsInfo();
   if (info) return info;
   Ref<TlsInfo> created = new TlsInfo();
   created->_pool = this;
   created->_worker = worker;
   GetThisThread()->SetTls(_tlsKey, created.Get());
   return created.Get();
}

void ThreadPoolFair::ThreadLeft(Atomic<int32_t>& counter) {
   Synchronized lock(_exitMutex.Get());
   if (counter.ReadDec() == 1) _exitCondition->Broadcast();
}

void ThreadPoolFair::RunWorkerThread() {
   _threadCtl->InitializeThisThread();
   _threadCtl->SetThreadName(_threadNamePrefix + "worker");
   TlsInfo* info = AttachThisThread(true);
   ServeLoop(info);
   GetThisThread()->SetTls(_tlsKey, nullptr);
   _threadCtl->UninitializeThisThread();
   ThreadLeft(_threadCount);
}

void ThreadPoolFair::ServeLoop(TlsInfo* info) {
   void* outer = std::exchange(tServingInfo, info);
   while (!IsShuttingDown() && !info->_exit) {
      info->_working = 0;
      // Nothing is left to run only once shutdown took the work guard away.
      if (_io.run_one() == 0) {
         _io.stop();
         break;
      }
   }
   tServingInfo = outer;
}

void ThreadPoolFair::PostWork() {
   int32_t none = 0;
   if (_threadCount.Read() == 0 && _threadCount.CompareAndSwap(none, 1)) StartWorkers(1);
   postCount.ReadInc();
   boost::asio::post(_io, [this] { HandleWork(); });
}

void ThreadPoolFair::PriorityNonEmpty(int level) { _runnable.set(level); }

void ThreadPoolFair::HandleWork() {
   if (IsShuttingDown()) return;
   handleWorkCount.ReadInc();
   TlsInfo* _tlsInfo = static_cast<TlsInfo*>(tServingInfo);
   if (!_tlsInfo || _tlsInfo->_pool != this) _tlsInfo = AttachThisThread(false);
   PELMORA_VERIFY(!_tlsInfo->_working);
   _tlsInfo->_working = 1;
   int minThreads = std::max(_limits.minThreads.load(std::memory_order_relaxed), 1);
   if (_threadCount.Read() - _limits.maxThreads.load(std::memory_order_relaxed) - 1 <= minThreads) {
      _shrinkTicks.Write(-1);
   }
   bool starved = false;
   for (;;) {
      WorkItem item;
      WorkQueueImpl* queue = nullptr;  // the pool's map keeps it until every thread left
      if (!GetNextItem(starved, item, queue)) break;
      starved = true;
      PELMORA_VERIFY(item != NULL);
      PELMORA_VERIFY(_tlsInfo->_queue == NULL);
      _tlsInfo->_queue = queue;
      long long start = NowMicroseconds();
      {
         PerfCounter::TlsScope scope;
         item.Run();
      }
      item.Reset();
      long long elapsed = NowMicroseconds() - start;
      _tlsInfo->_queue = nullptr;
      queue->ItemCompleted(elapsed);
      if (IsShuttingDown()) break;
   }
   _tlsInfo->_working = 0;
   minThreads = std::max(_limits.minThreads.load(std::memory_order_relaxed), 1);
   if (_threadCount.Read() - _limits.maxThreads.load(std::memory_order_relaxed) + 1 > minThreads) {
      int32_t disabled = -1;
      _shrinkTicks.CompareAndSwap(disabled, 0);
   }
}

bool ThreadPoolFair::GetNextItem(bool starved, WorkItem& item, WorkQueueImpl*& queue) {
   // Most handlers find no level refused and leave without the pool lock. A refusal is
   // counted before its slot is tried (below) and a completion frees its slot before it
   // gets here; both go through the busy count, so either the refusal sees the freed
   // slot or this read sees the refusal.
   if (starved && _starvedCount.load() == 0) return false;
   bool found = false;
   bool grow = false;
   {
      Synchronized lock(this);
      if (starved && _starvedCount.load(std::memory_order_relaxed) == 0) return false;
      size_t level = _runnable._Find_first();
      if (level >= kLevels) {
         if (!starved) {
            long long misses = retryCount.ReadInc() + 1;
            // A miss is a handler whose item a starved-level pass already ran; posting it
            // again would only spin, so it is counted and dropped.
            if (misses % 10 == 0) PELMORA_LOG_TRIVIA(_logger, "GetNextItem misses: %1", misses);
         }
         return false;
      }
      // Counted as refused while the slot is tried (a starved pass is counted already);
      // the count drops again unless the level is refused.
      int refusedBefore = starved ? _starvedCount.load(std::memory_order_relaxed) : _starvedCount.fetch_add(1);
      bool refused = false;
      for (;;) {
         PriorityInfo::GetItemResult result = _priorities[level]->GetItem(item, queue);
         if (result == PriorityInfo::NO_ITEM) {
            // A level left runnable when its last queue went: clear it and look further.
            _runnable.reset(level);
            level = _runnable._Find_first();
            if (level >= kLevels) break;
            continue;
         }
         if (result == PriorityInfo::NO_SLOT) {
            refused = true;
            LogUsage(refusedBefore);
         } else {
            found = true;
            if (result == PriorityInfo::ITEM_LEVEL_EMPTY) {
               _runnable.reset(level);
               PELMORA_LOG_TRIVIA(_logger, "Priority %1 becomming empty.", static_cast<int>(level));
            }
         }
         break;
      }
      if (!refused) _starvedCount.fetch_sub(1);
      int threads = _threadCount.Read();
      if (threads < _limits.maxThreads.load(std::memory_order_relaxed) &&
          _limits.busyCount.Read() > threads / 2 + threads / 4) {
         _threadCount.ReadInc();
         grow = true;
      }
   }
   if (grow) StartWorkers(1);
   return found;
}

void ThreadPoolFair::LogUsage(int refusedBefore) {
   // Once per stretch of refusals, not per refused handler: a pool at its limit refuses
   // often, and the line says the same every time.
   if (refusedBefore > 0) return;
   int busy = _limits.busyCount.Read();
   int maxThreads = _limits.maxThreads.load(std::memory_order_relaxed);
   if (maxThreads - busy <= _threadCountWarningThreshold) {
      PELMORA_LOG_VERBOSE(_logger, "Thread pool usage: threads %1, busy %2, max threads %3, starved %4",
                          _threadCount.Read(), busy, maxThreads, _starvedCount.load(std::memory_order_relaxed));
   }
}

PriorityInfo* ThreadPoolFair::InsertPriorityInfo(int level) {
   PELMORA_VERIFY(IsLocked());
   PELMORA_VERIFY(level >= WorkQueueSpec::PL_BEGIN && level <= WorkQueueSpec::PL_END);
   PELMORA_VERIFY(!_priorities[level]);
   auto info = std::make_unique<PriorityInfo>(level, _reservationRatio, &_limits, this);
   for (int above = level - 1; above >= 0; --above) {
      if (_priorities[above]) {
         info->_moreUrgent = _priorities[above].get();
         _priorities[above]->_lessUrgent = info.get();
         break;
      }
   }
   for (int below = level + 1; below < kLevels; ++below) {
      if (_priorities[below]) {
         info->_lessUrgent = _priorities[below].get();
         _priorities[below]->_moreUrgent = info.get();
         break;
      }
   }
   _mostUrgent = std::min(_mostUrgent, level);
   // The levels below get a new neighbour: their cached reservations are stale.
   int seen = PriorityInfo::sLowestCalculatedPriority.load();
   while (seen > level - 1 &&
          !PriorityInfo::sLowestCalculatedPriority.compare_exchange_weak(seen, level - 1)) {
   }
   _priorities[level] = std::move(info);
   PELMORA_LOG_INFO(_logger, "Priority level %1 is now active.", level);
   return _priorities[level].get();
}

void ThreadPoolFair::CreateQueueInt(const WorkQueueSpec& spec, WorkQueueImpl::Kind kind,
                                    Ref<WorkQueue>& out) {
   PELMORA_VERIFY(!spec.id.empty());
   PELMORA_VERIFY(spec.priority >= WorkQueueSpec::PL_BEGIN && spec.priority <= WorkQueueSpec::PL_END);
   Synchronized lock(this);
   if (_queues.count(spec.id)) {
      throw InvalidStateException(
          MessageFormatter::ASPrint("Queue creation failed. Queue[%1] already exists.", spec.id));
   }
   PriorityInfo* level = _priorities[spec.priority].get();
   if (!level) level = InsertPriorityInfo(spec.priority);
   level->AddMemberQueue();
   Ref<WorkQueueImpl> queue = new WorkQueueImpl(spec, kind, this, level);
   _queues.emplace(spec.id, queue);
   out = queue.Get();
}

void ThreadPoolFair::CreateSerialWorkQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) {
   CreateQueueInt(spec, WorkQueueImpl::KIND_SERIAL, out);
   out.Cast<WorkQueueImpl>()->PublishStats(PerfCounter::GetCounterRegistry());
}

void ThreadPoolFair::CreateFairWorkQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) {
   CreateQueueInt(spec, WorkQueueImpl::KIND_FAIR, out);
   out.Cast<WorkQueueImpl>()->PublishStats(PerfCounter::GetCounterRegistry());
}

void ThreadPoolFair::FindCompletionQueue(const WorkQueueSpec& spec, Ref<WorkQueue>& out) {
   {
      Synchronized lock(this);
      auto it = _queues.find(spec.id);
      if (it != _queues.end()) {
         out = it->second.Get();
         return;
      }
   }
   try {
      CreateFairWorkQueue(spec, out);
   } catch (const InvalidStateException&) {
      // Created by another thread meanwhile.
      Synchronized lock(this);
      out = _queues[spec.id].Get();
   }
}

WorkQueue* ThreadPoolFair::GetCurrentWorkQueue() {
   TlsInfo* info = GetTlsInfo();
   if (!info || !info->_queue) return nullptr;
   return info->_queue;
}

void ThreadPoolFair::ScheduleWorkItem(const Functor<>& item) { _defaultIOQueue->Enqueue(item); }

void ThreadPoolFair::ScheduleTimer(const Functor<>& callback, long long delayMicroseconds,
                                   Ref<ScheduledItem>& out) {
   Ref<TimerItem> timer = new TimerItem(this, callback, false);
   timer->Start(delayMicroseconds);
   out = timer.Get();
}

void ThreadPoolFair::TimerDone(TimerItem* timer) {
   Synchronized lock(_exitMutex.Get());
   _timers.erase(timer);
}

void ThreadPoolFair::ScheduleShrinkTimer() {
   Ref<TimerItem> timer = new TimerItem(this, [this] { HandleShrinkTimerTick(); }, true);
   {
      Synchronized lock(_exitMutex.Get());
      _shrinkTimer = timer;
   }
   timer->Start(_shrinkPeriod);
}

void ThreadPoolFair::HandleShrinkTimerTick() {
   int ticks = _shrinkTicks.Read();
   int checkTimeSecs = _threadCheckTimeSecs.load();
   if (_view) _view->Get("ThreadCheckTimeSecs", &checkTimeSecs);
   int threads = _threadCount.Read();
   if (ticks >= 0 && checkTimeSecs > 0) {
      int needed = std::max(checkTimeSecs / 10, 1);
      if (ticks < needed) {
         _shrinkTicks.CompareAndSwap(ticks, ticks + 1);
      } else if (threads - _limits.maxThreads.load() + 1 > std::max(_limits.minThreads.load(), 1)) {
         // One worker retires per tick: the one running it.
         TlsInfo* info = GetTlsInfo();
         if (info && info->_worker) info->_exit = 1;
      }
   }
   _threadCtl->CheckDescriptors(threads);
   if (!IsShuttingDown()) ScheduleShrinkTimer();
}

void ThreadPoolFair::ScheduleIOCompletion(Exception* error, int bytes,
                                          const Functor<void, Exception*, int>& callback) {
   std::shared_ptr<Exception> copy(error ? error->Clone() : nullptr);
   _defaultIOQueue->Enqueue([copy, bytes, callback] { callback(copy.get(), bytes); });
}

void ThreadPoolFair::SchedulePollable(int fd, ThreadControl::POLL_EVENT event,
                                      const Functor<>& callback, Ref<ScheduledItem>& out) {
   _pollScheduler->Schedule(fd, event, callback, out);
}

void ThreadPoolFair::ScheduleReadReady(int fd, const Functor<>& callback, Ref<ScheduledItem>& out) {
   SchedulePollable(fd, ThreadControl::POLL_EVENT_READ, callback, out);
}

void ThreadPoolFair::ScheduleWriteReady(int fd, const Functor<>& callback, Ref<ScheduledItem>& out) {
   SchedulePollable(fd, ThreadControl::POLL_EVENT_WRITE, callback, out);
}

bool ThreadPoolFair::CancelPollable(ScheduledItem* item) { return item && item->Cancel(); }

void ThreadPoolFair::EnlistThisThread() { AttachThisThread(false); }

void ThreadPoolFair::DelistThisThread() {
   TlsInfo* tlsInfo = GetTlsInfo();
   PELMORA_VERIFY(tlsInfo != NULL);
   PELMORA_VERIFY(tlsInfo->_pool != NULL);
   PELMORA_VERIFY(this == tlsInfo->_pool);
   GetThisThread()->SetTls(_tlsKey, nullptr);
}

void ThreadPoolFair::MainQueueNonEmpty() {
   Synchronized lock(_exitMutex.Get());
   _exitCondition->Broadcast();
}

void ThreadPoolFair::MainThreadRun() {
   TlsInfo* info = AttachThisThread(false);
   _runnerCount.ReadInc();
   for (;;) {
      WorkItem item;
      {
         Synchronized lock(_exitMutex.Get());
         while (!IsShuttingDown() && _mainThreadQueue->GetQueueSize() == 0) {
            _exitCondition->Wait(_exitMutex.Get());
         }
         if (IsShuttingDown()) break;
         _mainThreadQueue->PopItem(item);
      }
      info->_queue = _mainThreadQueue.Get();
      long long start = NowMicroseconds();
      item.Run();
      item.Reset();
      info->_queue = nullptr;
      _mainThreadQueue->ItemCompleted(NowMicroseconds() - start);
   }
   ThreadLeft(_runnerCount);
}

void ThreadPoolFair::ThreadRun() {
   TlsInfo* info = AttachThisThread(false);
   _runnerCount.ReadInc();
   ServeLoop(info);
   ThreadLeft(_runnerCount);
}

void ThreadPoolFair::RequestShutdown() {
   std::vector<Ref<TimerItem>> timers;
   {
      Synchronized lock(_exitMutex.Get());
      if (IsShuttingDown()) return;
      _shuttingDown.store(true, std::memory_order_release);
      for (TimerItem* timer : _timers) timers.emplace_back(timer);
      _exitCondition->Broadcast();
   }
   for (Ref<TimerItem>& timer : timers) timer->AbortWait();
   _workGuard.reset();
   _io.stop();
   _pollScheduler->Stop();
   _threadCtl->OnThreadPoolShutdown();
}

bool ThreadPoolFair::WaitShutdown(long long timeoutMicroseconds) {
   Ref<ThreadPoolFair> self(this);  // releasing the queues may drop the last other reference
   long long deadline = timeoutMicroseconds < 0 ? -1 : NowMicroseconds() + timeoutMicroseconds;
   auto remaining = [deadline] { return deadline < 0 ? -1 : std::max(deadline - NowMicroseconds(), 0LL); };
   {
      Synchronized lock(_exitMutex.Get());
      while (_threadCount.Read() > 0 || _runnerCount.Read() > 0) {
         long long left = remaining();
         if (left == 0) return false;
         _exitCondition->TimedWait(_exitMutex.Get(), left);
      }
   }
   if (!_pollScheduler->WaitStopped(remaining())) return false;
   ReleaseAll();
   return true;
}

void ThreadPoolFair::ReleaseAll() {
   std::vector<Ref<WorkQueueImpl>> queues;
   Ref<TimerItem> shrinkTimer;
   {
      Synchronized lock(this);
      if (_released) return;
      _released = true;
      // The default queues stay: callers may still hold them; closed, they drop items.
      for (auto& [id, queue] : _queues) queues.push_back(queue);
      queues.push_back(_mainThreadQueue);
   }
   // Aborted timer waits still hold their items (and so this pool) until they complete.
   for (;;) {
      std::vector<Ref<TimerItem>> timers;
      {
         Synchronized lock(_exitMutex.Get());
         for (TimerItem* timer : _timers) timers.emplace_back(timer);
         shrinkTimer = std::move(_shrinkTimer);
      }
      for (Ref<TimerItem>& timer : timers) timer->AbortWait();
      _io.restart();
      _io.poll();
      Synchronized lock(_exitMutex.Get());
      if (_timers.empty()) break;
   }
   std::vector<Ref<ThreadPoolFair>> references;
   for (Ref<WorkQueueImpl>& queue : queues) {
      references.emplace_back();
      queue->Close(references.back());
   }
}

void ThreadPoolFair::GetConfig(ThreadPoolConfig& out) {
   Synchronized lock(this);
   out.minThreads = _limits.minThreads.load();
   out.maxThreads = _limits.maxThreads.load();
   out.reservationRatio = _reservationRatio;
   out.maxConcurrency = _maxConcurrency;
   out.threadCountWarningThreshold = _threadCountWarningThreshold;
   out.threadCheckTimeSecs = _threadCheckTimeSecs.load();
   out.catchWorkItemExceptions = GetCatchWorkItemExceptions();
}

void ThreadPoolFair::SetConfig(const ThreadPoolConfig& config) {
   Synchronized lock(this);
   _limits.minThreads.store(config.minThreads);
   _limits.maxThreads.store(config.maxThreads);
   _reservationRatio = config.reservationRatio;
   _maxConcurrency = config.maxConcurrency;
   _threadCountWarningThreshold = config.threadCountWarningThreshold;
   _threadCheckTimeSecs.store(config.threadCheckTimeSecs);
   SetCatchWorkItemExceptions(config.catchWorkItemExceptions);
}

void ThreadPoolFair::GetStats(PerfCounter::LwStatsBuilder& builder) {
   std::vector<Ref<WorkQueueImpl>> queues;
   {
      Synchronized lock(this);
      for (auto& [id, queue] : _queues) queues.push_back(queue);
      if (_mainThreadQueue) queues.push_back(_mainThreadQueue);
   }
   for (Ref<WorkQueueImpl>& queue : queues) queue->GetStats(builder);
}

std::string ThreadPoolFair::ToString() const {
   return MessageFormatter::ASPrint(
       "ThreadPoolFair: threads = %1, busy = %2, min threads = %3, max threads = %4, reservation ratio = %5",
       _threadCount.Read(), _limits.busyCount.Read(), _limits.minThreads.load(),
       _limits.maxThreads.load(), _reservationRatio);
}

void CreateThreadPool(Service::Config::View* view, Ref<ThreadPool>& out) {
   Ref<ThreadControl> control;
   GetSystemFactory()->CreateThreadControl(control);
   Ref<ThreadPoolFair> pool = new ThreadPoolFair(view, control.Get());
   pool->Start();
   out = pool.Get();
}

namespace {

Ref<ThreadPool>& ProcessPool() {
   // Never destroyed: callers during static destruction still find the pool.
   static Ref<ThreadPool>* pool = new Ref<ThreadPool>();
   return *pool;
}

std::mutex& ProcessPoolMutex() {
   static std::mutex* mutex = new std::mutex();
   return *mutex;
}

}  // namespace

ThreadPool* GetThreadPool() {
   std::lock_guard<std::mutex> lock(ProcessPoolMutex());
   return ProcessPool().Get();
}

void SetThreadPool(ThreadPool* pool) {
   Ref<ThreadPool> previous;
   std::lock_guard<std::mutex> lock(ProcessPoolMutex());
   previous = std::move(ProcessPool());
   ProcessPool() = pool;
}

}  // namespace Pelmora::System
