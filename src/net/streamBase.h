#pragma once
// StreamBase holds what every stream shares: the two per-direction state records that
// turn asynchronous completions into synchronous waits, the completion invocation and the
// read and write time-outs counted by the process-wide ticker. A concrete stream starts
// and closes its transport (StartRead, StartWrite, CloseIo) and reports each finished
// operation through CompleteIO. One mutex per stream guards both directions.

#include <memory>
#include <string>

#include "pelmora/object/atomic.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/stream.h"

namespace Pelmora::System {

class StreamBase : public virtual Stream, public WaitableObjectImpl {
public:
   enum AsyncStateValue { STATE_IDLE = 0, STATE_PENDING = 1, STATE_COMPLETING = 2, STATE_CLOSED = 3 };

   // Made for each finished operation; consumed once a wait or the completion path took it.
   class CompletingState : public ObjectImpl {
   public:
      explicit CompletingState(bool isWrite) : _isWrite(isWrite) {}
      bool _isWrite;
      bool _consumed = false;
   };

   struct AsyncState {
      int state = STATE_IDLE;
      int bytes = 0;
      Ref<CompletingState> completing;
      int tlsKey = 0;  // marks the thread running this direction's completion
      std::unique_ptr<Exception> exception;
      bool waiter = false;
      bool closeOnFailure = false;
      int ticks = 0;
      Atomic<int> ticksLeft{0};
   };

   explicit StreamBase(std::string description);
   ~StreamBase() override;

   int WaitWrite() override;
   int WaitRead() override;
   int TimedWaitWrite(long long microseconds) override;
   int TimedWaitRead(long long microseconds) override;
   bool HasWriteCompleted() override;
   bool HasReadCompleted() override;
   void SetReadTimeout(long long microseconds, Service::Logger::LogLevel level,
                       const char* message) override;
   void SetWriteTimeout(long long microseconds, Service::Logger::LogLevel level,
                        const char* message) override;
   void GetBindingInfo(const std::type_info& type, Ref<BindingInfo>& local,
                       Ref<BindingInfo>& peer) override;
   void CloseNoLock() override;
   int Write(const char* buffer, int length) override;
   void AsyncWrite(const char* buffer, int length,
                   const Functor<void, Stream*, Exception*>& callback) override;
   int Read(char* buffer, int length) override;
   void AsyncRead(char* buffer, int length,
                  const Functor<void, Stream*, Exception*, int>& callback) override;
   void Close() override;

   using ObjectImpl::ToString;
   // The stream's description: its kind and ends.
   std::string ToString() const override { return _description; }

   // One tick of the ticker: the write direction first, then the read direction.
   void TimeoutTick(const std::string& description);
   // When a failed wait closes its direction (a time-out of a synchronous wait).
   void SetCloseOnFailure(bool closeIt);
   // Takes a reference unless the count already reached 0 (the object is dying).
   bool TryIncRef() const;

   // For tests: the state of one direction.
   int GetState(bool isWrite);
   int GetTicksLeft(bool isWrite) { return (isWrite ? _write : _read).ticksLeft.Read(); }

protected:
   // Start the transport's operation; never complete inline. Called with the lock held.
   virtual void StartRead(char* buffer, int length) = 0;
   virtual void StartWrite(const char* buffer, int length) = 0;
   // Writes what the transport takes at once without blocking; -1 where it cannot try
   // (the asynchronous path then does all). Called with the lock held, direction idle.
   virtual int TryWriteNow(const char* buffer, int length) {
      (void)buffer;
      (void)length;
      return -1;
   }
   // Closes the transport so that outstanding operations finish. Called with the lock held.
   virtual void CloseIo() = 0;
   // The transport finished an operation of that direction (`error` null on success).
   void CompleteIO(bool isWrite, Exception* error, int bytes);
   // Runs `start` with the lock held as the write direction's operation (a file sent by
   // the transport, say): the write time-out and Close apply to it as to a write, and it
   // ends through CompleteIO(true, ...), which calls `callback`.
   template <class Start>
   void AsyncWriteOperation(Start&& start, const Functor<void, Stream*, Exception*>& callback) {
      Synchronized lock(this);
      CheckAsyncStateBeforeIO(_write);
      _writeFun = callback;
      try {
         start();
      } catch (...) {
         _write.state = STATE_IDLE;
         _writeFun.Reset();
         throw;
      }
   }

   void SetBindings(Ref<BindingInfo> local, Ref<BindingInfo> peer);
   void FinalDecRef(const std::type_info& type) override;

private:
   void CheckAsyncStateBeforeIO(AsyncState& state);
   int WaitIOInt(AsyncState& state, bool isWrite, long long timeout);
   bool HasCompleted(AsyncState& state);
   void SetTimeoutInt(AsyncState& state, long long microseconds, Service::Logger::LogLevel level,
                      const char* message);
   // True when the direction timed out in this tick.
   bool TickDirection(AsyncState& state, bool isWrite, const std::string& description);

   AsyncState _write;
   AsyncState _read;
   Functor<void, Stream*, Exception*> _writeFun;
   Functor<void, Stream*, Exception*, int> _readFun;
   Service::Logger::LogLevel _timeoutLevel = Service::Logger::LOG_WARNING;
   std::string _timeoutMessage;
   std::atomic<bool> _registered{false};
   const std::string _description;
   Ref<BindingInfo> _local;
   Ref<BindingInfo> _peer;
};

// The process-wide time-out ticker: every tick it calls TimeoutTick of each registered
// stream. Created on first use, never destroyed; runs its timer on the process's pool.
class TimeoutTicker {
public:
   static TimeoutTicker& GetInstance();
   void RegisterStream(StreamBase* stream);
   void UnregisterStream(StreamBase* stream);
   // Restarts the timer with the current tick length.
   void Rearm();
   // One tick now, on the calling thread.
   void Tick();
   int GetStreamCount();

private:
   TimeoutTicker() = default;
   void ArmLocked();
   void Fire();

   struct Private;
   Private* _private = nullptr;
};

}  // namespace Pelmora::System
