#pragma once
// Binds asynchronous I/O objects to the pool: their completions run on pool threads
// because they are created on the pool's I/O service. Only implementation files that
// include Boost.Asio use the service; the header needs no Asio. Thread-safe.

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace boost::asio {
class io_context;
}

namespace Pelmora::System {

class PELMORA_EXPORT ThreadPoolWorkBinder : public virtual Object {
public:
   // Lives as long as the pool.
   virtual boost::asio::io_context& GetIoService() = 0;
};

}  // namespace Pelmora::System
