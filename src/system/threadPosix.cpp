// Threads: detached creation with a chosen stack, the thread key whose destructor
// releases a thread's objects, sleeping and waiting on a descriptor.

#include "src/system/threadPosix.h"

#include <errno.h>
#include <poll.h>
#include <pthread.h>
#include <sys/time.h>
#include <time.h>
#include <unistd.h>

#include <cxxabi.h>

#include <climits>
#include <exception>
#include <memory>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"

namespace Pelmora::System {

namespace {

struct StartRecord {
   ThreadFunction function;
   Ref<ThreadPosix> thread;
   itimerval profilingTimer;
};

// Runs as the key's destructor when a thread that has an object ends.
void CleanupThisThread(void* value);

pthread_key_t ThreadKey() {
   // Created once and never deleted: threads may end at any time until the process does.
   static const pthread_key_t key = [] {
      pthread_key_t created;
      int error = pthread_key_create(&created, CleanupThisThread);
      PELMORA_VERIFY(0 == error);
      return created;
   }();
   return key;
}

void StoreThisThread(ThreadPosix* thread) {
   thread->IncRef();  // the key's reference
   int error = pthread_setspecific(ThreadKey(), thread);
   PELMORA_VERIFY(0 == error);
}

void CleanupThisThread(void* value) {
   ThreadPosix* thread = static_cast<ThreadPosix*>(value);
   // The system cleared the key before calling us; the objects being released may still
   // look up their thread, so it stays findable until they are gone.
   pthread_setspecific(ThreadKey(), value);
   thread->GetTlsObjects().Clear();
   pthread_setspecific(ThreadKey(), nullptr);
   thread->DecRef();
}

// An exception leaving a thread's function would reach std::terminate with no report.
void RunToTheEnd(const ThreadFunction& function) {
   try {
      function();
   } catch (abi::__forced_unwind&) {
      throw;  // cancellation unwinds through here and must go on
   } catch (const Throwable& e) {
      PanicExit(e);
   } catch (const std::exception& e) {
      Panic("Exception escaped a thread: %s", e.what());
   } catch (...) {
      Panic("Exception of unknown type escaped a thread");
   }
}

void* StartRoutine(void* argument) {
   std::unique_ptr<StartRecord> record(static_cast<StartRecord*>(argument));
   setitimer(ITIMER_PROF, &record->profilingTimer, nullptr);
   StoreThisThread(record->thread.Get());
   if (!record->function) PanicVerify("!IsNull()", __FILE__, __LINE__);
   RunToTheEnd(record->function);
   record.reset();
   return nullptr;
}

class ThreadAttributes {
public:
   ThreadAttributes() {
      int error = pthread_attr_init(&_attributes);
      if (error != 0) throw SystemException(error);
   }
   ~ThreadAttributes() { pthread_attr_destroy(&_attributes); }
   ThreadAttributes(const ThreadAttributes&) = delete;
   ThreadAttributes& operator=(const ThreadAttributes&) = delete;
   pthread_attr_t* Get() { return &_attributes; }

private:
   pthread_attr_t _attributes;
};

}  // namespace

void ThreadPosix::CreateThread(const ThreadFunction& function, long long stackSizeKb,
                               Ref<Thread>& out) {
   Ref<ThreadPosix> thread = new ThreadPosix();
   auto record = std::make_unique<StartRecord>(StartRecord{function, thread, {}});
   // Profiling timers are per thread: without a copy, a profiled process would see
   // nothing of the threads it starts.
   getitimer(ITIMER_PROF, &record->profilingTimer);

   ThreadAttributes attributes;
   int error = pthread_attr_setstacksize(attributes.Get(), static_cast<size_t>(stackSizeKb) * 1024);
   if (error != 0) throw SystemException(error);
   pthread_t id;
   error = pthread_create(&id, attributes.Get(), StartRoutine, record.get());
   if (error != 0) throw SystemException(error);
   record.release();  // the new thread's now
   error = pthread_detach(id);
   if (error != 0) throw SystemException(error);
   out = thread;
}

ThreadPosix* ThreadPosix::Find() {
   return static_cast<ThreadPosix*>(pthread_getspecific(ThreadKey()));
}

void ThreadPosix::Sleep(long long microseconds) {
   PELMORA_VERIFY(microseconds >= 0);
   timespec remaining;
   remaining.tv_sec = microseconds / 1000000;
   remaining.tv_nsec = (microseconds % 1000000) * 1000;
   while (nanosleep(&remaining, &remaining) != 0) {
      PELMORA_VERIFY(EINTR == errno);
   }
}

bool ThreadPosix::Wait(int fd) {
   return TimedWait(fd, -1);
}

bool ThreadPosix::TimedWait(int fd, long long microseconds) {
   // Whole milliseconds, truncated toward zero: -1 polls once without waiting, and only
   // -1000 or less waits without limit. Callers rely on both.
   long long milliseconds = microseconds / 1000;
   int timeout = milliseconds > INT_MAX ? INT_MAX
                 : milliseconds < 0     ? -1
                                        : static_cast<int>(milliseconds);
   pollfd entry = {fd, POLLIN, 0};
   for (;;) {
      int ready = poll(&entry, 1, timeout);
      if (ready > 0) return true;
      if (ready == 0) return false;
      if (errno != EINTR) throw SystemException(errno);
   }
}

ThreadPosix* GetThisThreadPosix() {
   if (ThreadPosix* thread = ThreadPosix::Find()) return thread;
   // A thread the library did not start: its object is made here and lives until it ends.
   Ref<ThreadPosix> thread = new ThreadPosix();
   StoreThisThread(thread.Get());
   return thread.Get();
}

Thread* GetThisThread() {
   return GetThisThreadPosix();
}

bool ThisThreadExists() {
   return ThreadPosix::Find() != nullptr;
}

long long GetThreadId() {
   return gettid();
}

}  // namespace Pelmora::System
