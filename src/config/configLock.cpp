// glibc's reader/writer lock prefers readers by default; this one is told to prefer writers.

#include "src/config/configLock.h"

namespace Pelmora::Service {

ConfigLock::ConfigLock() {
   pthread_rwlockattr_t attr;
   pthread_rwlockattr_init(&attr);
   pthread_rwlockattr_setkind_np(&attr, PTHREAD_RWLOCK_PREFER_WRITER_NONRECURSIVE_NP);
   pthread_rwlock_init(&_lock, &attr);
   pthread_rwlockattr_destroy(&attr);
}

ConfigLock::~ConfigLock() { pthread_rwlock_destroy(&_lock); }

}  // namespace Pelmora::Service
