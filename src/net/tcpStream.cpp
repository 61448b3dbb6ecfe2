// Files sent over plain TCP streams with sendfile(2).

#include "src/net/tcpStream.h"

#include <sys/sendfile.h>

#include <algorithm>
#include <cerrno>
#include <climits>

namespace Pelmora::System {

namespace {

// One sendfile call moves at most this much; the kernel caps it near 2 GiB anyway.
constexpr long long kLargestPiece = 1LL << 30;

}  // namespace

std::shared_ptr<TcpStream::Sending> TcpStream::MakeSending(int fd, long long offset, long long length) {
   if (offset < 0 || length < 0) throw InvalidArgumentException("negative file offset or length");
   auto sending = std::make_shared<Sending>();
   sending->fd = fd;
   sending->offset = offset;
   sending->left = length;
   return sending;
}

bool TcpStream::Step(Sending& sending) {
   boost::system::error_code ignored;
   if (!_io.non_blocking()) _io.non_blocking(true, ignored);
   while (sending.left > 0) {
      off_t offset = static_cast<off_t>(sending.offset);
      ssize_t n = ::sendfile(_io.native_handle(), sending.fd, &offset,
                             static_cast<size_t>(std::min(sending.left, kLargestPiece)));
      if (n > 0) {
         sending.offset += n;
         sending.left -= n;
         sending.sent += n;
         continue;
      }
      if (n == 0) return true;  // the file is shorter than asked
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) return false;
      sending.error = boost::system::error_code(errno, boost::system::system_category());
      return true;
   }
   return true;
}

long long TcpStream::TrySendFile(int fd, long long offset, long long length) {
   auto sending = MakeSending(fd, offset, length);
   Synchronized lock(this);
   Step(*sending);
   if (sending->error) throw SystemException(sending->error.value(), sending->error.message());
   return sending->sent;
}

void TcpStream::Start(const std::shared_ptr<Sending>& sending, const Functor<void, Stream*, Exception*>& callback) {
   AsyncWriteOperation(
       [this, &sending] {
          if (!Step(*sending)) {
             WaitForRoom(sending);
             return;
          }
          // Completions never run inside the call that started them.
          Ref<TcpStream> self(this);
          boost::asio::post(_io.get_executor(), [self, sending] { self->Finish(true, sending->error, 0); });
       },
       callback);
}

void TcpStream::WaitForRoom(const std::shared_ptr<Sending>& sending) {
   Ref<TcpStream> self(this);
   _io.async_wait(Socket::wait_write, [self, sending](const boost::system::error_code& error) {
      if (error) {
         self->Finish(true, error, 0);
         return;
      }
      bool ended;
      {
         Synchronized lock(self.Get());
         ended = self->Step(*sending);
         if (!ended) self->WaitForRoom(sending);
      }
      if (ended) self->Finish(true, sending->error, 0);
   });
}

void TcpStream::AsyncSendFile(int fd, long long offset, long long length,
                              const Functor<void, Stream*, Exception*, long long>& callback) {
   auto sending = MakeSending(fd, offset, length);
   Start(sending, [sending, callback](Stream* stream, Exception* error) {
      if (callback) callback(stream, error, sending->sent);
   });
}

long long TcpStream::SendFile(int fd, long long offset, long long length) {
   auto sending = MakeSending(fd, offset, length);
   Start(sending, Functor<void, Stream*, Exception*>());
   WaitWrite();
   return sending->sent;
}

}  // namespace Pelmora::System
