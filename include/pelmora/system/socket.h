#pragma once
// Sockets that yield Streams: a ServerSocket listens on a TCP port or a Unix-domain path
// and accepts connections asynchronously (or waiting, with a time-out); the connection
// factories open a client stream with a time-out. Descriptor streams wrap standard input
// and output or pipes. Sockets are close-on-exec. Everything here is thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/stream.h"
#include "pelmora/system/workQueue.h"

namespace Pelmora::System {

struct PELMORA_EXPORT ServerSocketOptions {
   int backlog = 128;
   // TCP: SO_REUSEADDR, so a restarted service binds while old connections linger.
   // Unix-domain: a socket file nobody listens on is removed before binding.
   bool reuseAddress = true;
   // Where accepted streams run their completions; null: the pool thread of the I/O.
   Ref<WorkQueue> completionQueue;
   // TLS server sockets: a handshake taking longer fails the accept (negative: no limit).
   long long handshakeTimeoutMicroseconds = 30000000;
   // TLS server sockets keep accepting while handshakes run, so that a silent client
   // holds up nobody else. This bounds connections in handshake plus finished ones not
   // yet taken by AsyncAccept or Accept; at the bound the socket stops taking
   // connections and the backlog holds the rest. Values below 1 count as 1.
   int maxPendingAccepts = 64;
};

class PELMORA_EXPORT ServerSocket : public virtual Object {
public:
   // Starts accepting one connection; the callback gets this socket, the failure (null on
   // success) and the new stream (null on failure). One accept at a time:
   // InProgressException otherwise, InvalidStateException after Close.
   virtual void AsyncAccept(const Functor<void, ServerSocket*, Exception*, Stream*>& callback) = 0;
   // Waits up to `microseconds` (negative: no limit) for one connection; TimeoutException
   // "Operation timed out" when none came.
   virtual void Accept(long long microseconds, Ref<Stream>& out) = 0;
   // Where the socket listens (the port chosen by the system when 0 was asked).
   virtual void GetBindingInfo(Ref<BindingInfo>& local) = 0;
   // Stops listening; an outstanding accept completes with a failure.
   virtual void Close() = 0;
};

// Listens on `host` (a name or numeric IPv4/IPv6 address; empty: every IPv4 address)
// and `port` (0: chosen by the system). SystemException when binding fails,
// NotFoundException when `host` does not resolve.
PELMORA_EXPORT void CreateTcpServerSocket(const std::string& host, int port,
                                          const ServerSocketOptions& options, Ref<ServerSocket>& out);
// Listens on the Unix-domain socket `path`.
PELMORA_EXPORT void CreateLocalServerSocket(const std::string& path, const ServerSocketOptions& options,
                                            Ref<ServerSocket>& out);

// Connects to `host`:`port`, trying each resolved address in turn, within
// `timeoutMicroseconds` (negative: no limit) in all. TimeoutException "Operation timed
// out", SystemException when refused, NotFoundException when `host` does not resolve.
PELMORA_EXPORT void CreateTcpConnection(const std::string& host, int port, long long timeoutMicroseconds,
                                        Ref<Stream>& out);
// Connects to the Unix-domain socket `path`.
PELMORA_EXPORT void CreateLocalConnection(const std::string& path, long long timeoutMicroseconds,
                                          Ref<Stream>& out);

// A stream reading `readFd` and writing `writeFd` (the same descriptor for a socket;
// 0 and 1 for standard input and output). The stream works on duplicates, so closing it
// leaves the given descriptors open. Pipes, sockets and terminals; not regular files.
PELMORA_EXPORT void CreateDescriptorStream(int readFd, int writeFd, Ref<Stream>& out);

}  // namespace Pelmora::System
