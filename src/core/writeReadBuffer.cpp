// A buffer written in fixed blocks, so that growing it never moves what is already written,
// and then read back from the start.

#include <cstring>
#include <memory>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"

namespace Pelmora {

namespace {

constexpr int blockSize = 1024;

}  // namespace

class WriteReadBufferImpl : public virtual WriteReadBuffer, public ObjectImpl {
public:
   void Write(const char* data, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      if (_reading) throw InvalidStateException();
      while (length > 0) {
         if (_blocks.empty() || _writeOffset == blockSize) {
            _blocks.push_back(std::make_unique_for_overwrite<char[]>(blockSize));
            _writeOffset = 0;
         }
         int count = length < blockSize - _writeOffset ? length : blockSize - _writeOffset;
         memcpy(_blocks.back().get() + _writeOffset, data, static_cast<size_t>(count));
         _writeOffset += count;
         _size += count;
         data += count;
         length -= count;
      }
   }

   int Read(char* buffer, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      _reading = true;
      long long unread = _size - (static_cast<long long>(_readBlock) * blockSize + _readOffset);
      if (unread == 0) return -1;
      int total = length < unread ? length : static_cast<int>(unread);
      int copied = 0;
      while (copied < total) {
         if (_readOffset == blockSize) {
            ++_readBlock;
            _readOffset = 0;
         }
         int count =
             total - copied < blockSize - _readOffset ? total - copied : blockSize - _readOffset;
         memcpy(buffer + copied, _blocks[_readBlock].get() + _readOffset,
                static_cast<size_t>(count));
         _readOffset += count;
         copied += count;
      }
      return copied;
   }

   void Rewind() override {
      _readBlock = 0;
      _readOffset = 0;
   }

   long long GetSize() override { return _size; }

   // The bytes stay readable: closing the writing side is what usually precedes reading.
   void Close() override {}

private:
   std::vector<std::unique_ptr<char[]>> _blocks;
   int _writeOffset = 0;
   long long _size = 0;
   bool _reading = false;
   size_t _readBlock = 0;
   int _readOffset = 0;
};

void CreateWriteReadBuffer(Ref<WriteReadBuffer>& out) {
   out = new WriteReadBufferImpl();
}

}  // namespace Pelmora
