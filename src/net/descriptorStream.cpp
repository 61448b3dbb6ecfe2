// Streams over descriptors: one for reading and one for writing (standard input and
// output, the two ends of pipes, or a socket twice), each a duplicate the stream owns.

#include <fcntl.h>
#include <unistd.h>

#if defined(__SANITIZE_THREAD__)
// Asio's fences are outside what ThreadSanitizer models; its handlers synchronise
// through the service's mutex, which it does model.
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/posix/stream_descriptor.hpp>

#include "src/net/socketImpl.h"

namespace Pelmora::System {

namespace {

using Descriptor = boost::asio::posix::stream_descriptor;

// Reads through one descriptor and writes through the other, as one asio stream.
class DuplexDescriptor {
public:
   using executor_type = Descriptor::executor_type;

   DuplexDescriptor(Descriptor&& in, Descriptor&& out) : _in(std::move(in)), _out(std::move(out)) {}

   executor_type get_executor() { return _in.get_executor(); }
   template <class Buffers, class Token>
   auto async_read_some(const Buffers& buffers, Token&& token) {
      return _in.async_read_some(buffers, std::forward<Token>(token));
   }
   template <class Buffers, class Token>
   auto async_write_some(const Buffers& buffers, Token&& token) {
      return _out.async_write_some(buffers, std::forward<Token>(token));
   }
   void close(boost::system::error_code& error) {
      _in.close(error);
      _out.close(error);
   }

private:
   Descriptor _in;
   Descriptor _out;
};

int DuplicateForStream(int fd) {
   int copy = ::fcntl(fd, F_DUPFD_CLOEXEC, 0);
   if (copy < 0) throw SystemException(errno);
   return copy;
}

}  // namespace

void CreateDescriptorStream(int readFd, int writeFd, Ref<Stream>& out) {
   boost::asio::io_context& io = GetPoolIoContext();
   int in = DuplicateForStream(readFd);
   Descriptor inDescriptor(io, in);
   int outCopy = DuplicateForStream(writeFd);
   Descriptor outDescriptor(io, outCopy);
   std::string description =
       "descriptors " + std::to_string(readFd) + "/" + std::to_string(writeFd);
   out = new GenericStream<DuplexDescriptor>(
       DuplexDescriptor(std::move(inDescriptor), std::move(outDescriptor)), nullptr, description);
}

}  // namespace Pelmora::System
