#pragma once
// GenericStream moves a StreamBase's bytes over one Boost.Asio I/O object (a socket, a
// descriptor, a TLS stream). Reads take what is there; writes send everything. Its
// completions run on the pool thread that served the I/O, or, when the stream was given a
// work queue, on that queue. The asio object is touched only under the stream's lock.
// A serialized stream (TLS: its engine serves both directions) keeps its I/O object on a
// strand: operations start and close inside it, and completions leave it, so a callback
// may wait for the other direction.

#include <cstddef>
#include <string>
#include <utility>

#if defined(__SANITIZE_THREAD__)
// Asio's fences are outside what ThreadSanitizer models; its handlers synchronise
// through the service's mutex, which it does model.
#pragma GCC diagnostic ignored "-Wtsan"
#endif
#include <boost/asio/buffer.hpp>
#include <boost/asio/dispatch.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/post.hpp>

#include "pelmora/system/workQueue.h"
#include "src/net/streamBase.h"

namespace Pelmora::System {

// The process's pool's I/O service; InvalidStateException when no pool is set.
boost::asio::io_context& GetPoolIoContext();
// The library's exception for a failed asio operation: SslException for TLS failures,
// CanceledException for an aborted operation, SystemException otherwise.
Exception* MakeStreamException(const boost::system::error_code& error);
// Whether a read error means the peer ended the stream.
bool IsEndOfStream(const boost::system::error_code& error);

template <class Io, bool kSerialized = false>
class GenericStream : public StreamBase {
public:
   GenericStream(Io&& io, WorkQueue* queue, std::string description)
       : StreamBase(std::move(description)), _io(std::move(io)), _queue(queue) {}

   Io& GetIo() { return _io; }
   using StreamBase::SetBindings;

protected:
   void StartRead(char* buffer, int length) override {
      Ref<GenericStream> self(this);
      if constexpr (kSerialized) {
         boost::asio::dispatch(_io.get_executor(), [self, buffer, length] { self->ReadNow(buffer, length); });
      } else {
         ReadNow(buffer, length);
      }
   }

   void StartWrite(const char* buffer, int length) override {
      Ref<GenericStream> self(this);
      if constexpr (kSerialized) {
         boost::asio::dispatch(_io.get_executor(), [self, buffer, length] { self->WriteNow(buffer, length); });
      } else {
         WriteNow(buffer, length);
      }
   }

   void CloseIo() override {
      if constexpr (kSerialized) {
         Ref<GenericStream> self(this);
         boost::asio::dispatch(_io.get_executor(), [self] { self->CloseNow(); });
      } else {
         CloseNow();
      }
   }

   void ReadNow(char* buffer, int length) {
      Ref<GenericStream> self(this);
      _io.async_read_some(boost::asio::buffer(buffer, static_cast<std::size_t>(length)),
                          [self](const boost::system::error_code& error, std::size_t bytes) {
                             self->Finish(false, error, bytes);
                          });
   }

   int TryWriteNow(const char* buffer, int length) override {
      if constexpr (kSerialized || !requires { _io.non_blocking(true); }) {
         (void)buffer;
         (void)length;
         return -1;
      } else {
         boost::system::error_code error;
         // Setting the mode is an ioctl each time; asking is not.
         if (!_io.non_blocking()) _io.non_blocking(true, error);
         if (error) return -1;
         std::size_t bytes = _io.write_some(boost::asio::buffer(buffer, static_cast<std::size_t>(length)), error);
         return error ? -1 : static_cast<int>(bytes);
      }
   }

   // Writes the rest from `written` on. Each further piece starts from the completion of
   // the previous one, under the stream's lock (or inside the strand), like every other
   // use of the I/O object, so that a concurrent Close never races it.
   void WriteNow(const char* buffer, int length, int written = 0) {
      Ref<GenericStream> self(this);
      _io.async_write_some(
          boost::asio::buffer(buffer + written, static_cast<std::size_t>(length - written)),
          [self, buffer, length, written](const boost::system::error_code& error, std::size_t bytes) {
             int total = written + static_cast<int>(bytes);
             if (!error && total < length) {
                if constexpr (kSerialized) {
                   self->WriteNow(buffer, length, total);
                } else {
                   Synchronized lock(self.Get());
                   self->WriteNow(buffer, length, total);
                }
                return;
             }
             self->Finish(true, error, static_cast<std::size_t>(total));
          });
   }

   void CloseNow() {
      boost::system::error_code ignored;
      if constexpr (requires { _io.close(ignored); }) {
         _io.close(ignored);
      } else {
         _io.lowest_layer().close(ignored);
      }
   }

   void Finish(bool isWrite, const boost::system::error_code& error, std::size_t bytes) {
      if (_queue) {
         Ref<GenericStream> self(this);
         _queue->Enqueue([self, isWrite, error, bytes] { self->Deliver(isWrite, error, bytes); });
      } else if constexpr (kSerialized) {
         Ref<GenericStream> self(this);
         boost::asio::post(GetPoolIoContext(), [self, isWrite, error, bytes] {
            self->Deliver(isWrite, error, bytes);
         });
      } else {
         Deliver(isWrite, error, bytes);
      }
   }

   void Deliver(bool isWrite, const boost::system::error_code& error, std::size_t bytes) {
      if (!error) {
         CompleteIO(isWrite, nullptr, static_cast<int>(bytes));
      } else if (!isWrite && IsEndOfStream(error)) {
         CompleteIO(isWrite, nullptr, 0);
      } else {
         std::unique_ptr<Exception> failure(MakeStreamException(error));
         CompleteIO(isWrite, failure.get(), static_cast<int>(bytes));
      }
   }

   Io _io;
   Ref<WorkQueue> _queue;
};

}  // namespace Pelmora::System
