#pragma once
// The round trip every configuration syntax must survive on fuzzed text: only
// FileFormatException may leave reading it; a tree that reads writes back (or, where the
// syntax cannot hold it, is refused with InvalidArgumentException); and what was written
// reads again and writes to the same text.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"

namespace PelmoraFuzz {

// `read(text, out)` makes a configuration over `text` and reads it.
template <class Read>
int CheckConfigRoundTrip(const uint8_t* data, size_t size, Read read, bool mayRefuseWrite) {
   using namespace Pelmora;
   std::string text(reinterpret_cast<const char*>(data), size);
   Ref<Service::Config> config;
   try {
      read(text, config);
   } catch (const FileFormatException&) {
      return 0;
   }
   try {
      config->Flush();  // into `text`
   } catch (const InvalidArgumentException& e) {
      if (mayRefuseWrite) return 0;
      std::fprintf(stderr, "a read tree does not write (%s)\n", e.what());
      std::abort();
   }
   std::string written = text;
   Ref<Service::Config> copy;
   try {
      read(written, copy);
   } catch (const FileFormatException& e) {
      std::fprintf(stderr, "written text does not read (%s):\n%s\n", e.what(), written.c_str());
      std::abort();
   }
   copy->Flush();
   if (written != text) {
      std::fprintf(stderr, "second write differs:\n%s\n---\n%s\n", text.c_str(), written.c_str());
      std::abort();
   }
   return 0;
}

}  // namespace PelmoraFuzz
