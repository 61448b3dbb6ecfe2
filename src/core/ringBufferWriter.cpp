// The ring that keeps the newest bytes written, with an end marker that a reader of the raw
// memory (a core dump) can find.

#include <cstring>
#include <memory>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"

namespace Pelmora {

namespace {

constexpr int markerSize = 13;
constexpr char marker[markerSize] = {'*', '*', '*', '*', '*', '*', '*', '*', '*', '*', 0, 0, 0};

}  // namespace

// The ring's N bytes are followed by markerSize spare bytes. The write position never
// exceeds N, so the marker written there always ends within the allocation.
class RingBufferWriterImpl : public virtual RingBufferWriter, public ObjectImpl {
public:
   explicit RingBufferWriterImpl(int size)
       : _size(size), _ring(std::make_unique<char[]>(static_cast<size_t>(size) + markerSize)) {}

   void Write(const char* data, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      if (length > _size) throw NotSupportedException();
      int room = _size - _position;
      if (length <= room) {
         // Ending exactly at the ring's end does not wrap: the marker goes to the spare bytes.
         if (length > 0) memcpy(_ring.get() + _position, data, static_cast<size_t>(length));
         _position += length;
      } else {
         if (room > 0) memcpy(_ring.get() + _position, data, static_cast<size_t>(room));
         // A marker left in the spare bytes would point at data that is no longer the newest.
         memset(_ring.get() + _size, 0, markerSize);
         memcpy(_ring.get(), data + room, static_cast<size_t>(length - room));
         _position = length - room;
         _wrapped = true;
      }
      memcpy(_ring.get() + _position, marker, markerSize);
   }

   // The ring stays readable after closing: it is kept for the core dump.
   void Close() override {}

   void Reset() override {
      memset(_ring.get(), 0, static_cast<size_t>(_size) + markerSize);
      _position = 0;
      _wrapped = false;
   }

   const char* GetCurrentWritePointer() override { return _ring.get() + _position; }
   const char* GetBufferStart() override { return _ring.get(); }
   int GetRingSize() const override { return _size; }

protected:
   int _size;
   std::unique_ptr<char[]> _ring;
   int _position = 0;
   // Whether the ring has been filled once; before that, the bytes past the marker were
   // never written.
   bool _wrapped = false;
};

class RingStringWriterImpl : public virtual RingStringWriter, public RingBufferWriterImpl {
public:
   explicit RingStringWriterImpl(int size) : RingBufferWriterImpl(size) {}

   // Oldest first: what follows the marker up to the ring's end, then the start up to the
   // write position. The marker has overwritten the bytes it covers.
   std::string GetText() const override {
      std::string text;
      if (_wrapped && _position + markerSize < _size) {
         text.assign(_ring.get() + _position + markerSize,
                     static_cast<size_t>(_size - _position - markerSize));
      }
      text.append(_ring.get(), static_cast<size_t>(_position));
      return text;
   }
};

void CreateRingBufferWriter(int size, Ref<RingBufferWriter>& out) {
   if (size <= 0) throw InvalidArgumentException("size");
   out = new RingBufferWriterImpl(size);
}

void CreateRingStringWriter(int size, Ref<RingStringWriter>& out) {
   if (size <= 0) throw InvalidArgumentException("size");
   out = new RingStringWriterImpl(size);
}

void CreateRingStringWriter(int size, Ref<RingBufferWriter>& out) {
   Ref<RingStringWriter> writer;
   CreateRingStringWriter(size, writer);
   out = writer;
}

}  // namespace Pelmora
