#pragma once
// The configuration tree's reader/writer lock. Writers go first: once a writer waits, new
// readers queue behind it, so a daemon whose threads read settings all the time can still
// apply a change. Read locks are not recursive. Thread-safe; meets SharedMutex.

#include <pthread.h>

namespace Pelmora::Service {

class ConfigLock {
public:
   ConfigLock();
   ~ConfigLock();
   ConfigLock(const ConfigLock&) = delete;
   ConfigLock& operator=(const ConfigLock&) = delete;

   void lock() { pthread_rwlock_wrlock(&_lock); }
   void unlock() { pthread_rwlock_unlock(&_lock); }
   void lock_shared() { pthread_rwlock_rdlock(&_lock); }
   void unlock_shared() { pthread_rwlock_unlock(&_lock); }
   // False when a writer holds the lock or waits for it.
   bool try_lock_shared() { return pthread_rwlock_tryrdlock(&_lock) == 0; }

private:
   pthread_rwlock_t _lock;
};

}  // namespace Pelmora::Service
