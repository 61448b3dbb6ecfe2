#pragma once
// A Stream is a byte stream (TCP, Unix-domain socket, descriptor, TLS over either) with
// at most one outstanding operation per direction. Asynchronous operations complete on
// pool threads through their callback; the synchronous forms start the operation and wait
// for it. Each direction may carry a time-out that closes the stream when one operation
// takes too long. The stream is its own lock and condition. Thread-safe.

#include <typeinfo>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logger.h"
#include "pelmora/system/address.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/lockable.h"

namespace Pelmora::System {

class PELMORA_EXPORT Stream : public virtual LockableObject, public virtual WaitableObject {
public:
   // Wait for the outstanding operation of that direction and return its byte count, or
   // throw its exception. InvalidStateException on a closed direction,
   // NotInProgressException when nothing is outstanding, InProgressException when another
   // thread already waits, TimeoutException when the timed form runs out (negative: no
   // limit).
   virtual int WaitWrite() = 0;
   virtual int WaitRead() = 0;
   virtual int TimedWaitWrite(long long microseconds) = 0;
   virtual int TimedWaitRead(long long microseconds) = 0;
   // Only on the thread running this stream's completion of that direction: whether the
   // completion was already consumed. Elsewhere WrongThreadException.
   virtual bool HasWriteCompleted() = 0;
   virtual bool HasReadCompleted() = 0;
   // Arms the time-out of one direction: an operation pending longer than about
   // `microseconds` (rounded up to whole ticks, plus one) closes the stream and logs
   // `message` at `level`. Negative disables it; a null message counts as empty.
   virtual void SetReadTimeout(long long microseconds, Service::Logger::LogLevel level,
                               const char* message) = 0;
   virtual void SetWriteTimeout(long long microseconds, Service::Logger::LogLevel level,
                                const char* message) = 0;
   // The local and peer binding when the stream has them and they are of `type` (or
   // `type` is BindingInfo itself); otherwise both are left empty.
   virtual void GetBindingInfo(const std::type_info& type, Ref<BindingInfo>& local,
                               Ref<BindingInfo>& peer) = 0;
   // As Close, for a caller that holds the stream's lock.
   virtual void CloseNoLock() = 0;
   // Writes all `length` bytes and returns `length`.
   virtual int Write(const char* buffer, int length) = 0;
   // Starts writing all `length` bytes; `buffer` must live until the callback runs.
   // The callback gets the stream and the failure (null on success).
   virtual void AsyncWrite(const char* buffer, int length,
                           const Functor<void, Stream*, Exception*>& callback) = 0;
   // Reads up to `length` bytes; 0 means end of stream.
   virtual int Read(char* buffer, int length) = 0;
   // Starts a read of up to `length` bytes; the callback gets the stream, the failure
   // (null on success) and the byte count (0: end of stream).
   virtual void AsyncRead(char* buffer, int length,
                          const Functor<void, Stream*, Exception*, int>& callback) = 0;
   // Closes both directions for good; outstanding operations complete with a failure.
   virtual void Close() = 0;
   // Whether the bytes travel encrypted (TLS); false unless a stream says otherwise.
   virtual bool IsSecure() const { return false; }
};

// The length of one time-out tick: 5 seconds, unless shortened (tests do). Applies to
// time-outs armed after the change and to the ticker's next period.
constexpr long long kStreamTimeoutTickMicroseconds = 5000000;
PELMORA_EXPORT void SetStreamTimeoutTick(long long microseconds);
PELMORA_EXPORT long long GetStreamTimeoutTick();

// Two connected streams over a Unix-domain socket pair, completing on the process's
// thread pool (GetThreadPool); for tests and in-process pipes. SystemException when the
// system refuses, InvalidStateException without a pool.
PELMORA_EXPORT void CreateStreamPair(Ref<Stream>& first, Ref<Stream>& second);

}  // namespace Pelmora::System
