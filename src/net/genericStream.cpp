// The pool's I/O service for streams, asio errors as the library's exceptions, and
// stream pairs over a Unix-domain socket pair.

#include "src/net/genericStream.h"

#if defined(__SANITIZE_THREAD__)
// Asio's fences are outside what ThreadSanitizer models; its handlers synchronise
// through the service's mutex, which it does model.
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/error.hpp>
#include <boost/asio/local/connect_pair.hpp>
#include <boost/asio/local/stream_protocol.hpp>
#include <boost/asio/ssl/error.hpp>

#include "pelmora/system/ssl.h"
#include "pelmora/system/threadPool.h"
#include "pelmora/system/threadPoolWorkBinder.h"

namespace Pelmora::System {

boost::asio::io_context& GetPoolIoContext() {
   auto* binder = dynamic_cast<ThreadPoolWorkBinder*>(GetThreadPool());
   if (binder == nullptr) throw InvalidStateException("No thread pool for streams");
   return binder->GetIoService();
}

bool IsEndOfStream(const boost::system::error_code& error) {
   // A TLS peer that closes without its close-notify ends the stream all the same.
   return error == boost::asio::error::eof || error == boost::asio::ssl::error::stream_truncated;
}

Exception* MakeStreamException(const boost::system::error_code& error) {
   if (error == boost::asio::error::operation_aborted) return new CanceledException();
   if (error.category() == boost::asio::error::get_ssl_category() ||
       error.category() == boost::asio::ssl::error::get_stream_category()) {
      return new SslException(error.message());
   }
   return new SystemException(error.value(), error.message());
}

void CreateStreamPair(Ref<Stream>& first, Ref<Stream>& second) {
   using Socket = boost::asio::local::stream_protocol::socket;
   boost::asio::io_context& io = GetPoolIoContext();
   Socket a(io);
   Socket b(io);
   boost::system::error_code error;
   boost::asio::local::connect_pair(a, b, error);
   if (error) throw SystemException(error.value(), error.message());
   std::string name = "pair " + std::to_string(a.native_handle()) + "<->" +
                      std::to_string(b.native_handle());
   first = new GenericStream<Socket>(std::move(a), nullptr, name);
   second = new GenericStream<Socket>(std::move(b), nullptr, name);
}

}  // namespace Pelmora::System
