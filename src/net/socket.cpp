// TCP and Unix-domain server sockets and connections over asio.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#if defined(__SANITIZE_THREAD__)
// Asio's fences are outside what ThreadSanitizer models; its handlers synchronise
// through the service's mutex, which it does model.
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/connect.hpp>

#include "src/net/socketImpl.h"
#include "src/net/tcpStream.h"

namespace Pelmora::System {

namespace {

using Tcp = boost::asio::ip::tcp;
using Local = boost::asio::local::stream_protocol;

template <class Protocol>
class PlainServerSocket : public ServerSocketImpl<Protocol> {
public:
   using Base = ServerSocketImpl<Protocol>;
   PlainServerSocket(typename Protocol::acceptor&& acceptor, const ServerSocketOptions& options, const char* kind)
       : Base(std::move(acceptor), options), _kind(kind) {}

protected:
   void MakeStream(typename Protocol::socket&& socket,
                   const std::function<void(Exception*, Stream*)>& done) override {
      if constexpr (std::is_same_v<Protocol, Tcp>) SetNoDelay(socket);
      Ref<BindingInfo> local = MakeBindingInfo(socket.local_endpoint());
      boost::system::error_code error;
      auto remote = socket.remote_endpoint(error);
      Ref<BindingInfo> peer = error ? Ref<BindingInfo>() : MakeBindingInfo(remote);
      std::string description = DescribeStream(_kind, local.Get(), peer.Get());
      Ref<GenericStream<typename Protocol::socket>> stream;
      if constexpr (std::is_same_v<Protocol, Tcp>)
         stream = new TcpStream(std::move(socket), this->_options.completionQueue.Get(), description);
      else
         stream = new GenericStream<typename Protocol::socket>(std::move(socket),
                                                               this->_options.completionQueue.Get(), description);
      stream->SetBindings(local, peer);
      done(nullptr, stream.Get());
   }

private:
   const char* _kind;
};

// Removes a Unix-domain socket file nobody listens on.
void RemoveStaleSocket(const std::string& path) {
   struct stat info {};
   if (::stat(path.c_str(), &info) != 0 || !S_ISSOCK(info.st_mode)) return;
   Local::socket probe(GetPoolIoContext());
   boost::system::error_code error;
   probe.connect(Local::endpoint(path), error);
   if (error == boost::asio::error::connection_refused) ::unlink(path.c_str());
}

template <class Socket>
void FinishConnection(Socket&& socket, const char* kind, Ref<Stream>& out) {
   SetCloseOnExec(socket.native_handle());
   if constexpr (std::is_same_v<Socket, Tcp::socket>) SetNoDelay(socket);
   boost::system::error_code error;
   Ref<BindingInfo> local = MakeBindingInfo(socket.local_endpoint(error));
   auto remote = socket.remote_endpoint(error);
   Ref<BindingInfo> peer = error ? Ref<BindingInfo>() : MakeBindingInfo(remote);
   std::string description = DescribeStream(kind, local.Get(), peer.Get());
   Ref<GenericStream<Socket>> stream;
   if constexpr (std::is_same_v<Socket, Tcp::socket>)
      stream = new TcpStream(std::move(socket), nullptr, description);
   else
      stream = new GenericStream<Socket>(std::move(socket), nullptr, description);
   stream->SetBindings(local, peer);
   out = stream;
}

}  // namespace

void SetNoDelay(Tcp::socket& socket) {
   boost::system::error_code ignored;
   socket.set_option(Tcp::no_delay(true), ignored);
}

Ref<BindingInfo> MakeBindingInfo(const Tcp::endpoint& endpoint) {
   boost::asio::ip::address address = endpoint.address();
   if (address.is_v4()) {
      // inet_ntop goes through sprintf, and every accepted connection names two ends.
      char text[16];
      char* end = text;
      bool first = true;
      for (unsigned int part : address.to_v4().to_bytes()) {
         if (!first) *end++ = '.';
         first = false;
         if (part >= 100) *end++ = static_cast<char>('0' + part / 100);
         if (part >= 10) *end++ = static_cast<char>('0' + part / 10 % 10);
         *end++ = static_cast<char>('0' + part % 10);
      }
      return new InetBindingInfo(std::string(text, end), endpoint.port(), false);
   }
   return new InetBindingInfo(address.to_string(), endpoint.port(), true);
}

Ref<BindingInfo> MakeBindingInfo(const Local::endpoint& endpoint) {
   return new LocalBindingInfo(endpoint.path());
}

std::string DescribeStream(const char* kind, BindingInfo* local, BindingInfo* peer) {
   std::string text = kind;
   text += " ";
   text += local != nullptr ? local->ToString() : "?";
   text += " <- ";
   text += peer != nullptr ? peer->ToString() : "?";
   return text;
}

void SetCloseOnExec(int fd) {
   int flags = ::fcntl(fd, F_GETFD);
   if (flags < 0 || ::fcntl(fd, F_SETFD, flags | FD_CLOEXEC) < 0) throw SystemException(errno);
}

std::chrono::steady_clock::time_point DeadlineAfter(long long microseconds) {
   if (microseconds < 0) return std::chrono::steady_clock::time_point::max();
   return std::chrono::steady_clock::now() + std::chrono::microseconds(microseconds);
}

void WaitOrCancel(OperationWait& wait, std::chrono::steady_clock::time_point deadline,
                  const std::function<void()>& cancel) {
   if (wait.WaitUntil(deadline)) return;
   cancel();
   wait.WaitDone();
   throw TimeoutException("Operation timed out");
}

void CreateTcpServerSocket(const std::string& host, int port, const ServerSocketOptions& options,
                           Ref<ServerSocket>& out) {
   std::vector<Ref<InetBindingInfo>> addresses;
   ResolveAddress(host, port, true, addresses);
   Tcp::endpoint endpoint(boost::asio::ip::make_address(addresses.front()->GetAddress()),
                          static_cast<unsigned short>(port));
   Tcp::acceptor acceptor(GetPoolIoContext());
   OpenAcceptor(acceptor, endpoint, options, options.reuseAddress);
   out = new PlainServerSocket<Tcp>(std::move(acceptor), options, "tcp");
}

void CreateLocalServerSocket(const std::string& path, const ServerSocketOptions& options,
                             Ref<ServerSocket>& out) {
   if (options.reuseAddress) RemoveStaleSocket(path);
   Local::acceptor acceptor(GetPoolIoContext());
   OpenAcceptor(acceptor, Local::endpoint(path), options, false);
   out = new PlainServerSocket<Local>(std::move(acceptor), options, "unix");
}

void ConnectTcpSocket(const std::string& host, int port, std::chrono::steady_clock::time_point deadline,
                      Tcp::socket& socket) {
   std::vector<Ref<InetBindingInfo>> addresses;
   ResolveAddress(host, port, false, addresses);
   boost::system::error_code last;
   for (const Ref<InetBindingInfo>& address : addresses) {
      Tcp::endpoint endpoint(boost::asio::ip::make_address(address->GetAddress()),
                             static_cast<unsigned short>(port));
      boost::system::error_code error;
      if (socket.is_open()) socket.close(error);
      socket.open(endpoint.protocol(), error);
      if (error) {
         last = error;
         continue;
      }
      SetCloseOnExec(socket.native_handle());
      // Only the completion handler runs elsewhere, and it touches nothing but the wait.
      auto wait = std::make_shared<OperationWait>();
      socket.async_connect(endpoint, [wait](const boost::system::error_code& result) { wait->Done(result); });
      WaitOrCancel(*wait, deadline, [&socket] {
         boost::system::error_code ignored;
         socket.close(ignored);
      });
      if (!wait->Error()) return;
      last = wait->Error();
   }
   throw SystemException(last.value(), "Cannot connect to " + host + ":" + std::to_string(port) + ": " +
                                           last.message());
}

void CreateTcpConnection(const std::string& host, int port, long long timeoutMicroseconds,
                         Ref<Stream>& out) {
   Tcp::socket socket(GetPoolIoContext());
   ConnectTcpSocket(host, port, DeadlineAfter(timeoutMicroseconds), socket);
   FinishConnection(std::move(socket), "tcp", out);
}

void CreateLocalConnection(const std::string& path, long long timeoutMicroseconds, Ref<Stream>& out) {
   Local::socket socket(GetPoolIoContext());
   Local::endpoint endpoint(path);
   boost::system::error_code error;
   socket.open(endpoint.protocol(), error);
   if (error) throw SystemException(error.value(), error.message());
   SetCloseOnExec(socket.native_handle());
   auto wait = std::make_shared<OperationWait>();
   socket.async_connect(endpoint, [wait](const boost::system::error_code& result) { wait->Done(result); });
   WaitOrCancel(*wait, DeadlineAfter(timeoutMicroseconds), [&socket] {
      boost::system::error_code ignored;
      socket.close(ignored);
   });
   if (wait->Error()) {
      throw SystemException(wait->Error().value(), "Cannot connect to " + path + ": " + wait->Error().message());
   }
   FinishConnection(std::move(socket), "unix", out);
}

}  // namespace Pelmora::System
