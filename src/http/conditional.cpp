#include "src/http/conditional.h"

#include <strings.h>

#include <algorithm>

namespace Pelmora::Http {

bool TagListMatches(const std::string& list, const std::string& tag) {
   size_t at = 0;
   while (at < list.size()) {
      size_t end = list.find(',', at);
      if (end == std::string::npos) end = list.size();
      std::string item = list.substr(at, end - at);
      at = end + 1;
      size_t first = item.find_first_not_of(" \t");
      if (first == std::string::npos) continue;
      item = item.substr(first, item.find_last_not_of(" \t") - first + 1);
      if (item == "*") return true;
      if (item.rfind("W/", 0) == 0) item.erase(0, 2);
      if (item == tag) return true;
   }
   return false;
}

namespace {

bool ParseNumber(const std::string& text, long long& out) {
   if (text.empty() || text.size() > 18) return false;
   out = 0;
   for (char c : text) {
      if (c < '0' || c > '9') return false;
      out = out * 10 + (c - '0');
   }
   return true;
}

}  // namespace

ByteRange ParseRange(std::string value, long long size) {
   ByteRange range;
   value.erase(std::remove_if(value.begin(), value.end(), [](char c) { return c == ' ' || c == '\t'; }),
               value.end());
   if (value.size() < 6 || strncasecmp(value.c_str(), "bytes=", 6) != 0) return range;
   std::string spec = value.substr(6);
   if (spec.find(',') != std::string::npos) return range;
   size_t dash = spec.find('-');
   if (dash == std::string::npos) return range;
   std::string from = spec.substr(0, dash), to = spec.substr(dash + 1);
   long long a = 0, b = 0;
   if (from.empty()) {
      if (!ParseNumber(to, b)) return range;
      if (b == 0 || size == 0) {
         range.kind = ByteRange::UNSATISFIABLE;
         return range;
      }
      range.kind = ByteRange::PART;
      range.first = std::max(0LL, size - b);
      range.last = size - 1;
      return range;
   }
   if (!ParseNumber(from, a)) return range;
   if (to.empty()) {
      b = size - 1;
   } else if (!ParseNumber(to, b) || b < a) {
      return range;
   }
   if (a >= size) {
      range.kind = ByteRange::UNSATISFIABLE;
      return range;
   }
   range.kind = ByteRange::PART;
   range.first = a;
   range.last = std::min(b, size - 1);
   return range;
}

}  // namespace Pelmora::Http
