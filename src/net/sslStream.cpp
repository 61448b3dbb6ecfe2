// TLS contexts, server sockets and connections over asio::ssl and OpenSSL. Each TLS
// stream lives on its own strand: the OpenSSL engine serves both directions.

#include <openssl/err.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>

#if defined(__SANITIZE_THREAD__)
// Asio's fences are outside what ThreadSanitizer models; its handlers synchronise
// through the service's mutex, which it does model.
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/ssl/context.hpp>
#include <boost/asio/ssl/host_name_verification.hpp>
#include <boost/asio/ssl/stream.hpp>
#include <boost/asio/steady_timer.hpp>
#include <boost/asio/strand.hpp>

#include <algorithm>
#include <deque>
#include <set>

#include "pelmora/system/ssl.h"
#include "src/net/socketImpl.h"

namespace Pelmora::System {

namespace {

// OpenSSL frees its locks in an exit handler, while pool threads, which live until exit,
// may still be dropping TLS objects then. Like the library's own singletons, OpenSSL's
// state is kept until the process ends. The first initialisation decides, so this runs
// ahead of every ordinary static initialiser (asio's among them).
__attribute__((constructor(101))) void InitOpenSslWithoutExitCleanup() {
   OPENSSL_init_ssl(OPENSSL_INIT_NO_ATEXIT, nullptr);
}

using Tcp = boost::asio::ip::tcp;
using SslSocket = boost::asio::ssl::stream<Tcp::socket>;

// The TLS stream says so, for answers that depend on it (cookies marked Secure).
class SslGenericStream final : public GenericStream<SslSocket, true> {
public:
   using GenericStream::GenericStream;
   bool IsSecure() const override { return true; }
};

class SslContextImpl : public virtual SslContext, public ObjectImpl {
public:
   explicit SslContextImpl(bool server)
       : _context(server ? boost::asio::ssl::context::tls_server : boost::asio::ssl::context::tls_client),
         _server(server) {}
   bool IsServer() const override { return _server; }
   boost::asio::ssl::context& Get() { return _context; }
   SslClientOptions clientOptions;

private:
   boost::asio::ssl::context _context;
   bool _server;
};

// OpenSSL's reason for the last failure on this thread, or `fallback`.
std::string LastSslError(const std::string& fallback) {
   unsigned long code = ERR_get_error();
   ERR_clear_error();
   if (code == 0) return fallback;
   const char* reason = ERR_reason_error_string(code);
   return reason != nullptr ? reason : fallback;
}

void Check(const boost::system::error_code& error, const std::string& what) {
   if (error) throw SslException(what + ": " + error.message());
}

void ApplyVersionAndCiphers(SSL_CTX* context, const std::string& minVersion, const std::string& ciphers) {
   int version = 0;
   if (minVersion == "TLSv1.2") {
      version = TLS1_2_VERSION;
   } else if (minVersion == "TLSv1.3") {
      version = TLS1_3_VERSION;
   } else {
      throw SslException("unsupported minimum version " + minVersion);
   }
   if (SSL_CTX_set_min_proto_version(context, version) != 1) {
      throw SslException(LastSslError("cannot set the minimum version"));
   }
   if (!ciphers.empty() && SSL_CTX_set_cipher_list(context, ciphers.c_str()) != 1) {
      throw SslException("cipher list " + ciphers + ": " + LastSslError("no cipher matches"));
   }
}

SslContextImpl* ContextOf(SslContext* context, bool server) {
   auto* impl = dynamic_cast<SslContextImpl*>(context);
   if (impl == nullptr || impl->IsServer() != server) {
      throw InvalidArgumentException(server ? "a server TLS context is needed" : "a client TLS context is needed");
   }
   return impl;
}

Ref<SslGenericStream> MakeSslStream(SslSocket&& socket) {
   boost::system::error_code error;
   Tcp::socket& tcp = socket.next_layer();
   Ref<BindingInfo> local = MakeBindingInfo(tcp.local_endpoint(error));
   auto remote = tcp.remote_endpoint(error);
   Ref<BindingInfo> peer = error ? Ref<BindingInfo>() : MakeBindingInfo(remote);
   std::string description = DescribeStream("tls", local.Get(), peer.Get());
   Ref<SslGenericStream> stream = new SslGenericStream(std::move(socket), nullptr, description);
   stream->SetBindings(local, peer);
   return stream;
}

// A handshake failure with the certificate check's own reason where there is one.
Exception* HandshakeFailure(const boost::system::error_code& error, SslSocket& socket) {
   std::unique_ptr<Exception> failure(MakeStreamException(error));
   long verify = SSL_get_verify_result(socket.native_handle());
   if (dynamic_cast<SslException*>(failure.get()) != nullptr && verify != X509_V_OK) {
      return new SslException(error.message() + " (" + X509_verify_cert_error_string(verify) + ")");
   }
   if (dynamic_cast<SslException*>(failure.get()) == nullptr) {
      return new SslException("handshake failed: " + failure->GetMessage());
   }
   return failure.release();
}

// Accepts connections in the background and runs their handshakes side by side, each
// with its own time-out, so that a client that never speaks cannot hold up the others.
// Outcomes (streams or handshake failures) queue in the order they finish until an
// accept takes them; connections in handshake plus queued outcomes stay within
// `maxPendingAccepts`. The object is its own lock; handshakes run on their strands and
// report back under it.
class SslServerSocket : public virtual ServerSocket, public LockableObjectImpl {
public:
   using Callback = Functor<void, ServerSocket*, Exception*, Stream*>;

