#include "src/http/charBuffer.h"

#include <cstring>

#include "pelmora/exception/panic.h"

namespace Pelmora::Http {

CharBuffer::CharBuffer(size_t capacity, size_t prependReserve) : _capacity(capacity), _reserve(prependReserve) {
   _prepend = _position = _reserve;
   _limit = _reserve + _capacity;
}

CharBuffer::~CharBuffer() = default;

void CharBuffer::Clear() {
   _prepend = _position = _reserve;
   _limit = _reserve + _capacity;
   _flipped = false;
}

void CharBuffer::Flip() {
   if (_flipped) return;
   _limit = _position;
   _position = _prepend;
   _flipped = true;
}

size_t CharBuffer::Get(char* out, size_t n) {
   size_t done = 0;
   while (done < n && _position < _limit) {
      size_t contiguous = 0;
      char* at = At(_position, contiguous);
      size_t take = n - done;
      if (take > contiguous) take = contiguous;
      if (take > _limit - _position) take = _limit - _position;
      std::memcpy(out + done, at, take);
      done += take;
      _position += take;
   }
   return done;
}

size_t CharBuffer::Append(const char* data, size_t n) {
   if (_flipped) return 0;
   size_t done = 0;
   while (done < n && _position < _limit) {
      size_t contiguous = 0;
      char* at = At(_position, contiguous);
      size_t take = n - done;
      if (take > contiguous) take = contiguous;
      if (take > _limit - _position) take = _limit - _position;
      std::memcpy(at, data + done, take);
      done += take;
      _position += take;
   }
   return done;
}

size_t CharBuffer::Prepend(const char* data, size_t n) {
   if (n > _prepend) return 0;
   size_t start = _prepend - n;
   size_t done = 0;
   while (done < n) {
      size_t contiguous = 0;
      char* at = At(start + done, contiguous);
      size_t take = n - done;
      if (take > contiguous) take = contiguous;
      std::memcpy(at, data + done, take);
      done += take;
   }
   // After Flip the read cursor sits on the first byte; it moves with it.
   if (_flipped && _position == _prepend) _position = start;
   _prepend = start;
   return n;
}

void CharBuffer::Compact() {
   size_t from = _flipped ? _position : _prepend;
   size_t end = _flipped ? _limit : _position;
   size_t to = _reserve;
   while (from < end) {
      size_t inContiguous = 0, outContiguous = 0;
      char* src = At(from, inContiguous);
      char* dst = At(to, outContiguous);
      size_t take = end - from;
      if (take > inContiguous) take = inContiguous;
      if (take > outContiguous) take = outContiguous;
      std::memmove(dst, src, take);
      from += take;
      to += take;
   }
   _prepend = _reserve;
   _position = to;
   _limit = _reserve + _capacity;
   _flipped = false;
}

size_t CharBuffer::WriteTo(System::Stream* stream) {
   Flip();
   size_t total = 0;
   while (_position < _limit) {
      size_t contiguous = 0;
      char* at = At(_position, contiguous);
      size_t take = _limit - _position;
      if (take > contiguous) take = contiguous;
      int written = stream->Write(at, static_cast<int>(take));
      PELMORA_VERIFY(written == static_cast<int>(take));
      _position += take;
      total += take;
   }
   Clear();
   return total;
}

void CharBuffer::AsyncWriteInt(System::Stream* stream, const WriteCallback& callback) {
   Flip();
   _asyncStream = stream;
   _asyncCallback = callback;
   _asyncWritten = 0;
   AsyncWriteNext();
}

void CharBuffer::AsyncWriteNext() {
   if (_position >= _limit) {
      InvokeCallback(nullptr, static_cast<int>(_asyncWritten));
      return;
   }
   size_t contiguous = 0;
   char* at = At(_position, contiguous);
   _asyncPiece = _limit - _position;
   if (_asyncPiece > contiguous) _asyncPiece = contiguous;
   try {
      _asyncStream->AsyncWrite(at, static_cast<int>(_asyncPiece),
                               [this](System::Stream*, Exception* error) { AsyncWriteDone(error); });
   } catch (Exception& e) {
      InvokeCallback(&e, static_cast<int>(_asyncWritten));
   }
}

void CharBuffer::AsyncWriteDone(Exception* error) {
   if (error != nullptr) {
      InvokeCallback(error, static_cast<int>(_asyncWritten));
      return;
   }
   _position += _asyncPiece;
   _asyncWritten += _asyncPiece;
   AsyncWriteNext();
}

void CharBuffer::InvokeCallback(Exception* error, int count) {
   WriteCallback callback = std::move(_asyncCallback);
   _asyncCallback.Reset();
   _asyncStream.Reset();
   if (error == nullptr) Clear();
   if (callback) callback(error, count);
}

FixedCharBuffer::FixedCharBuffer(size_t capacity, size_t prependReserve)
   : CharBuffer(capacity, prependReserve), _bytes(new char[capacity + prependReserve]) {}

char* FixedCharBuffer::At(size_t offset, size_t& contiguous) {
   contiguous = Capacity() + PrependReserve() - offset;
   return _bytes.get() + offset;
}

DynamicCharBuffer::DynamicCharBuffer(size_t capacity, size_t prependReserve)
   : CharBuffer(capacity, prependReserve) {}

char* DynamicCharBuffer::At(size_t offset, size_t& contiguous) {
   size_t block = offset / kBlockSize;
   while (_blocks.size() <= block) _blocks.emplace_back(new char[kBlockSize]);
   size_t within = offset % kBlockSize;
   contiguous = kBlockSize - within;
   return _blocks[block].get() + within;
}

}  // namespace Pelmora::Http
