#pragma once
// In-memory and buffering readers. Not thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/io/readerWriter.h"

namespace Pelmora {

// Reads from a caller-owned buffer, which must outlive the reader; nothing is copied.
class PELMORA_EXPORT StringReader : public virtual Reader {
public:
   virtual void SetSource(const char* data, int length) = 0;
};

// Buffers a source reader and splits it into lines.
class PELMORA_EXPORT BufferedReader : public virtual Reader {
public:
   // Reads one line without its end (LF, CR or CR LF) into `line`; false at the end of data.
   virtual bool ReadLine(std::string* line) = 0;
};

PELMORA_EXPORT void CreateStringReader(const char* data, int length, Ref<StringReader>& out);
// Holds a reference to `source`.
PELMORA_EXPORT void CreateBufferedReader(Reader* source, int bufferSize, Ref<BufferedReader>& out);

}  // namespace Pelmora