   SslServerSocket(Tcp::acceptor&& acceptor, const ServerSocketOptions& options, SslContextImpl* context)
       : _options(options), _acceptor(std::move(acceptor)), _context(context) {
      _local = MakeBindingInfo(_acceptor.local_endpoint());
      _limit = static_cast<size_t>(std::max(1, options.maxPendingAccepts));
   }

   void AsyncAccept(const Callback& callback) override { Wait(callback); }

   void Accept(long long microseconds, Ref<Stream>& out) override {
      struct Result {
         OperationWait wait;
         Ref<Stream> stream;
         std::unique_ptr<Exception> failure;
      };
      auto result = std::make_shared<Result>();
      unsigned long long ticket = Wait([result](ServerSocket*, Exception* error, Stream* stream) {
         if (error != nullptr) result->failure.reset(error->Clone());
         result->stream = stream;
         result->wait.Done({});
      });
      if (!result->wait.WaitUntil(DeadlineAfter(microseconds))) {
         {
            Synchronized lock(this);
            // Withdrawn before an outcome reached it: the background accepting goes on and
            // what it finds waits for the next caller.
            if (_waiting && _ticket == ticket) {
               _waiting = false;
               _waiter = Callback();
               throw TimeoutException("Operation timed out");
            }
         }
         result->wait.WaitDone();
      }
      if (result->failure) result->failure->Throw();
      out = result->stream;
   }

   void GetBindingInfo(Ref<BindingInfo>& local) override { local = _local; }

   void Close() override {
      std::deque<Outcome> dropped;
      {
         Synchronized lock(this);
         if (_closed) return;
         _closed = true;
         boost::system::error_code ignored;
         _acceptor.close(ignored);
         for (const std::shared_ptr<Handshake>& handshake : _handshakes) {
            // The handshake's own completion then sees the socket closed and lets go of it.
            boost::asio::post(handshake->stream.get_executor(), [handshake] {
               boost::system::error_code ignored;
               handshake->stream.lowest_layer().close(ignored);
            });
         }
         dropped.swap(_ready);
         if (_waiting) {
            _waiting = false;
            Deliver(_waiter, Outcome());
            _waiter = Callback();
         }
      }
      for (Outcome& outcome : dropped) {
         if (outcome.stream) outcome.stream->Close();
      }
   }

   using ObjectImpl::ToString;
   std::string ToString() const override { return "listening tls " + _local->ToString(); }

private:
   struct Handshake {
      Handshake(Tcp::socket&& tcp, boost::asio::ssl::context& context)
          : stream(std::move(tcp), context), timer(stream.get_executor()) {}
      SslSocket stream;
      boost::asio::steady_timer timer;
      bool finished = false;
   };
   // A finished handshake, or a failed accept; both empty: the socket was closed.
   struct Outcome {
      Ref<Stream> stream;
      std::shared_ptr<Exception> failure;
   };

   // Registers the one waiting accept and returns its ticket.
   unsigned long long Wait(const Callback& callback) {
      Synchronized lock(this);
      if (_closed) throw InvalidStateException("Server socket closed");
      if (_waiting) throw InProgressException();
      _waiting = true;
      _waiter = callback;
      _started = true;
      unsigned long long ticket = ++_ticket;
      Pump();
      return ticket;
   }

