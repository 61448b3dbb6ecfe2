#include "tools/pelmorad/json.h"

#include <cmath>
#include <cstdio>

namespace Pelmora::Daemon {

namespace {

// Length of the valid UTF-8 sequence starting at `p` (at most `left` bytes), or 0.
size_t Utf8Length(const unsigned char* p, size_t left) {
   unsigned char c = p[0];
   size_t length;
   unsigned min;
   unsigned code;
   if (c < 0x80) return 1;
   if (c >= 0xC2 && c <= 0xDF) length = 2, code = c & 0x1F, min = 0x80;
   else if (c >= 0xE0 && c <= 0xEF) length = 3, code = c & 0x0F, min = 0x800;
   else if (c >= 0xF0 && c <= 0xF4) length = 4, code = c & 0x07, min = 0x10000;
   else return 0;
   if (left < length) return 0;
   for (size_t i = 1; i < length; ++i) {
      if ((p[i] & 0xC0) != 0x80) return 0;
      code = (code << 6) | (p[i] & 0x3F);
   }
   if (code < min || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF)) return 0;
   return length;
}

}  // namespace

void AppendJsonString(std::string& out, std::string_view text) {
   out += '"';
   const auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
   size_t i = 0;
   while (i < text.size()) {
      unsigned char c = bytes[i];
      if (c == '"' || c == '\\') {
         out += '\\';
         out += static_cast<char>(c);
      } else if (c == '\n') {
         out += "\\n";
      } else if (c == '\t') {
         out += "\\t";
      } else if (c == '\r') {
         out += "\\r";
      } else if (c < 0x20 || c == 0x7F) {
         char escape[8];
         std::snprintf(escape, sizeof escape, "\\u%04x", c);
         out += escape;
      } else if (c >= 0x80) {
         size_t length = Utf8Length(bytes + i, text.size() - i);
         if (length == 0) {
            out += "\xEF\xBF\xBD";
            ++i;
            continue;
         }
         out.append(text.data() + i, length);
         i += length;
         continue;
      } else {
         out += static_cast<char>(c);
      }
      ++i;
   }
   out += '"';
}

void JsonWriter::Separate() {
   if (_afterKey) {
      _afterKey = false;
      return;
   }
   if (!_first) _out += ',';
   _first = false;
}

JsonWriter& JsonWriter::Open(char bracket) {
   Separate();
   _out += bracket;
   _first = true;
   return *this;
}

JsonWriter& JsonWriter::Close(char bracket) {
   _out += bracket;
   _first = false;
   return *this;
}

JsonWriter& JsonWriter::Key(std::string_view name) {
   Separate();
   AppendJsonString(_out, name);
   _out += ':';
   _afterKey = true;
   return *this;
}

JsonWriter& JsonWriter::String(std::string_view value) {
   Separate();
   AppendJsonString(_out, value);
   return *this;
}

JsonWriter& JsonWriter::Number(long long value) {
   Separate();
   _out += std::to_string(value);
   return *this;
}

JsonWriter& JsonWriter::Number(double value) {
   Separate();
   if (!std::isfinite(value)) {
      _out += "null";  // JSON has no NaN or infinity
      return *this;
   }
   char text[32];
   std::snprintf(text, sizeof text, "%.3f", value);
   _out += text;
   return *this;
}

JsonWriter& JsonWriter::Bool(bool value) {
   Separate();
   _out += value ? "true" : "false";
   return *this;
}

}  // namespace Pelmora::Daemon
