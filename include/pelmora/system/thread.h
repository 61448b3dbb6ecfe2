#pragma once
// A Thread is the library's object for one operating-system thread: it holds that
// thread's TLS slots and offers sleeping and waiting on a descriptor. Threads started by
// the library are detached and never joined; their objects and TLS slots are released
// when they end. Any thread, also one the library did not start, gets its Thread from
// GetThisThread. ThreadControl starts threads and runs the wake-up pipes and polling of
// the pools' I/O loops. TLS slots of a Thread are for its own thread only; everything
// else here is thread-safe.

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::System {

using ThreadFunction = std::function<void()>;

class PELMORA_EXPORT Thread : public virtual Object {
public:
   // Sleeps the calling thread; a signal does not cut it short. Negative panics.
   virtual void Sleep(long long microseconds) = 0;
   // Whether `fd` is readable now, without waiting (see TimedWait).
   virtual bool Wait(int fd) = 0;
   // Waits for `fd` to become readable, in whole milliseconds: the time-out is cut down
   // to a multiple of 1000 microseconds, so below 1000 it does not wait, and only
   // -1000 or less waits without limit. False on time-out.
   virtual bool TimedWait(int fd, long long microseconds) = 0;
   // The object stored under `key`, null when none; the thread keeps it referenced.
   virtual Object* GetTls(int key) = 0;
   // Stores `object` under `key` (null clears), releasing the previous one.
   virtual void SetTls(int key, Object* object) = 0;
};

class PELMORA_EXPORT ThreadControl : public virtual Object {
public:
   enum POLL_EVENT {
      POLL_EVENT_READ = 1,
      POLL_EVENT_WRITE = 2,
   };

   // Whether I/O must complete on the thread that started it (never on POSIX).
   virtual bool HasIoThreadAffinity() = 0;
   // Starts a detached thread running `function` on a stack of `stackSizeKb` kilobytes.
   // Throws SystemException when the system refuses.
   virtual void StartThread(const ThreadFunction& function, long long stackSizeKb,
                            Ref<Thread>& out) = 0;
   // Hooks run by pool threads at start and end.
   virtual void InitializeThisThread() = 0;
   virtual void UninitializeThisThread() = 0;
   // Names the calling thread for the kernel (15 characters kept); a failure is logged.
   virtual void SetThreadName(const std::string& name) = 0;
   // How many descriptors one DoPoll may watch.
   virtual int GetMaxPollables() = 0;
   // A non-blocking pipe: Set makes `readFd` readable until Reset drains it. Setting
   // an already set pair is harmless.
   virtual void CreatePollableSignalPair(int& readFd, int& writeFd) = 0;
   virtual void SetPollableSignal(int writeFd) = 0;
   virtual void ResetPollableSignal(int readFd) = 0;
   // Waits without limit until one of the descriptors is ready for its event and fills
   // `readyIndices` with the positions (in `pollables`) of the ready ones, in order.
   virtual void DoPoll(const std::vector<std::pair<int, POLL_EVENT>>& pollables,
                       std::vector<int>& readyIndices) = 0;

   // A pool starting: `maxFdsPerThread` is its descriptor budget per thread (0: none).
   virtual void OnThreadPoolStartup(int maxFdsPerThread) = 0;
   // The pool shut down: the budget no longer applies.
   virtual void OnThreadPoolShutdown() = 0;
   // Counts the process's open descriptors and logs a warning when they pass the budget
   // for `threadCount` threads. Returns the count (-1 when it cannot be read).
   virtual int CheckDescriptors(int threadCount) = 0;
};

// The calling thread's object, created on first use for a thread the library did not start.
PELMORA_EXPORT Thread* GetThisThread();
// Whether the calling thread has its object yet.
PELMORA_EXPORT bool ThisThreadExists();
// The calling thread's kernel thread id.
PELMORA_EXPORT long long GetThreadId();

// A key for one TLS slot in every thread. Released keys are reused with a new version,
// so an object left behind under an old key is never returned for the new one.
PELMORA_EXPORT int ReserveTlsKey();
PELMORA_EXPORT void ReleaseTlsKey(int key);

}  // namespace Pelmora::System
