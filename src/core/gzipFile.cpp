// gzip streams over zlib, stacked on a caller's reader or writer.

#include <zlib.h>

#include <cstring>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/gzip.h"

namespace Pelmora {

namespace {

constexpr int kGzipWindowBits = 15 + 16;  // 32 KB window, gzip header and trailer
constexpr int kChunk = 16384;

const char* ZlibText(int code) {
   switch (code) {
      case Z_STREAM_END: return "Stream end";
      case Z_NEED_DICT: return "Need dict";
      case Z_STREAM_ERROR: return "Stream error";
      case Z_DATA_ERROR: return "Data error";
      case Z_MEM_ERROR: return "Memory error";
      case Z_BUF_ERROR: return "Buffer error";
      case Z_VERSION_ERROR: return "Version error";
      default: return "Unknown error";
   }
}

[[noreturn]] void ThrowZlib(int code, const std::string& name) {
   throw FileIOException(ZlibText(code), name);
}

class GzippedFileReader : public Reader, public ObjectImpl {
public:
   GzippedFileReader(Reader* source, const std::string& name)
       : _source(source), _name(name), _input(kChunk) {
      std::memset(&_stream, 0, sizeof(_stream));
      int rc = inflateInit2(&_stream, kGzipWindowBits);
      if (rc != Z_OK) ThrowZlib(rc, _name);
   }
   ~GzippedFileReader() override { inflateEnd(&_stream); }

   int Read(char* buffer, int length) override {
      if (_closed) throw InvalidStateException();
      if (length <= 0) return 0;
      _stream.next_out = reinterpret_cast<Bytef*>(buffer);
      _stream.avail_out = static_cast<uInt>(length);
      while (_stream.avail_out == static_cast<uInt>(length)) {
         if (_stream.avail_in == 0 && !FillInput()) {
            // The source ended: fine between members, too early inside one.
            if (_betweenMembers) return -1;
            ThrowZlib(Z_BUF_ERROR, _name);
         }
         if (_betweenMembers) {
            inflateReset(&_stream);
            _betweenMembers = false;
         }
         int rc = inflate(&_stream, Z_NO_FLUSH);
         if (rc == Z_STREAM_END) {
            _betweenMembers = true;
         } else if (rc != Z_OK) {
            // Z_BUF_ERROR here means no progress with input left: corrupt data.
            ThrowZlib(rc == Z_BUF_ERROR ? Z_DATA_ERROR : rc, _name);
         }
      }
      return length - static_cast<int>(_stream.avail_out);
   }

   void Close() override {
      if (_closed) return;
      _closed = true;
      _source->Close();
   }

private:
   bool FillInput() {
      int n = _source->Read(_input.data(), kChunk);
      if (n <= 0) return false;
      _stream.next_in = reinterpret_cast<Bytef*>(_input.data());
      _stream.avail_in = static_cast<uInt>(n);
      return true;
   }

   Ref<Reader> _source;
   std::string _name;
   std::vector<char> _input;
   z_stream _stream;
   // The first member has not begun yet, or the last one ended: end of input is clean.
   bool _betweenMembers = false;
   bool _closed = false;
};

class GzippedFileWriter : public Writer, public ObjectImpl {
public:
   GzippedFileWriter(Writer* target, const std::string& name)
       : _target(target), _name(name), _output(kChunk) {
      std::memset(&_stream, 0, sizeof(_stream));
      int rc = deflateInit2(&_stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, kGzipWindowBits, 8,
                            Z_DEFAULT_STRATEGY);
      if (rc != Z_OK) ThrowZlib(rc, _name);
   }
   ~GzippedFileWriter() override { deflateEnd(&_stream); }

   void Write(const char* data, int length) override {
      if (_closed) throw InvalidStateException();
      if (length <= 0) return;
      _stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(data));
      _stream.avail_in = static_cast<uInt>(length);
      Deflate(Z_NO_FLUSH);
   }

   // Hands the compressed bytes so far on; the stream stays open.
   void Flush() override {
      if (_closed) return;
      Deflate(Z_SYNC_FLUSH);
      _target->Flush();
   }

   void Close() override {
      if (_closed) return;
      _closed = true;
      Deflate(Z_FINISH);
      _target->Flush();
      _target->Close();
   }

private:
   void Deflate(int flush) {
      for (;;) {
         _stream.next_out = reinterpret_cast<Bytef*>(_output.data());
         _stream.avail_out = kChunk;
         int rc = deflate(&_stream, flush);
         if (rc != Z_OK && rc != Z_STREAM_END && rc != Z_BUF_ERROR) ThrowZlib(rc, _name);
         int produced = kChunk - static_cast<int>(_stream.avail_out);
         if (produced > 0) _target->Write(_output.data(), produced);
         if (flush == Z_FINISH ? rc == Z_STREAM_END : _stream.avail_out != 0) break;
      }
   }

   Ref<Writer> _target;
   std::string _name;
   std::vector<char> _output;
   z_stream _stream;
   bool _closed = false;
};

}  // namespace

void CreateGzippedFileReader(Reader* source, const std::string& name, Ref<Reader>& out) {
   if (!source) throw InvalidArgumentException("source");
   out = new GzippedFileReader(source, name);
}

void CreateGzippedFileWriter(Writer* target, const std::string& name, Ref<Writer>& out) {
   if (!target) throw InvalidArgumentException("target");
   out = new GzippedFileWriter(target, name);
}

}  // namespace Pelmora
