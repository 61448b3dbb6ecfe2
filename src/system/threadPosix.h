#pragma once
// The POSIX thread object: one per thread, stored under the process-wide thread key,
// which holds one reference to it until the thread ends.

#include "pelmora/system/thread.h"
#include "src/system/tls.h"

namespace Pelmora::System {

class ThreadPosix : public virtual Thread, public ObjectImpl {
public:
   // Starts a detached thread running `function` on a `stackSizeKb` kilobyte stack; the
   // caller's profiling timer is copied into it. Throws SystemException when refused.
   static void CreateThread(const ThreadFunction& function, long long stackSizeKb,
                            Ref<Thread>& out);
   // The calling thread's object without creating one (null for a thread that has none).
   static ThreadPosix* Find();

   void Sleep(long long microseconds) override;
   bool Wait(int fd) override;
   bool TimedWait(int fd, long long microseconds) override;
   Object* GetTls(int key) override { return _tls.Get(static_cast<TlsKey>(key)); }
   void SetTls(int key, Object* object) override { _tls.Set(static_cast<TlsKey>(key), object); }

   TlsObjects& GetTlsObjects() { return _tls; }

private:
   TlsObjects _tls;
};

// The calling thread's object as its implementation, created on first use.
ThreadPosix* GetThisThreadPosix();

}  // namespace Pelmora::System
