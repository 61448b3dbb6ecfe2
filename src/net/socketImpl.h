#pragma once
// What the socket units share: binding information from asio endpoints, close-on-exec,
// waiting for one asio operation with a deadline, and the server socket over a protocol
// (TCP, Unix-domain) whose accepted connections a subclass turns into streams.

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#if defined(__SANITIZE_THREAD__)
// Asio's fences are outside what ThreadSanitizer models; its handlers synchronise
// through the service's mutex, which it does model.
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/ip/tcp.hpp>
#include <boost/asio/local/stream_protocol.hpp>

#include "pelmora/system/socket.h"
#include "src/net/genericStream.h"

namespace Pelmora::System {

Ref<BindingInfo> MakeBindingInfo(const boost::asio::ip::tcp::endpoint& endpoint);
Ref<BindingInfo> MakeBindingInfo(const boost::asio::local::stream_protocol::endpoint& endpoint);
// "tcp 127.0.0.1:80 <- 127.0.0.1:5000" and the like.
std::string DescribeStream(const char* kind, BindingInfo* local, BindingInfo* peer);
// Request-response traffic goes out at once instead of waiting to fill a segment.
void SetNoDelay(boost::asio::ip::tcp::socket& socket);
// Sets FD_CLOEXEC; SystemException when the system refuses.
void SetCloseOnExec(int fd);

// The outcome of one asynchronous operation that a caller waits for.
class OperationWait {
public:
   // The completion handler's part.
   void Done(const boost::system::error_code& error) {
      std::lock_guard<std::mutex> lock(_mutex);
      _error = error;
      _done = true;
      _cv.notify_all();
   }
   // Until done or `deadline` (time_point::max(): no limit); false on time-out.
   bool WaitUntil(std::chrono::steady_clock::time_point deadline) {
      std::unique_lock<std::mutex> lock(_mutex);
      return _cv.wait_until(lock, deadline, [this] { return _done; });
   }
   void WaitDone() {
      std::unique_lock<std::mutex> lock(_mutex);
      _cv.wait(lock, [this] { return _done; });
   }
   boost::system::error_code Error() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _error;
   }

private:
   std::mutex _mutex;
   std::condition_variable _cv;
   boost::system::error_code _error;
   bool _done = false;
};

std::chrono::steady_clock::time_point DeadlineAfter(long long microseconds);

// Listens on an acceptor of `Protocol`; MakeStream turns an accepted socket into a stream
// (or a failure) and hands it on. One accept at a time. The object is its own lock.
template <class Protocol>
class ServerSocketImpl : public virtual ServerSocket, public LockableObjectImpl {
public:
   using Acceptor = typename Protocol::acceptor;
   using Socket = typename Protocol::socket;
   using Callback = Functor<void, ServerSocket*, Exception*, Stream*>;

   ServerSocketImpl(Acceptor&& acceptor, const ServerSocketOptions& options)
       : _options(options), _acceptor(std::move(acceptor)) {
      _local = MakeBindingInfo(_acceptor.local_endpoint());
   }

   void AsyncAccept(const Callback& callback) override {
      Synchronized lock(this);
      if (_closed) throw InvalidStateException("Server socket closed");
      if (_accepting) throw InProgressException();
      _accepting = true;
      Ref<ServerSocketImpl> self(this);
      _acceptor.async_accept(AcceptExecutor(), [self, callback](const boost::system::error_code& error,
                                                                Socket socket) {
         self->Accepted(error, std::move(socket), callback);
      });
   }

   void Accept(long long microseconds, Ref<Stream>& out) override {
      struct Result {
         OperationWait wait;
         Ref<Stream> stream;
         std::unique_ptr<Exception> failure;
      };
      auto result = std::make_shared<Result>();
      AsyncAccept([result](ServerSocket*, Exception* error, Stream* stream) {
         if (error != nullptr) result->failure.reset(error->Clone());
         result->stream = stream;
         result->wait.Done({});
      });
      if (!result->wait.WaitUntil(DeadlineAfter(microseconds))) {
         {
            Synchronized lock(this);
            boost::system::error_code ignored;
            _acceptor.cancel(ignored);
         }
         result->wait.WaitDone();
         // A connection that raced the time-out is kept.
         if (!result->stream) throw TimeoutException("Operation timed out");
      }
      if (result->failure) result->failure->Throw();
      out = result->stream;
   }

   void GetBindingInfo(Ref<BindingInfo>& local) override { local = _local; }

   void Close() override {
      Synchronized lock(this);
      _closed = true;
      boost::system::error_code ignored;
      _acceptor.close(ignored);
   }

   using ObjectImpl::ToString;
   std::string ToString() const override { return "listening " + _local->ToString(); }

   int GetNativeHandle() {
      Synchronized lock(this);
      return _acceptor.native_handle();
   }

protected:
   // Builds the stream of an accepted socket and calls `done` with it (or a failure),
   // now or later.
   virtual void MakeStream(Socket&& socket,
                           const std::function<void(Exception*, Stream*)>& done) = 0;
   // The executor new sockets get (a strand where the stream needs one).
   virtual boost::asio::any_io_executor AcceptExecutor() { return _acceptor.get_executor(); }

   const ServerSocketOptions _options;

private:
   void Accepted(const boost::system::error_code& error, Socket&& socket, const Callback& callback) {
      {
         Synchronized lock(this);
         _accepting = false;
      }
      Ref<ServerSocketImpl> self(this);
      auto done = [self, callback](Exception* failure, Stream* stream) {
         callback(self.Get(), failure, stream);
      };
      if (error) {
         std::unique_ptr<Exception> failure(MakeStreamException(error));
         done(failure.get(), nullptr);
         return;
      }
      try {
         SetCloseOnExec(socket.native_handle());
         MakeStream(std::move(socket), done);
      } catch (const Exception& e) {
         std::unique_ptr<Exception> failure(e.Clone());
         done(failure.get(), nullptr);
      }
   }

   Acceptor _acceptor;
   Ref<BindingInfo> _local;
   bool _accepting = false;
   bool _closed = false;
};

// Opens, binds and listens `acceptor` on `endpoint`; SystemException on failure.
template <class Acceptor, class Endpoint>
void OpenAcceptor(Acceptor& acceptor, const Endpoint& endpoint, const ServerSocketOptions& options,
                  bool reuseAddress) {
   boost::system::error_code error;
   acceptor.open(endpoint.protocol(), error);
   if (!error) SetCloseOnExec(acceptor.native_handle());
   if (!error && reuseAddress) acceptor.set_option(boost::asio::socket_base::reuse_address(true), error);
   if (!error) acceptor.bind(endpoint, error);
   if (!error) acceptor.listen(options.backlog, error);
   if (error) {
      throw SystemException(error.value(), "Cannot listen on " + MakeBindingInfo(endpoint)->ToString() +
                                               ": " + error.message());
   }
}

// Resolves `host` and connects a TCP socket (made on `executor`) to the first address
// that takes it, by `deadline`.
void ConnectTcpSocket(const std::string& host, int port, std::chrono::steady_clock::time_point deadline,
                      boost::asio::ip::tcp::socket& socket);
// Waits for `wait` by `deadline`; on time-out runs `cancel`, waits for the operation
// to finish and throws TimeoutException.
void WaitOrCancel(OperationWait& wait, std::chrono::steady_clock::time_point deadline,
                  const std::function<void()>& cancel);

}  // namespace Pelmora::System
