// Polling threads of the pool's descriptor waits.

#include "src/pool/pollScheduler.h"

#include <unistd.h>

#include <atomic>
#include <utility>

#include "pelmora/exception/panic.h"
#include "pelmora/system/systemFactory.h"

namespace Pelmora::System {

namespace {

enum PollState { WAITING = 0, FIRED = 1, CANCELLED = 2, RUNNING = 3 };

}  // namespace

class PollItem : public virtual ScheduledItem, public ObjectImpl {
public:
   PollItem(int fd, ThreadControl::POLL_EVENT event, const Functor<>& callback)
       : _fd(fd), _event(event), _callback(callback) {}

   bool Cancel() override;
   bool IsCancelled() const override { return _state.load() == CANCELLED; }

   // The callback runs unless the wait was cancelled first.
   void Run() {
      int expected = FIRED;
      if (_state.compare_exchange_strong(expected, RUNNING)) _callback();
   }
   bool Fire() {
      int expected = WAITING;
      return _state.compare_exchange_strong(expected, FIRED);
   }

   const int _fd;
   const ThreadControl::POLL_EVENT _event;
   PollThread* _owner = nullptr;

private:
   Functor<> _callback;
   std::atomic<int> _state{WAITING};
};

class PollThread : public LockableObjectImpl {
public:
   explicit PollThread(PollScheduler* scheduler)
       : _scheduler(scheduler), _threadCtl(scheduler->_threadCtl.Get()) {
      _threadCtl->CreatePollableSignalPair(_readFd, _writeFd);
   }
   ~PollThread() override {
      close(_readFd);
      close(_writeFd);
   }

   // Under the scheduler's lock. False when the thread is full.
   bool Add(PollItem* item) {
      Synchronized lock(this);
      if (_stop || static_cast<int>(_items.size()) + 1 >= _threadCtl->GetMaxPollables())
         return false;
      item->_owner = this;
      _items.emplace(item, item);
      _threadCtl->SetPollableSignal(_writeFd);
      return true;
   }

   void Remove(PollItem* item) {
      Ref<PollItem> keep;  // released outside the lock
      Synchronized lock(this);
      auto it = _items.find(item);
      if (it == _items.end()) return;
      keep = std::move(it->second);
      _items.erase(it);
      _threadCtl->SetPollableSignal(_writeFd);
   }

   void Stop() {
      Synchronized lock(this);
      _stop = true;
      _threadCtl->SetPollableSignal(_writeFd);
   }

   void Run() {
      ThreadControl* control = _threadCtl;
      control->SetThreadName(_scheduler->_threadName);
      std::vector<std::pair<int, ThreadControl::POLL_EVENT>> vecHandles;
      std::vector<Ref<PollItem>> polled;
      std::vector<int> ready;
      for (;;) {
         vecHandles.clear();
         polled.clear();
         {
            Synchronized lock(this);
            if (_stop) break;
            vecHandles.emplace_back(_readFd, ThreadControl::POLL_EVENT_READ);
            for (auto& [item, ref] : _items) {
               vecHandles.emplace_back(item->_fd, item->_event);
               polled.push_back(ref);
            }
         }
         PELMORA_VERIFY((int) vecHandles.size() <= _threadCtl->GetMaxPollables());
         control->DoPoll(vecHandles, ready);
         for (int index : ready) {
            if (index == 0) {
               control->ResetPollableSignal(_readFd);
               continue;
            }
            PollItem* item = polled[index - 1].Get();
            bool registered;
            {
               Synchronized lock(this);
               registered = _items.erase(item) != 0;
            }
            if (!registered || !item->Fire()) continue;
            Ref<PollItem> keep(item);
            _scheduler->_post(Functor<>([keep] { keep->Run(); }));
         }
      }
      Synchronized lock(this);
      _items.clear();
   }

private:
   PollScheduler* const _scheduler;
   ThreadControl* const _threadCtl;
   int _readFd = -1;
   int _writeFd = -1;
   std::map<PollItem*, Ref<PollItem>> _items;
   bool _stop = false;
};

bool PollItem::Cancel() {
   int expected = WAITING;
   if (!_state.compare_exchange_strong(expected, CANCELLED)) {
      expected = FIRED;
      if (!_state.compare_exchange_strong(expected, CANCELLED)) return false;
   }
   if (_owner) _owner->Remove(this);
   return true;
}

PollScheduler::PollScheduler(ThreadControl* threadControl, Functor<void, const Functor<>&> post,
                             long long stackSizeKb, std::string threadName)
    : _threadCtl(threadControl), _post(std::move(post)), _stackSizeKb(stackSizeKb),
      _threadName(std::move(threadName)) {
   GetSystemFactory()->CreateMutex(_mutex);
   GetSystemFactory()->CreateCondition(_exited);
}

PollScheduler::~PollScheduler() = default;

void PollScheduler::Schedule(int fd, ThreadControl::POLL_EVENT event, const Functor<>& callback,
                             Ref<ScheduledItem>& out) {
   Ref<PollItem> item = new PollItem(fd, event, callback);
   Synchronized lock(_mutex.Get());
   if (_stopped) {
      out = item.Get();  // never fires
      return;
   }
   for (Ref<PollThread>& thread : _threads) {
      if (thread->Add(item.Get())) {
         out = item.Get();
         return;
      }
   }
   Ref<PollThread> thread = new PollThread(this);
   thread->Add(item.Get());
   Ref<Thread> started;
   _threadCount.ReadInc();
   Ref<PollScheduler> self(this);
   try {
      _threadCtl->StartThread(
          [self, thread] {
             thread->Run();
             self->ThreadLeft();
          },
          _stackSizeKb, started);
   } catch (...) {
      _threadCount.ReadDec();
      throw;
   }
   _threads.push_back(thread);
   out = item.Get();
}

void PollScheduler::Stop() {
   Synchronized lock(_mutex.Get());
   _stopped = true;
   for (Ref<PollThread>& thread : _threads) thread->Stop();
}

void PollScheduler::ThreadLeft() {
   Synchronized lock(_mutex.Get());
   if (_threadCount.ReadDec() == 1) _exited->Broadcast();
}

bool PollScheduler::WaitStopped(long long timeoutMicroseconds) {
   Synchronized lock(_mutex.Get());
   while (_threadCount.Read() > 0) {
      if (!_exited->TimedWait(_mutex.Get(), timeoutMicroseconds)) return _threadCount.Read() == 0;
   }
   _threads.clear();
   return true;
}

}  // namespace Pelmora::System
