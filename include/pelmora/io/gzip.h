#pragma once
// Readers and writers of the gzip file format over zlib, stacked on another reader or
// writer (a file's, usually). zlib failures raise FileIOException whose message is zlib's
// condition ("Data error", "Buffer error" for input that ends early, ...) and whose path
// is the `name` given. Not thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/io/readerWriter.h"

namespace Pelmora {

// Inflates what `source` delivers (one gzip member or several in a row); holds a reference
// to `source` and closes it on Close.
PELMORA_EXPORT void CreateGzippedFileReader(Reader* source, const std::string& name, Ref<Reader>& out);
// Deflates into `target`, holding a reference to it. Close writes the gzip trailer, then
// flushes and closes `target`; a writer dropped without Close leaves the stream unfinished.
PELMORA_EXPORT void CreateGzippedFileWriter(Writer* target, const std::string& name, Ref<Writer>& out);

}  // namespace Pelmora
