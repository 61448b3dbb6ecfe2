// The per-direction state machine of streams, their completions and time-outs.

#include "src/net/streamBase.h"

#include <algorithm>
#include <chrono>
#include <mutex>
#include <set>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/system/thread.h"
#include "pelmora/system/threadPool.h"

namespace Pelmora::System {

namespace {

std::atomic<long long> tickMicroseconds{kStreamTimeoutTickMicroseconds};

}  // namespace

void SetStreamTimeoutTick(long long microseconds) {
   PELMORA_VERIFY(microseconds > 0);
   tickMicroseconds.store(microseconds, std::memory_order_relaxed);
   TimeoutTicker::GetInstance().Rearm();
}

long long GetStreamTimeoutTick() { return tickMicroseconds.load(std::memory_order_relaxed); }

StreamBase::StreamBase(std::string description) : _description(std::move(description)) {
   _write.tlsKey = ReserveTlsKey();
   _read.tlsKey = ReserveTlsKey();
}

StreamBase::~StreamBase() {
   ReleaseTlsKey(_write.tlsKey);
   ReleaseTlsKey(_read.tlsKey);
}

bool StreamBase::TryIncRef() const {
   int count = _refCount.Read();
   while (count > 0) {
      if (_refCount.CompareAndSwap(count, count + 1)) return true;
   }
   return false;
}

void StreamBase::FinalDecRef(const std::type_info& type) {
   if (_registered.load(std::memory_order_acquire)) TimeoutTicker::GetInstance().UnregisterStream(this);
   WaitableObjectImpl::FinalDecRef(type);
}

void StreamBase::SetBindings(Ref<BindingInfo> local, Ref<BindingInfo> peer) {
   Synchronized lock(this);
   _local = std::move(local);
   _peer = std::move(peer);
}

void StreamBase::GetBindingInfo(const std::type_info& type, Ref<BindingInfo>& local,
                                Ref<BindingInfo>& peer) {
   Synchronized lock(this);
   auto fits = [&type](BindingInfo* info) {
      return info != nullptr && (type == typeid(BindingInfo) || typeid(*info) == type);
   };
   local = fits(_local.Get()) ? _local : Ref<BindingInfo>();
   peer = fits(_peer.Get()) ? _peer : Ref<BindingInfo>();
}

int StreamBase::GetState(bool isWrite) {
   Synchronized lock(this);
   return (isWrite ? _write : _read).state;
}

void StreamBase::SetCloseOnFailure(bool closeIt) {
   Synchronized lock(this);
   _write.closeOnFailure = closeIt;
   _read.closeOnFailure = closeIt;
}

void StreamBase::CheckAsyncStateBeforeIO(AsyncState& state) {
   if (state.state == STATE_CLOSED) throw InvalidStateException("Stream closed");
   if (state.state == STATE_PENDING || state.waiter) throw InProgressException();
   state.state = STATE_PENDING;
}

void StreamBase::AsyncWrite(const char* buffer, int length,
                            const Functor<void, Stream*, Exception*>& callback) {
   Synchronized lock(this);
   CheckAsyncStateBeforeIO(_write);
   _writeFun = callback;
   try {
      StartWrite(buffer, length);
   } catch (...) {
      _write.state = STATE_IDLE;
      _writeFun.Reset();
      throw;
   }
}

void StreamBase::AsyncRead(char* buffer, int length,
                           const Functor<void, Stream*, Exception*, int>& callback) {
   Synchronized lock(this);
   CheckAsyncStateBeforeIO(_read);
   _readFun = callback;
   try {
      StartRead(buffer, length);
   } catch (...) {
      _read.state = STATE_IDLE;
      _readFun.Reset();
      throw;
   }
}

int StreamBase::Write(const char* buffer, int length) {
   // Most writes fit the socket's buffer: done on this thread, without a completion to
   // hand over. The rest goes the asynchronous way.
   int written = 0;
   {
      Synchronized lock(this);
      if (_write.state == STATE_IDLE && !_write.waiter) {
         written = std::max(0, TryWriteNow(buffer, length));
         if (written == length) return length;
      }
   }
   AsyncWrite(buffer + written, length - written, Functor<void, Stream*, Exception*>());
   return written + WaitWrite();
}

int StreamBase::Read(char* buffer, int length) {
   AsyncRead(buffer, length, Functor<void, Stream*, Exception*, int>());
   return WaitRead();
}

void StreamBase::CompleteIO(bool isWrite, Exception* error, int bytes) {
   AsyncState& state = isWrite ? _write : _read;
   Ref<CompletingState> completing = new CompletingState(isWrite);
   Functor<void, Stream*, Exception*> writeFun;
   Functor<void, Stream*, Exception*, int> readFun;
   {
      Synchronized lock(this);
      state.bytes = bytes;
      state.exception.reset(error != nullptr ? error->Clone() : nullptr);
      // A closed direction stays closed; its callback still hears of the operation.
      if (state.state != STATE_CLOSED) state.state = STATE_COMPLETING;
      state.completing = completing;
      state.ticksLeft.Write(state.ticks);
      if (isWrite) {
         writeFun = std::move(_writeFun);
         _writeFun.Reset();
      } else {
         readFun = std::move(_readFun);
         _readFun.Reset();
      }
      if (state.waiter) Broadcast();
   }
   if (!writeFun && !readFun) return;  // a synchronous wait consumes it

   Thread* thread = GetThisThread();
   thread->SetTls(state.tlsKey, completing.Get());
   // The callback may drop the caller's last reference; the stream stays until we are done.
   Ref<StreamBase> self(this);
   try {
      if (isWrite) {
         writeFun(this, error);
      } else {
         readFun(this, error, bytes);
      }
   } catch (const std::exception& e) {
      Service::Logger* logger = Service::GetDefaultLogger();
      if (logger->IsLevelWanted(Service::Logger::LOG_ERROR)) {
         if (isWrite) {
            Service::LogInternal(logger, Service::Logger::LOG_ERROR,
                                 "Unexpected exception in writeFun.Invoke: %1", e.what());
         } else {
            Service::LogInternal(logger, Service::Logger::LOG_ERROR,
                                 "Unexpected exception in readFun.Invoke: %1 : %2", e.what(), bytes);
         }
      }
   }
   thread->SetTls(state.tlsKey, nullptr);
   Synchronized lock(this);
   if (state.completing == completing) {
      if (state.state == STATE_COMPLETING) state.state = STATE_IDLE;
      state.completing = nullptr;
      state.exception.reset();
   }
   completing->_consumed = true;
}

int StreamBase::WaitIOInt(AsyncState& state, bool isWrite, long long timeout) {
   std::unique_ptr<Exception> failure;
   int bytes = 0;
   {
      Synchronized lock(this);
      if (state.state == STATE_CLOSED) throw InvalidStateException("Stream closed");
      if (state.state == STATE_IDLE) throw NotInProgressException("Operation is not in progress");
      if (state.waiter) throw InProgressException();
      state.waiter = true;
      try {
         long long remaining = timeout;
         while (state.state == STATE_PENDING) {
            if (timeout < 0) {
               Wait();
               continue;
            }
            if (remaining <= 0) throw TimeoutException("Operation timed out");
            auto start = std::chrono::steady_clock::now();
            TimedWait(remaining);
            remaining -= std::chrono::duration_cast<std::chrono::microseconds>(
                             std::chrono::steady_clock::now() - start)
                             .count();
         }
         // Closed while waiting: the operation will never be handed to this waiter.
         if (state.state == STATE_CLOSED) throw InvalidStateException("Stream closed");
      } catch (...) {
         state.waiter = false;
         if (state.closeOnFailure) state.state = STATE_CLOSED;
         throw;
      }
      state.waiter = false;
      if (state.state != STATE_COMPLETING || !state.completing) {
         Service::Logger* logger = Service::GetDefaultLogger();
         if (logger->IsLevelWanted(Service::Logger::LOG_PANIC)) {
            Service::LogInternal(logger, Service::Logger::LOG_PANIC,
                                 "Unexpected state %1 completing IO", state.state);
         }
         PanicExit("Encountered unexpected state during IO completion");
      }
      state.completing->_consumed = true;
      state.state = STATE_IDLE;
      state.completing = nullptr;
      bytes = state.bytes;
      failure = std::move(state.exception);
   }
   (void)isWrite;
   if (failure) failure->Throw();
   return bytes;
}

int StreamBase::WaitWrite() { return WaitIOInt(_write, true, -1); }
int StreamBase::WaitRead() { return WaitIOInt(_read, false, -1); }
int StreamBase::TimedWaitWrite(long long microseconds) { return WaitIOInt(_write, true, microseconds); }
int StreamBase::TimedWaitRead(long long microseconds) { return WaitIOInt(_read, false, microseconds); }

bool StreamBase::HasCompleted(AsyncState& state) {
   auto* completing = dynamic_cast<CompletingState*>(GetThisThread()->GetTls(state.tlsKey));
   if (completing == nullptr) throw WrongThreadException();
   Synchronized lock(this);
   return completing->_consumed;
}

bool StreamBase::HasWriteCompleted() { return HasCompleted(_write); }
bool StreamBase::HasReadCompleted() { return HasCompleted(_read); }

void StreamBase::Close() {
   Synchronized lock(this);
   CloseNoLock();
}

void StreamBase::CloseNoLock() {
   if (_write.state == STATE_CLOSED && _read.state == STATE_CLOSED) return;
   _write.state = STATE_CLOSED;
   _read.state = STATE_CLOSED;
   CloseIo();
   Broadcast();
}

void StreamBase::SetTimeoutInt(AsyncState& state, long long microseconds,
                               Service::Logger::LogLevel level, const char* message) {
   int ticks = microseconds < 0 ? 0 : static_cast<int>(microseconds / GetStreamTimeoutTick() + 1);
   {
      Synchronized lock(this);
      state.ticks = ticks;
      state.ticksLeft.Write(ticks);
      _timeoutLevel = level;
      _timeoutMessage = message != nullptr ? message : "";
   }
   // Outside the stream's lock: the ticker takes its own lock first, then a stream's.
   if (ticks > 0 && !_registered.exchange(true, std::memory_order_acq_rel)) {
      TimeoutTicker::GetInstance().RegisterStream(this);
   }
}

void StreamBase::SetReadTimeout(long long microseconds, Service::Logger::LogLevel level,
                                const char* message) {
   SetTimeoutInt(_read, microseconds, level, message);
}

void StreamBase::SetWriteTimeout(long long microseconds, Service::Logger::LogLevel level,
                                 const char* message) {
   SetTimeoutInt(_write, microseconds, level, message);
}

bool StreamBase::TickDirection(AsyncState& state, bool isWrite, const std::string& description) {
   std::string message;
   Service::Logger::LogLevel level;
   int ticks;
   {
      Synchronized lock(this);
      if (state.state != STATE_PENDING) return false;
      int left = state.ticksLeft.Read();
      while (left >= 1 && !state.ticksLeft.CompareAndSwap(left, left - 1)) {
      }
      if (left != 1) return false;
      message = _timeoutMessage;
      level = _timeoutLevel;
      ticks = state.ticks;
   }
   Service::Logger* logger = Service::GetDefaultLogger();
   if (logger->IsLevelWanted(level)) {
      long long milliseconds = static_cast<long long>(ticks) * GetStreamTimeoutTick() / 1000;
      Service::LogInternal(logger, level, "%1%2%3 timeout after approximately %4ms. Closing stream %5",
                           message, message.empty() ? "" : " : ", isWrite ? "Write" : "Read",
                           milliseconds, description);
   }
   Close();
   return true;
}

void StreamBase::TimeoutTick(const std::string& description) {
   if (TickDirection(_write, true, description)) return;
   TickDirection(_read, false, description);
}

// The ticker.

struct TimeoutTicker::Private {
   std::mutex mutex;
   std::set<StreamBase*> streams;
   Ref<ScheduledItem> timer;
   ThreadPool* pool = nullptr;  // the pool the timer runs on
   bool armed = false;
};

TimeoutTicker& TimeoutTicker::GetInstance() {
   static TimeoutTicker* instance = [] {
      auto* ticker = new TimeoutTicker();
      ticker->_private = new Private();
      return ticker;
   }();
   return *instance;
}

void TimeoutTicker::RegisterStream(StreamBase* stream) {
   std::lock_guard<std::mutex> lock(_private->mutex);
   _private->streams.insert(stream);
   ArmLocked();
}

void TimeoutTicker::UnregisterStream(StreamBase* stream) {
   std::lock_guard<std::mutex> lock(_private->mutex);
   _private->streams.erase(stream);
}

int TimeoutTicker::GetStreamCount() {
   std::lock_guard<std::mutex> lock(_private->mutex);
   return static_cast<int>(_private->streams.size());
}

void TimeoutTicker::ArmLocked() {
   ThreadPool* pool = GetThreadPool();
   // A new pool (tests make one after another) gets the timer even when an old one had it.
   if (pool == nullptr || pool->IsShuttingDown()) return;
   if (_private->armed && _private->pool == pool) return;
   _private->armed = true;
   _private->pool = pool;
   pool->ScheduleTimer([this] { Fire(); }, GetStreamTimeoutTick(), _private->timer);
}

void TimeoutTicker::Rearm() {
   std::lock_guard<std::mutex> lock(_private->mutex);
   if (_private->armed && _private->timer && _private->timer->Cancel()) _private->armed = false;
   if (!_private->streams.empty()) ArmLocked();
}

void TimeoutTicker::Fire() {
   {
      std::lock_guard<std::mutex> lock(_private->mutex);
      _private->armed = false;
   }
   Tick();
   std::lock_guard<std::mutex> lock(_private->mutex);
   if (!_private->streams.empty()) ArmLocked();
}

void TimeoutTicker::Tick() {
   // References taken under the lock keep each stream alive through its tick, which runs
   // outside the lock so that closing a stream cannot wait for the ticker.
   std::vector<Ref<StreamBase>> streams;
   {
      std::lock_guard<std::mutex> lock(_private->mutex);
      streams.reserve(_private->streams.size());
      for (StreamBase* stream : _private->streams) {
         if (!stream->TryIncRef()) continue;
         streams.emplace_back(stream);
         stream->DecRef();
      }
   }
   for (const Ref<StreamBase>& stream : streams) stream->TimeoutTick(stream->ToString());
}

}  // namespace Pelmora::System
