#pragma once
// Files compiled into the daemon at build time (embed.cmake): the status page and the
// default configuration. The bytes are followed by a terminating zero not counted in
// `size`, so text files can be used as C strings.

#include <cstddef>
#include <string>

namespace Pelmora::Daemon {

struct EmbeddedFile {
   const char* name;
   const unsigned char* data;
   size_t size;
};

// The file embedded under `name` ("/index.html", "defaults.xml"), or null.
const EmbeddedFile* FindEmbeddedFile(const std::string& name);

}  // namespace Pelmora::Daemon
