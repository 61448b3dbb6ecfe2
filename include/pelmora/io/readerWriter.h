#pragma once
// Reader and Writer are the byte sources and sinks that parsers read from and
// serialisers write to. An instance is not thread-safe unless its class says so.

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora {

class PELMORA_EXPORT Reader : public virtual Object {
public:
   // Places up to `length` bytes in `buffer`; returns their number, or -1 at the end.
   virtual int Read(char* buffer, int length) = 0;
   virtual void Close() = 0;
};

class PELMORA_EXPORT Writer : public virtual Object {
public:
   virtual void Write(const char* data, int length) = 0;
   virtual void Close() = 0;
   // Hands buffered bytes on; does nothing for writers that do not buffer.
   virtual void Flush() {}
};

}  // namespace Pelmora
