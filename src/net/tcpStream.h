#pragma once
// The plain TCP stream: a GenericStream over a TCP socket that also sends files with
// sendfile(2). When the socket is full it waits for room with an asynchronous wait on the
// stream's I/O service, under the stream's lock like every other use of the socket.

#include <memory>
#include <string>

#include "pelmora/system/streamFileSender.h"
#include "src/net/genericStream.h"

#if defined(__SANITIZE_THREAD__)
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/ip/tcp.hpp>

namespace Pelmora::System {

class TcpStream : public GenericStream<boost::asio::ip::tcp::socket>, public virtual FileSender {
public:
   using Socket = boost::asio::ip::tcp::socket;
   TcpStream(Socket&& socket, WorkQueue* queue, std::string description)
       : GenericStream(std::move(socket), queue, std::move(description)) {}

   bool CanSendFile() override { return true; }
   long long TrySendFile(int fd, long long offset, long long length) override;
   void AsyncSendFile(int fd, long long offset, long long length,
                      const Functor<void, Stream*, Exception*, long long>& callback) override;
   long long SendFile(int fd, long long offset, long long length) override;

private:
   // The progress of one file being sent.
   struct Sending {
      int fd;
      long long offset;
      long long left;
      long long sent = 0;
      boost::system::error_code error;
   };

   static std::shared_ptr<Sending> MakeSending(int fd, long long offset, long long length);
   // Sends what the socket takes; true when the operation ended (all sent, the file ended
   // or a failure, kept in `sending`). Lock held.
   bool Step(Sending& sending);
   // Starts the write-direction operation; `callback` as the stream's write callback.
   void Start(const std::shared_ptr<Sending>& sending, const Functor<void, Stream*, Exception*>& callback);
   // Waits for room, then steps again. Lock held.
   void WaitForRoom(const std::shared_ptr<Sending>& sending);
};

}  // namespace Pelmora::System
