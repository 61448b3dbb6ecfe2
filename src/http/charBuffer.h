#pragma once
// The write buffers of the response: bytes with a reserved zone in front, so that a
// header or a chunk-size line can be put before body bytes already in place.
// Offsets run from 0 (the front of the reserve) to PrependReserve() + Capacity():
// while filling, the bytes are [PrependPosition(), Position()); Flip() turns the buffer
// round for reading out [Position(), Limit()). FixedCharBuffer never grows;
// DynamicCharBuffer adds equal-size blocks as bytes arrive, up to its capacity.
// Not thread-safe.

#include <cstddef>
#include <memory>
#include <vector>

#include "pelmora/exception/throwable.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/stream.h"

namespace Pelmora::Http {

class CharBuffer {
public:
   using WriteCallback = System::Functor<void, Exception*, int>;

   CharBuffer(size_t capacity, size_t prependReserve);
   virtual ~CharBuffer();
   CharBuffer(const CharBuffer&) = delete;
   CharBuffer& operator=(const CharBuffer&) = delete;

   size_t Capacity() const { return _capacity; }
   size_t PrependReserve() const { return _reserve; }
   size_t Position() const { return _position; }
   size_t PrependPosition() const { return _prepend; }
   size_t Limit() const { return _limit; }
   // Bytes written so far (filling) or left to read (after Flip).
   size_t Filled() const { return _flipped ? _limit - _position : _position - _prepend; }
   // Room for Append.
   size_t Free() const { return _flipped ? 0 : _limit - _position; }

   void Clear();
   void Flip();
   // Copies up to `n` bytes out from Position(); returns the count.
   size_t Get(char* out, size_t n);
   // Takes as many of `n` bytes as there is room for; returns the count.
   size_t Append(const char* data, size_t n);
   // Puts all `n` bytes in front of the data, or none when the reserve left is too small;
   // returns the count.
   size_t Prepend(const char* data, size_t n);
   // Moves the bytes not yet read to the front of the body zone and fills after them.
   void Compact();

   // Writes what is left to read to `stream` and empties the buffer; returns the count.
   size_t WriteTo(System::Stream* stream);
   // As WriteTo, without waiting: `callback` gets the failure (or null) and the count.
   // The buffer must stay untouched until then.
   void AsyncWriteInt(System::Stream* stream, const WriteCallback& callback);

protected:
   // A pointer to the byte at `offset` and how many bytes follow it contiguously; storage
   // is made when missing.
   virtual char* At(size_t offset, size_t& contiguous) = 0;

private:
   void AsyncWriteNext();
   void AsyncWriteDone(Exception* error);
   void InvokeCallback(Exception* error, int count);

   size_t _capacity;
   size_t _reserve;
   size_t _prepend = 0;
   size_t _position = 0;
   size_t _limit = 0;
   bool _flipped = false;

   Ref<System::Stream> _asyncStream;
   WriteCallback _asyncCallback;
   size_t _asyncWritten = 0;
   size_t _asyncPiece = 0;
};

class FixedCharBuffer : public CharBuffer {
public:
   FixedCharBuffer(size_t capacity, size_t prependReserve);

protected:
   char* At(size_t offset, size_t& contiguous) override;

private:
   std::unique_ptr<char[]> _bytes;
};

class DynamicCharBuffer : public CharBuffer {
public:
   static constexpr size_t kBlockSize = 16384;

   // `capacity` is the most it may grow to; memory is taken a block at a time.
   DynamicCharBuffer(size_t capacity, size_t prependReserve);

   size_t BlockCount() const { return _blocks.size(); }

protected:
   char* At(size_t offset, size_t& contiguous) override;

private:
   std::vector<std::unique_ptr<char[]>> _blocks;
};

}  // namespace Pelmora::Http
