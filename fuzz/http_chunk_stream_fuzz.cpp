// Fuzzes the pass-through chunk decoder: fed in pieces (the first byte picks the size),
// it reports the same end of message as when fed whole, never more bytes than given, and
// nothing after it has failed.

#include <cstdint>
#include <cstdlib>

#include "pelmora/http/chunkStreamDecoder.h"
#include "pelmora/io/writers.h"

using namespace Pelmora;
using namespace Pelmora::Http;

namespace {

Service::Logger* QuietLogger() {
   static Service::Logger* logger = [] {
      Ref<StringWriter> sink;
      CreateStringWriter(sink);
      Ref<Service::Logger> made;
      Service::CreateLogger(sink.Get(), "fuzz", "none", nullptr, made);
      return made.Release();
   }();
   return logger;
}

// Bytes of the message, -1 when it failed, -2 when it has not ended.
long long Follow(const char* in, size_t length, size_t piece) {
   ChunkStreamDecoder decoder(QuietLogger());
   size_t consumed = 0;
   while (consumed < length) {
      size_t n = piece < length - consumed ? piece : length - consumed;
      int used = decoder.ProcessBuffer(in + consumed, static_cast<int>(n));
      if (used < 0) {
         if (!decoder.HasFailed()) abort();
         return -1;
      }
      if (static_cast<size_t>(used) > n) abort();
      consumed += static_cast<size_t>(used);
      if (decoder.IsDone()) return static_cast<long long>(consumed);
      if (static_cast<size_t>(used) != n) abort();
   }
   return -2;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   if (size < 1) return 0;
   const char* in = reinterpret_cast<const char*>(data + 1);
   size_t length = size - 1;
   if (Follow(in, length, data[0] % 16 + 1) != Follow(in, length, length ? length : 1)) abort();
   return 0;
}