   // Under the lock: hands a queued outcome to the waiter and keeps the accepts going.
   void Pump() {
      if (_waiting && !_ready.empty()) {
         _waiting = false;
         Deliver(_waiter, std::move(_ready.front()));
         _waiter = Callback();
         _ready.pop_front();
      }
      AcceptMore();
   }

   // Under the lock: one raw accept at a time while there is room.
   void AcceptMore() {
      if (_closed || !_started || _accepting || _handshakes.size() + _ready.size() >= _limit) return;
      _accepting = true;
      Ref<SslServerSocket> self(this);
      // Each connection gets its own strand: the OpenSSL engine serves both directions.
      _acceptor.async_accept(boost::asio::make_strand(GetPoolIoContext()),
                             [self](const boost::system::error_code& error, Tcp::socket socket) {
                                self->Accepted(error, std::move(socket));
                             });
   }

   void Accepted(const boost::system::error_code& error, Tcp::socket&& socket) {
      std::shared_ptr<Handshake> handshake;
      {
         Synchronized lock(this);
         _accepting = false;
         if (_closed) return;
         if (error) {
            _ready.push_back(Outcome{nullptr, std::shared_ptr<Exception>(MakeStreamException(error))});
         } else {
            try {
               SetCloseOnExec(socket.native_handle());
               SetNoDelay(socket);
               handshake = std::make_shared<Handshake>(std::move(socket), _context->Get());
               _handshakes.insert(handshake);
            } catch (const Exception& e) {
               _ready.push_back(Outcome{nullptr, std::shared_ptr<Exception>(e.Clone())});
            }
         }
         // A failing acceptor (out of descriptors) fills the queue with failures and then
         // rests until an accept takes one.
         Pump();
      }
      if (handshake) StartHandshake(handshake);
   }

   void StartHandshake(const std::shared_ptr<Handshake>& handshake) {
      long long limit = _options.handshakeTimeoutMicroseconds;
      Ref<SslServerSocket> self(this);
      boost::asio::dispatch(handshake->stream.get_executor(), [handshake, limit, self] {
         if (limit >= 0) {
            handshake->timer.expires_after(std::chrono::microseconds(limit));
            handshake->timer.async_wait([handshake](const boost::system::error_code& error) {
               if (error || handshake->finished) return;
               boost::system::error_code ignored;
               handshake->stream.lowest_layer().close(ignored);
            });
         }
         handshake->stream.async_handshake(boost::asio::ssl::stream_base::server,
                                           [handshake, self](const boost::system::error_code& error) {
                                              self->HandshakeDone(handshake, error);
                                           });
      });
   }

   // On the connection's strand.
   void HandshakeDone(const std::shared_ptr<Handshake>& handshake, const boost::system::error_code& error) {
      handshake->finished = true;
      handshake->timer.cancel();
      Outcome outcome;
      if (error) {
         outcome.failure.reset(HandshakeFailure(error, handshake->stream));
      } else {
         outcome.stream = MakeSslStream(std::move(handshake->stream));
      }
      {
         Synchronized lock(this);
         _handshakes.erase(handshake);
         if (!_closed) {
            _ready.push_back(std::move(outcome));
            Pump();
            return;
         }
      }
      if (outcome.stream) outcome.stream->Close();
   }

   // Under the lock. The callback runs on a pool thread, off every strand, so that it may
   // use the stream synchronously. An outcome that meets a closed socket is dropped and
   // the accept fails as Close promises.
   void Deliver(const Callback& callback, Outcome&& outcome) {
      Ref<SslServerSocket> self(this);
      boost::asio::post(GetPoolIoContext(), [self, callback,
                                             outcome = std::move(outcome)]() mutable {
         bool closed;
         {
            Synchronized lock(self.Get());
            closed = self->_closed;
         }
         if (closed && outcome.stream) {
            outcome.stream->Close();
            outcome = Outcome();
         }
         if (!outcome.stream && !outcome.failure) {
            outcome.failure.reset(MakeStreamException(boost::asio::error::operation_aborted));
         }
         callback(self.Get(), outcome.failure.get(), outcome.stream.Get());
      });
   }

