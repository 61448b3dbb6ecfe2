#pragma once
// Bytes as the journal lays them out, and whole files read and written, for the journal tests.

#include <cstdint>
#include <fstream>
#include <sstream>
#include <string>

namespace Pelmora::TestSupport {

// A little-endian 32-bit number.
inline std::string U32(uint32_t v) {
   std::string out(4, '\0');
   for (int i = 0; i < 4; ++i) out[i] = static_cast<char>(v >> (8 * i));
   return out;
}

inline std::string ReadAll(const std::string& path) {
   std::ifstream in(path, std::ios::binary);
   std::stringstream s;
   s << in.rdbuf();
   return s.str();
}

inline void WriteAll(const std::string& path, const std::string& bytes) {
   std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

}  // namespace Pelmora::TestSupport
