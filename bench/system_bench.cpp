// Locks and conditions against their peers: MutexImpl and the embedded NativeMutex against
// std::mutex, RWLockImpl read holds against pthread_rwlock_t, and a two-thread Condition
// ping-pong against std::condition_variable.

#include <pthread.h>

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "pelmora/pelmora.h"
#include "src/internal/nativeMutex.h"
#include "support/ratioMain.h"

using namespace Pelmora;
using namespace Pelmora::System;

namespace {

void BM_MutexImplLockUnlock(benchmark::State& state) {
   Ref<Mutex> mutex;
   GetSystemFactory()->CreateMutex(mutex);
   for (auto _ : state) {
      mutex->Lock();
      mutex->Unlock();
   }
}
BENCHMARK(BM_MutexImplLockUnlock);

// The mutex the library's objects embed, owner check included.
void BM_NativeMutexLockUnlock(benchmark::State& state) {
   NativeMutex mutex;
   for (auto _ : state) {
      mutex.Lock();
      mutex.Unlock();
   }
}
BENCHMARK(BM_NativeMutexLockUnlock);

void BM_StdMutexLockUnlock(benchmark::State& state) {
   std::mutex mutex;
   for (auto _ : state) {
      mutex.lock();
      mutex.unlock();
   }
}
BENCHMARK(BM_StdMutexLockUnlock);

void BM_RWLockImplReadLockUnlock(benchmark::State& state) {
   Ref<RWLock> lock;
   GetSystemFactory()->CreateRWLock(RWLockableObject::LOCK_MODE_WRITER_PRIORITY, lock);
   for (auto _ : state) {
      lock->ReadLock();
      lock->Unlock();
   }
}
BENCHMARK(BM_RWLockImplReadLockUnlock);

void BM_PthreadRWLockReadLockUnlock(benchmark::State& state) {
   pthread_rwlock_t lock = PTHREAD_RWLOCK_INITIALIZER;
   for (auto _ : state) {
      pthread_rwlock_rdlock(&lock);
      pthread_rwlock_unlock(&lock);
   }
   pthread_rwlock_destroy(&lock);
}
BENCHMARK(BM_PthreadRWLockReadLockUnlock);

// One iteration is a round trip: the partner answers every ball the measuring thread serves.
void BM_ConditionPingPong(benchmark::State& state) {
   Ref<Mutex> mutex;
   Ref<Condition> condition;
   GetSystemFactory()->CreateMutex(mutex);
   GetSystemFactory()->CreateCondition(condition);
   int turn = 0;  // 1: the partner's
   bool stop = false;
   std::thread partner([&] {
      Synchronized lock(mutex.Get());
      for (;;) {
         while (turn != 1 && !stop) condition->Wait(mutex.Get());
         if (stop) return;
         turn = 0;
         condition->Signal();
      }
   });
   for (auto _ : state) {
      Synchronized lock(mutex.Get());
      turn = 1;
      condition->Signal();
      while (turn != 0) condition->Wait(mutex.Get());
   }
   {
      Synchronized lock(mutex.Get());
      stop = true;
      condition->Signal();
   }
   partner.join();
}
BENCHMARK(BM_ConditionPingPong)->UseRealTime();

void BM_StdConditionVariablePingPong(benchmark::State& state) {
   std::mutex mutex;
   std::condition_variable condition;
   int turn = 0;
   bool stop = false;
   std::thread partner([&] {
      std::unique_lock<std::mutex> lock(mutex);
      for (;;) {
         condition.wait(lock, [&] { return turn == 1 || stop; });
         if (stop) return;
         turn = 0;
         condition.notify_one();
      }
   });
   for (auto _ : state) {
      std::unique_lock<std::mutex> lock(mutex);
      turn = 1;
      condition.notify_one();
      condition.wait(lock, [&] { return turn == 0; });
   }
   {
      std::lock_guard<std::mutex> lock(mutex);
      stop = true;
      condition.notify_one();
   }
   partner.join();
}
BENCHMARK(BM_StdConditionVariablePingPong)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(
       argc, argv,
       {{"BM_MutexImplLockUnlock", "BM_StdMutexLockUnlock"},
        {"BM_NativeMutexLockUnlock", "BM_StdMutexLockUnlock"},
        {"BM_RWLockImplReadLockUnlock", "BM_PthreadRWLockReadLockUnlock"},
        {"BM_ConditionPingPong/real_time", "BM_StdConditionVariablePingPong/real_time"}});
}
