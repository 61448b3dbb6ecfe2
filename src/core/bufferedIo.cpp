// Buffering in front of a source reader (with line splitting) and behind a target writer.

#include <cstring>
#include <memory>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"

namespace Pelmora {

namespace {

constexpr char lineFeed = 10;
constexpr char carriageReturn = 13;

}  // namespace

class BufferedReaderImpl : public virtual BufferedReader, public ObjectImpl {
public:
   BufferedReaderImpl(Reader* source, int bufferSize)
       : _source(source), _bufferSize(bufferSize), _buffer(new char[bufferSize]) {}

   int Read(char* buffer, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      if (!Recharge()) return -1;
      if (length < 1) return 0;
      int copied = 0;
      // Fills the whole request unless the source ends, even if that takes several reads.
      while (copied < length && Recharge()) {
         int count = length - copied < _numBufferedBytes ? length - copied : _numBufferedBytes;
         Take(buffer + copied, count);
         copied += count;
      }
      return copied;
   }

   bool ReadLine(std::string* line) override {
      if (!line) throw InvalidArgumentException("line");
      line->clear();
      bool readSome = false;
      while (Recharge()) {
         const char* start = _buffer.get() + _position;
         int count = 0;
         while (count < _numBufferedBytes && start[count] != lineFeed &&
                start[count] != carriageReturn) {
            ++count;
         }
         line->append(start, static_cast<size_t>(count));
         readSome = true;
         if (count == _numBufferedBytes) {
            Skip(count);
            continue;
         }
         char lineEnd = start[count];
         Skip(count + 1);
         // The LF of a CR LF pair may only arrive with the next recharge.
         if (lineEnd == carriageReturn && Recharge() && _buffer[_position] == lineFeed) Skip(1);
         return true;
      }
      return readSome;
   }

   void Close() override {
      _numBufferedBytes = 0;
      _position = 0;
      _source->Close();
   }

private:
   // Makes sure bytes are buffered; false at the end of the data. A source answering 0 has
   // nothing yet, not nothing ever, so it is asked again.
   bool Recharge() {
      if (_numBufferedBytes > 0) return true;
      int count;
      do {
         count = _source->Read(_buffer.get(), _bufferSize);
      } while (count == 0);
      if (count < 0) return false;
      _numBufferedBytes = count;
      _position = 0;
      return true;
   }

   void Skip(int numBytes) {
      PELMORA_VERIFY(numBytes <= _numBufferedBytes);
      _position += numBytes;
      _numBufferedBytes -= numBytes;
   }

   void Take(char* out, int numBytes) {
      PELMORA_VERIFY(numBytes <= _numBufferedBytes);
      memcpy(out, _buffer.get() + _position, static_cast<size_t>(numBytes));
      _position += numBytes;
      _numBufferedBytes -= numBytes;
   }

   Ref<Reader> _source;
   int _bufferSize;
   std::unique_ptr<char[]> _buffer;
   int _numBufferedBytes = 0;
   int _position = 0;
};

class BufferedWriterImpl : public virtual BufferedWriter, public ObjectImpl {
public:
   BufferedWriterImpl(int bufferSize, Writer* target)
       : _target(target), _bufferSize(bufferSize), _buffer(new char[bufferSize]) {}

   // Buffered bytes must not vanish with the writer; there is no one to tell of a failure.
   ~BufferedWriterImpl() override {
      if (_numBufferedBytes == 0) return;
      try {
         Flush();
      } catch (...) {
      }
   }

   void Write(const char* data, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      if (length > _bufferSize) {
         // Copying a piece this large would only cost time; the order is kept by draining first.
         Drain();
         _target->Write(data, length);
         return;
      }
      if (length > _bufferSize - _numBufferedBytes) Drain();
      if (length > 0) memcpy(_buffer.get() + _numBufferedBytes, data, static_cast<size_t>(length));
      _numBufferedBytes += length;
   }

   void Flush() override {
      Drain();
      _target->Flush();
   }

   void Close() override {
      Flush();
      _target->Close();
   }

private:
   // Hands the buffered bytes to the target without flushing it: a full buffer is not a
   // request to push the bytes further. They stay buffered if the target throws.
   void Drain() {
      if (_numBufferedBytes == 0) return;
      _target->Write(_buffer.get(), _numBufferedBytes);
      _numBufferedBytes = 0;
   }

   Ref<Writer> _target;
   int _bufferSize;
   std::unique_ptr<char[]> _buffer;
   int _numBufferedBytes = 0;
};

void CreateBufferedReader(Reader* source, int bufferSize, Ref<BufferedReader>& out) {
   if (!source) throw InvalidArgumentException("source");
   if (bufferSize <= 0) throw InvalidArgumentException("bufferSize");
   out = new BufferedReaderImpl(source, bufferSize);
}

void CreateBufferedWriter(int bufferSize, Writer* target, Ref<BufferedWriter>& out) {
   if (!target) throw InvalidArgumentException("target");
   if (bufferSize <= 0) throw InvalidArgumentException("bufferSize");
   out = new BufferedWriterImpl(bufferSize, target);
}

}  // namespace Pelmora