   const ServerSocketOptions _options;
   Tcp::acceptor _acceptor;
   Ref<BindingInfo> _local;
   Ref<SslContextImpl> _context;
   size_t _limit;
   std::set<std::shared_ptr<Handshake>> _handshakes;
   std::deque<Outcome> _ready;
   Callback _waiter;
   unsigned long long _ticket = 0;
   bool _waiting = false;
   bool _started = false;
   bool _accepting = false;
   bool _closed = false;
};

}  // namespace

void CreateSslServerContext(const SslServerOptions& options, Ref<SslContext>& out) {
   Ref<SslContextImpl> context = new SslContextImpl(true);
   boost::asio::ssl::context& ssl = context->Get();
   ssl.set_options(boost::asio::ssl::context::default_workarounds | boost::asio::ssl::context::no_sslv2 |
                   boost::asio::ssl::context::no_sslv3 | boost::asio::ssl::context::single_dh_use);
   boost::system::error_code error;
   ssl.use_certificate_chain_file(options.certificateChainFile, error);
   Check(error, "certificate chain " + options.certificateChainFile);
   ssl.use_private_key_file(options.privateKeyFile, boost::asio::ssl::context::pem, error);
   Check(error, "private key " + options.privateKeyFile);
   if (SSL_CTX_check_private_key(ssl.native_handle()) != 1) {
      throw SslException("private key " + options.privateKeyFile + ": " +
                         LastSslError("does not match the certificate"));
   }
   ApplyVersionAndCiphers(ssl.native_handle(), options.minVersion, options.cipherList);
   out = context;
}

void CreateSslClientContext(const SslClientOptions& options, Ref<SslContext>& out) {
   Ref<SslContextImpl> context = new SslContextImpl(false);
   boost::asio::ssl::context& ssl = context->Get();
   boost::system::error_code error;
   if (options.caFile.empty()) {
      ssl.set_default_verify_paths(error);
      Check(error, "system certificate store");
   } else {
      ssl.load_verify_file(options.caFile, error);
      Check(error, "CA file " + options.caFile);
   }
   ssl.set_verify_mode(options.verifyPeer ? boost::asio::ssl::verify_peer : boost::asio::ssl::verify_none);
   ApplyVersionAndCiphers(ssl.native_handle(), options.minVersion, options.cipherList);
   context->clientOptions = options;
   out = context;
}

void CreateSslServerSocket(const std::string& host, int port, const ServerSocketOptions& options,
                           SslContext* context, Ref<ServerSocket>& out) {
   SslContextImpl* impl = ContextOf(context, true);
   std::vector<Ref<InetBindingInfo>> addresses;
   ResolveAddress(host, port, true, addresses);
   Tcp::endpoint endpoint(boost::asio::ip::make_address(addresses.front()->GetAddress()),
                          static_cast<unsigned short>(port));
   Tcp::acceptor acceptor(GetPoolIoContext());
   OpenAcceptor(acceptor, endpoint, options, options.reuseAddress);
   out = new SslServerSocket(std::move(acceptor), options, impl);
}

void CreateSslConnection(const std::string& host, int port, long long timeoutMicroseconds,
                         SslContext* context, Ref<Stream>& out) {
   SslContextImpl* impl = ContextOf(context, false);
   auto deadline = DeadlineAfter(timeoutMicroseconds);
   Tcp::socket tcp(boost::asio::make_strand(GetPoolIoContext()));
   ConnectTcpSocket(host, port, deadline, tcp);
   SetNoDelay(tcp);
   SslSocket ssl(std::move(tcp), impl->Get());
   const std::string& name = impl->clientOptions.serverName.empty() ? host : impl->clientOptions.serverName;
   SSL_set_tlsext_host_name(ssl.native_handle(), name.c_str());
   if (impl->clientOptions.verifyPeer) ssl.set_verify_callback(boost::asio::ssl::host_name_verification(name));

   auto wait = std::make_shared<OperationWait>();
   boost::asio::dispatch(ssl.get_executor(), [&ssl, wait] {
      ssl.async_handshake(boost::asio::ssl::stream_base::client,
                          [wait](const boost::system::error_code& error) { wait->Done(error); });
   });
   WaitOrCancel(*wait, deadline, [&ssl] {
      OperationWait closed;
      boost::asio::dispatch(ssl.get_executor(), [&ssl, &closed] {
         boost::system::error_code ignored;
         ssl.lowest_layer().close(ignored);
         closed.Done({});
      });
      closed.WaitDone();
   });
   if (wait->Error()) {
      std::unique_ptr<Exception> failure(HandshakeFailure(wait->Error(), ssl));
      failure->Throw();
   }
   out = MakeSslStream(std::move(ssl));
}

}  // namespace Pelmora::System
