#pragma once
// In-memory, buffering, ring and fan-out writers. Not thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/io/readerWriter.h"

namespace Pelmora {

// Collects everything written in a growing string.
class PELMORA_EXPORT StringWriter : public virtual Writer {
public:
   virtual void Reset() = 0;
   virtual int GetLength() = 0;
   virtual const std::string& GetString() const = 0;
   virtual void Reserve(unsigned int size) = 0;
};

// Buffers writes to a target writer; pieces larger than the buffer go straight through.
class PELMORA_EXPORT BufferedWriter : public virtual Writer {};

// Collects writes in 1024-byte blocks, then reads them back. The first Read switches it
// to read mode for good: a later Write throws InvalidStateException.
class PELMORA_EXPORT WriteReadBuffer : public virtual Writer, public virtual Reader {
public:
   virtual long long GetSize() = 0;
   virtual void Rewind() = 0;
   using Writer::Close;
};

// Keeps the most recent bytes written in a fixed ring. After every write the 13-byte
// marker "**********" + three zero bytes stands at the write position, so a reader of the
// raw memory (a core dump, the in-memory log) finds where the newest data ends.
class PELMORA_EXPORT RingBufferWriter : public virtual Writer {
public:
   virtual void Reset() = 0;
   virtual const char* GetCurrentWritePointer() = 0;
   virtual const char* GetBufferStart() = 0;
   virtual int GetRingSize() const = 0;
};

// The ring used for text: it can also hand back what it holds, oldest first.
class PELMORA_EXPORT RingStringWriter : public virtual RingBufferWriter {
public:
   // The bytes the ring holds in the order written, without the marker.
   virtual std::string GetText() const = 0;
};

PELMORA_EXPORT void CreateStringWriter(Ref<StringWriter>& out);
// Holds a reference to `target`.
PELMORA_EXPORT void CreateBufferedWriter(int bufferSize, Writer* target, Ref<BufferedWriter>& out);
PELMORA_EXPORT void CreateWriteReadBuffer(Ref<WriteReadBuffer>& out);
PELMORA_EXPORT void CreateRingBufferWriter(int size, Ref<RingBufferWriter>& out);
PELMORA_EXPORT void CreateRingStringWriter(int size, Ref<RingBufferWriter>& out);
PELMORA_EXPORT void CreateRingStringWriter(int size, Ref<RingStringWriter>& out);
// Writes every piece to both targets; both must be given (InvalidArgumentException).
PELMORA_EXPORT void CreateDoubleWriter(Writer* first, Writer* second, Ref<Writer>& out);

}  // namespace Pelmora
