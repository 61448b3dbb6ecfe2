// Character checks for the XML syntax.

#include "src/config/configText.h"

#include <cstdint>

namespace Pelmora::Service {

namespace {

// Decodes one character at `i`, advancing it; false for malformed UTF-8.
bool Decode(std::string_view text, size_t& i, uint32_t& code) {
   auto byte = [&](size_t k) { return static_cast<unsigned char>(text[k]); };
   unsigned char first = byte(i);
   int extra;
   uint32_t min;
   if (first < 0x80) {
      code = first;
      ++i;
      return true;
   } else if ((first & 0xE0) == 0xC0) {
      code = first & 0x1F;
      extra = 1;
      min = 0x80;
   } else if ((first & 0xF0) == 0xE0) {
      code = first & 0x0F;
      extra = 2;
      min = 0x800;
   } else if ((first & 0xF8) == 0xF0) {
      code = first & 0x07;
      extra = 3;
      min = 0x10000;
   } else {
      return false;
   }
   if (i + extra >= text.size()) return false;
   for (int k = 1; k <= extra; ++k) {
      unsigned char b = byte(i + k);
      if ((b & 0xC0) != 0x80) return false;
      code = (code << 6) | (b & 0x3F);
   }
   i += extra + 1;
   return code >= min && code <= 0x10FFFF && !(code >= 0xD800 && code <= 0xDFFF);
}

bool IsXmlChar(uint32_t c) {
   if (c < 0x20) return c == '\t' || c == '\n' || c == '\r';
   return c != 0xFFFE && c != 0xFFFF;
}

bool IsNameStart(uint32_t c) {
   return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_' || c == ':' ||
          (c >= 0xC0 && c <= 0xD6) || (c >= 0xD8 && c <= 0xF6) || (c >= 0xF8 && c <= 0x2FF) ||
          (c >= 0x370 && c <= 0x37D) || (c >= 0x37F && c <= 0x1FFF) || (c >= 0x200C && c <= 0x200D) ||
          (c >= 0x2070 && c <= 0x218F) || (c >= 0x2C00 && c <= 0x2FEF) ||
          (c >= 0x3001 && c <= 0xD7FF) || (c >= 0xF900 && c <= 0xFDCF) ||
          (c >= 0xFDF0 && c <= 0xFFFD) || (c >= 0x10000 && c <= 0xEFFFF);
}

bool IsNameChar(uint32_t c) {
   return IsNameStart(c) || (c >= '0' && c <= '9') || c == '.' || c == '-' || c == 0xB7 ||
          (c >= 0x300 && c <= 0x36F) || (c >= 0x203F && c <= 0x2040);
}

}  // namespace

bool IsXmlText(std::string_view text) {
   size_t i = 0;
   uint32_t code;
   while (i < text.size()) {
      if (!Decode(text, i, code) || !IsXmlChar(code)) return false;
   }
   return true;
}

bool IsXmlName(std::string_view name) {
   size_t i = 0;
   uint32_t code;
   bool first = true;
   while (i < name.size()) {
      if (!Decode(name, i, code) || !IsXmlChar(code)) return false;
      if (first ? !IsNameStart(code) : !IsNameChar(code)) return false;
      first = false;
   }
   return !first;
}

}  // namespace Pelmora::Service
