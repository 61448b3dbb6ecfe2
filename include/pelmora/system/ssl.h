#pragma once
// TLS streams over TCP. An SslContext holds one side's settings: a server's certificate
// chain, key, minimum protocol version and cipher list; a client's trust (a CA file or
// the system store) and peer verification. TLS server sockets hand out streams after a
// successful handshake; TLS connections return one after theirs. Failed handshakes and
// bad settings raise SslException with OpenSSL's reason. Contexts are immutable once
// made and thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/exception/throwable.h"
#include "pelmora/system/socket.h"
#include "pelmora/system/stream.h"

namespace Pelmora::System {

class PELMORA_EXPORT SslException : public Exception {
public:
   explicit SslException(const std::string& reason) : Exception("SSL error: " + reason) {}
   PELMORA_EXCEPTION_CLONE(SslException)
};

// The protocol versions a context accepts at least: "TLSv1.2" or "TLSv1.3".
constexpr const char* kSslDefaultMinVersion = "TLSv1.2";
// Forward-secret AEAD suites for TLS 1.2 (TLS 1.3 suites are OpenSSL's own).
constexpr const char* kSslDefaultCipherList =
    "ECDHE+AESGCM:ECDHE+CHACHA20:DHE+AESGCM:DHE+CHACHA20:!aNULL:!eNULL:!MD5:!RC4:!3DES";

struct PELMORA_EXPORT SslServerOptions {
   // PEM: the server's certificate first, then its intermediates.
   std::string certificateChainFile;
   // PEM, unencrypted.
   std::string privateKeyFile;
   std::string minVersion = kSslDefaultMinVersion;
   std::string cipherList = kSslDefaultCipherList;
};

struct PELMORA_EXPORT SslClientOptions {
   // PEM certificates to trust; empty: the system's store.
   std::string caFile;
   // Off only for tests and trusted loopback peers.
   bool verifyPeer = true;
   // The name the peer's certificate must carry (and the name sent to the server);
   // empty: the host connected to.
   std::string serverName;
   std::string minVersion = kSslDefaultMinVersion;
   std::string cipherList = kSslDefaultCipherList;
};

class PELMORA_EXPORT SslContext : public virtual Object {
public:
   virtual bool IsServer() const = 0;
};

// SslException when a file cannot be used, the key does not match the certificate, or
// the version or cipher list is not understood.
PELMORA_EXPORT void CreateSslServerContext(const SslServerOptions& options, Ref<SslContext>& out);
PELMORA_EXPORT void CreateSslClientContext(const SslClientOptions& options, Ref<SslContext>& out);

// A TCP server socket whose accepts complete after the TLS handshake (within
// `options.handshakeTimeoutMicroseconds`); a failed handshake completes that accept with
// SslException. Once accepting has begun, handshakes run side by side, up to
// `options.maxPendingAccepts`, and accepts get their outcomes in the order the handshakes
// finished. Close ends handshakes in progress and closes streams nobody took; call it
// when done, since the accepting in the background keeps the socket alive until then.
// `context` must be a server context.
PELMORA_EXPORT void CreateSslServerSocket(const std::string& host, int port, const ServerSocketOptions& options,
                                          SslContext* context, Ref<ServerSocket>& out);
// Connects and completes the handshake within `timeoutMicroseconds` in all.
// `context` must be a client context.
PELMORA_EXPORT void CreateSslConnection(const std::string& host, int port, long long timeoutMicroseconds,
                                        SslContext* context, Ref<Stream>& out);

}  // namespace Pelmora::System
