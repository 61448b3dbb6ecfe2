// The child-process reaper: a thread that collects exited children and keeps their status.

#include <sys/wait.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

namespace {

class ChildReaperImpl : public virtual ChildReaper, public ObjectImpl {
public:
   explicit ChildReaperImpl(int idlePollMs) : _idlePoll(idlePollMs > 0 ? idlePollMs : 1) {
      _thread = std::thread([this] { Loop(); });
   }
   ~ChildReaperImpl() override { Stop(); }

   void NotifyChildStarted() override {
      {
         std::lock_guard<std::mutex> lock(_mutex);
         _wakeRequested = true;
      }
      _wake.notify_all();
   }

   bool TakeStatus(int pid, int& status) override {
      std::lock_guard<std::mutex> lock(_mutex);
      return TakeLocked(pid, status);
   }

   bool WaitStatus(int pid, int timeoutMs, int& status) override {
      std::unique_lock<std::mutex> lock(_mutex);
      // While someone waits, the loop looks every millisecond instead of every idle poll.
      ++_waiters;
      _wakeRequested = true;
      _wake.notify_all();
      auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
      bool found = TakeLocked(pid, status);
      while (!found && _reaped.wait_until(lock, deadline) != std::cv_status::timeout) {
         found = TakeLocked(pid, status);
      }
      if (!found) found = TakeLocked(pid, status);
      --_waiters;
      return found;
   }

   void Stop() override {
      std::thread thread;
      {
         std::lock_guard<std::mutex> lock(_mutex);
         _stopping = true;
         thread = std::move(_thread);
      }
      _wake.notify_all();
      if (thread.joinable()) thread.join();
   }

private:
   bool TakeLocked(int pid, int& status) {
      auto it = _statuses.find(pid);
      if (it == _statuses.end()) return false;
      status = it->second;
      _statuses.erase(it);
      return true;
   }

   void Loop() {
      std::unique_lock<std::mutex> lock(_mutex);
      while (!_stopping) {
         lock.unlock();
         int status = 0;
         pid_t pid = waitpid(-1, &status, WNOHANG);
         lock.lock();
         if (pid > 0) {
            _statuses[pid] = status;
            _reaped.notify_all();
            continue;  // others may have exited too
         }
         auto period = _waiters > 0 ? std::chrono::milliseconds(1) : _idlePoll;
         _wake.wait_for(lock, period, [this] { return _stopping || _wakeRequested; });
         _wakeRequested = false;
      }
   }

   const std::chrono::milliseconds _idlePoll;
   std::mutex _mutex;
   std::condition_variable _wake;
   std::condition_variable _reaped;
   bool _stopping = false;
   bool _wakeRequested = false;
   int _waiters = 0;
   std::map<int, int> _statuses;
   std::thread _thread;
};

std::mutex g_reaperMutex;
Ref<ChildReaper>& ProcessReaper() {
   static Ref<ChildReaper>* const reaper = new Ref<ChildReaper>();
   return *reaper;
}

}  // namespace

// The first reaper of the process becomes the application's; each stopped reaper leaves.
void CreateChildReaper(int idlePollMs, Ref<ChildReaper>& out) {
   Ref<ChildReaper> reaper = new ChildReaperImpl(idlePollMs);
   {
      std::lock_guard<std::mutex> lock(g_reaperMutex);
      if (!ProcessReaper()) ProcessReaper() = reaper;
   }
   out = reaper;
}

ChildReaper* GetChildReaper() {
   std::lock_guard<std::mutex> lock(g_reaperMutex);
   return ProcessReaper().Get();
}

void ReleaseChildReaper() {
   Ref<ChildReaper> reaper;
   {
      std::lock_guard<std::mutex> lock(g_reaperMutex);
      reaper = std::move(ProcessReaper());
   }
   if (reaper) reaper->Stop();
}

}  // namespace Pelmora::Service
