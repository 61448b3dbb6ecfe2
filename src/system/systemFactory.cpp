// The process-wide system factory.

#include "pelmora/system/systemFactory.h"

#include "src/system/systemImpl.h"

namespace Pelmora::System {

namespace {

class SystemFactoryImpl : public SystemFactory {
public:
   void CreateBacktrace(int skipFrames, Ref<Backtrace>& out) override {
      // One more: this function. The barrier keeps this frame on the stack (no tail
      // call), so that the count of frames to skip stays right.
      CaptureBacktrace(skipFrames + 1, out);
      asm volatile("" ::: "memory");
   }
   void CreateMutex(Ref<Mutex>& out) override { CreateMutexImpl(out); }
   void CreateCondition(Ref<Condition>& out) override { CreateConditionPosix(out); }
   void CreateRWLock(int mode, Ref<RWLock>& out) override { CreateRWLockImpl(mode, out); }
   void CreateThreadControl(Ref<ThreadControl>& out) override { CreateThreadControlPosix(out); }
};

}  // namespace

SystemFactory* GetSystemFactory() {
   // Never destroyed: exceptions may be built during static destruction.
   static SystemFactoryImpl* const factory = new SystemFactoryImpl();
   return factory;
}

}  // namespace Pelmora::System
