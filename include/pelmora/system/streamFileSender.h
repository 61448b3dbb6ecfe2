#pragma once
// A FileSender is a stream that can send a file's bytes from the kernel's page cache
// (sendfile) without copying them through user space; plain TCP streams offer it, TLS
// and Unix-domain streams do not. Sending counts as one write of the stream: the write
// time-out applies and Close ends it. Thread-safe like the stream.

#include "pelmora/object/export.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/stream.h"

namespace Pelmora::System {

class PELMORA_EXPORT FileSender : public virtual Object {
public:
   // Whether SendFile works on this stream now (a wrapper may front a stream that cannot).
   virtual bool CanSendFile() = 0;
   // Sends what the stream takes at once, without waiting: the bytes of the open file `fd`
   // from `offset`, at most `length`; 0 when the stream is full or the file ended. Only
   // while no write is outstanding. `fd`'s own position is left alone.
   virtual long long TrySendFile(int fd, long long offset, long long length) = 0;
   // Sends `length` bytes of `fd` from `offset` as one write of the stream, waiting for
   // room on the stream's I/O service, never on a thread. `callback` gets the failure
   // (null on success) and the bytes sent, fewer only when the file ended first; it never
   // runs before this returns. `fd` must stay open until then.
   virtual void AsyncSendFile(int fd, long long offset, long long length,
                              const Functor<void, Stream*, Exception*, long long>& callback) = 0;
   // As AsyncSendFile, waiting for the outcome: the bytes sent, or the failure thrown.
   virtual long long SendFile(int fd, long long offset, long long length) = 0;
};

}  // namespace Pelmora::System
