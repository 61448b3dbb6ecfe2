// The in-memory reader and writer: a string that grows, and a view of a caller's bytes.

#include <cstring>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"

namespace Pelmora {

class StringWriterImpl : public virtual StringWriter, public ObjectImpl {
public:
   void Write(const char* data, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      _string.append(data, static_cast<size_t>(length));
   }
   void Close() override {}

   // Keeps the capacity: a writer that is reset is usually refilled to a similar size.
   void Reset() override { _string.clear(); }
   int GetLength() override { return static_cast<int>(_string.size()); }
   const std::string& GetString() const override { return _string; }
   void Reserve(unsigned int size) override { _string.reserve(size); }

private:
   std::string _string;
};

class StringReaderImpl : public virtual StringReader, public ObjectImpl {
public:
   StringReaderImpl(const char* data, int length) { SetSource(data, length); }

   void SetSource(const char* data, int length) override {
      if (length < 0 || (!data && length > 0)) throw InvalidArgumentException("length");
      _source = data;
      _length = length;
      _position = 0;
   }

   int Read(char* buffer, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      int remaining = _length - _position;
      if (remaining == 0) return -1;
      int count = length < remaining ? length : remaining;
      if (count > 0) memcpy(buffer, _source + _position, static_cast<size_t>(count));
      _position += count;
      return count;
   }

   // Lets go of the caller's bytes, which may be freed from now on; later reads see the end.
   void Close() override { SetSource(nullptr, 0); }

private:
   const char* _source = nullptr;
   int _length = 0;
   int _position = 0;
};

void CreateStringWriter(Ref<StringWriter>& out) {
   out = new StringWriterImpl();
}

void CreateStringReader(const char* data, int length, Ref<StringReader>& out) {
   out = new StringReaderImpl(data, length);
}

}  // namespace Pelmora
