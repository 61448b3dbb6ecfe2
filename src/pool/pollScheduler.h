#pragma once
// Descriptor waits of the pool: polling threads, each waiting with ThreadControl::DoPoll
// on its registered descriptors and on its own signal pair, which wakes it to take new
// registrations and cancellations. A wait fires once: its callback is handed to the
// pool's default queue. Thread-safe.

#include <map>
#include <string>
#include <vector>

#include "pelmora/object/atomic.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/thread.h"
#include "pelmora/system/workQueue.h"

namespace Pelmora::System {

class PollThread;

class PollScheduler : public ObjectImpl {
public:
   // `post` hands a fired callback to the pool.
   PollScheduler(ThreadControl* threadControl, Functor<void, const Functor<>&> post,
                 long long stackSizeKb, std::string threadName);
   ~PollScheduler() override;

   void Schedule(int fd, ThreadControl::POLL_EVENT event, const Functor<>& callback,
                 Ref<ScheduledItem>& out);
   // Tells every polling thread to leave; pending waits are dropped.
   void Stop();
   // Up to `timeoutMicroseconds` (negative: no limit) for the threads to leave.
   bool WaitStopped(long long timeoutMicroseconds);
   int GetThreadCount() const { return _threadCount.Read(); }

private:
   friend class PollThread;
   void ThreadLeft();

   Ref<ThreadControl> _threadCtl;
   Functor<void, const Functor<>&> _post;
   const long long _stackSizeKb;
   const std::string _threadName;
   Ref<Mutex> _mutex;
   Ref<Condition> _exited;
   std::vector<Ref<PollThread>> _threads;
   bool _stopped = false;
   Atomic<int32_t> _threadCount{0};
};

}  // namespace Pelmora::System
