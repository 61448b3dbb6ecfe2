#include "pelmora/http/header.h"

#include <charconv>
#include <cstring>
#include <ctime>
#include <string_view>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/dateTime.h"
#include "pelmora/http/url.h"

namespace Pelmora::Http {

namespace {

inline unsigned char Lower(unsigned char c) { return (c >= 'A' && c <= 'Z') ? c + ('a' - 'A') : c; }

inline bool IsSpace(char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; }

void TrimRange(const char*& begin, const char*& end) {
   while (begin < end && IsSpace(*begin)) ++begin;
   while (end > begin && IsSpace(end[-1])) --end;
}

bool EqualsIgnoreCase(std::string_view a, const char* b) {
   size_t n = std::strlen(b);
   if (a.size() != n) return false;
   for (size_t i = 0; i < n; ++i) {
      if (Lower(a[i]) != Lower(b[i])) return false;
   }
   return true;
}

// A signed decimal that fits 64 bits, surrounding blanks allowed.
long long ParseLong(const std::string& text) {
   const char* begin = text.data();
   const char* end = begin + text.size();
   TrimRange(begin, end);
   bool negative = false;
   if (begin < end && (*begin == '-' || *begin == '+')) negative = *begin++ == '-';
   if (begin == end) throw NumberFormatException("Not a number: " + text);
   unsigned long long value = 0;
   for (; begin < end; ++begin) {
      if (*begin < '0' || *begin > '9') throw NumberFormatException("Not a number: " + text);
      unsigned digit = static_cast<unsigned>(*begin - '0');
      if (value > (9223372036854775808ULL - digit) / 10) throw NumberRangeException();
      value = value * 10 + digit;
   }
   if (!negative && value > 9223372036854775807ULL) throw NumberRangeException();
   return negative ? static_cast<long long>(0 - value) : static_cast<long long>(value);
}

const char kContentLength[] = "Content-Length";

}  // namespace

namespace {

struct LowerTable {
   unsigned char map[256];
   constexpr LowerTable() : map() {
      for (int c = 0; c < 256; ++c) map[c] = static_cast<unsigned char>(c >= 'A' && c <= 'Z' ? c + 32 : c);
   }
};
constexpr LowerTable kLower;

// Whole seconds of a time in microseconds, rounded down for times before 1970 as well.
long long FloorSeconds(long long microseconds) {
   long long seconds = microseconds / 1000000;
   if (microseconds < 0 && microseconds % 1000000 != 0) --seconds;
   return seconds;
}

// A busy server writes the same Date text thousands of times a second: each thread keeps
// the text of the last second it formatted.
struct DateCache {
   bool valid = false;
   long long second = 0;
   std::string text;
};
thread_local DateCache tDateCache;

const std::string& DateText(long long microseconds) {
   long long second = FloorSeconds(microseconds);
   DateCache& cache = tDateCache;
   if (!cache.valid || cache.second != second) {
      cache.text = HttpDateFormatter(second * 1000000).ToString();
      cache.second = second;
      cache.valid = true;
   }
   return cache.text;
}

}  // namespace

bool CaseInsensitiveStringLess::operator()(std::string_view a, std::string_view b) const noexcept {
   size_t n = a.size() < b.size() ? a.size() : b.size();
   const unsigned char* x = reinterpret_cast<const unsigned char*>(a.data());
   const unsigned char* y = reinterpret_cast<const unsigned char*>(b.data());
   for (size_t i = 0; i < n; ++i) {
      unsigned char p = kLower.map[x[i]];
      unsigned char q = kLower.map[y[i]];
      if (p != q) return p < q;
   }
   return a.size() < b.size();
}

void HttpDateFormatter::PrintTo(Writer* writer) const {
   std::string text = ToString();
   writer->Write(text.data(), static_cast<int>(text.size()));
}

std::string HttpDateFormatter::ToString() const {
   static const char* const kDays[] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
   static const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                         "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
   time_t when = static_cast<time_t>(FloorSeconds(_time));
   struct tm parts {};
   gmtime_r(&when, &parts);
   char text[64];
   snprintf(text, sizeof text, "%s, %d %s %d %02d:%02d:%02d GMT", kDays[parts.tm_wday],
            parts.tm_mday, kMonths[parts.tm_mon % 12], parts.tm_year + 1900, parts.tm_hour,
            parts.tm_min, parts.tm_sec);
   return text;
}

Header::Header(const Header& other)
   : _fields(other._fields), _cookies(other._cookies), _contentLength(other._contentLength) {}

Header& Header::operator=(const Header& other) {
   _fields = other._fields;
   _cookies = other._cookies;
   _contentLength = other._contentLength;
   return *this;
}

Header::~Header() = default;

bool Header::GetField(const std::string& name, std::string& value) const {
   auto found = _fields.find(name);
   if (found == _fields.end()) return false;
   value = found->second;
   return true;
}

void Header::SetField(const std::string& name, const std::string& value) {
   PutField(name, value);
   FieldChanged(name);
}

void Header::PutField(std::string_view name, std::string_view value) {
   // One descent, and a node kept by ClearHeader when there is one: a response sets the
   // same few fields on every request of a connection.
   auto at = _fields.lower_bound(name);
   if (at != _fields.end() && !_fields.key_comp()(name, at->first)) {
      at->second.assign(value);
   } else if (!_spareNodes.empty()) {
      FieldMap::node_type node = std::move(_spareNodes.back());
      _spareNodes.pop_back();
      node.key().assign(name);
      node.mapped().assign(value);
      _fields.insert(at, std::move(node));
   } else {
      _fields.emplace_hint(at, std::string(name), std::string(value));
   }
}

void Header::RemoveField(const std::string& name) {
   _fields.erase(name);
   FieldChanged(name);
}

void Header::GetFields(FieldMap& out) const { out = _fields; }

void Header::ClearHeader() {
   while (!_fields.empty() && _spareNodes.size() < kMaxSpareNodes) {
      _spareNodes.push_back(_fields.extract(_fields.begin()));
   }
   _fields.clear();
   _cookies.clear();
   _contentLength = -1;
}

bool Header::GetContentType(std::string& value) const { return GetField("Content-Type", value); }

bool Header::GetContentLength(long long& length) const {
   if (_contentLength < 0) return false;
   length = _contentLength;
   return true;
}

bool Header::IsChunkedTransferEncoding() const {
   auto found = _fields.find("Transfer-Encoding");
   return found != _fields.end() && !EqualsIgnoreCase(found->second, "identity");
}

bool Header::GetKeepAlive() const {
   auto found = _fields.find("Connection");
   return found == _fields.end() || found->second != "close";
}

void Header::AddCookie(Cookie* cookie) { _cookies.emplace_back(cookie); }

void Header::FieldChanged(const std::string& name) {
   if (!EqualsIgnoreCase(name, kContentLength)) return;
   auto found = _fields.find(kContentLength);
   if (found == _fields.end()) {
      _contentLength = -1;
      return;
   }
   long long length = ParseLong(found->second);
   if (length < 0) throw MalformedHeaderException("Content-Length is a negative value");
   _contentLength = length;
}

void Header::StoreField(std::string_view name, std::string_view value, bool setCookie) {
   if (EqualsIgnoreCase(name, setCookie ? "Set-Cookie" : "Cookie")) {
      ParseCookieHeaderString(std::string(value), setCookie, [this](Cookie* cookie) { AddCookie(cookie); });
   }
   // One descent finds the field or the place for it.
   auto at = _fields.lower_bound(name);
   if (at != _fields.end() && !_fields.key_comp()(name, at->first)) {
      // Repeated fields are one list (RFC 9110, 5.3); two Content-Length values then no
      // longer read as a number, which refuses a request that could be framed two ways.
      at->second += ", ";
      at->second += value;
   } else if (!_spareNodes.empty()) {
      FieldMap::node_type node = std::move(_spareNodes.back());
      _spareNodes.pop_back();
      node.key().assign(name);
      node.mapped().assign(value);
      at = _fields.insert(at, std::move(node));
   } else {
      at = _fields.emplace_hint(at, std::string(name), std::string(value));
   }
   FieldChanged(at->first);
}

void Header::ParseFieldLine(const char* begin, const char* end, bool setCookie) {
   const char* colon = static_cast<const char*>(std::memchr(begin, ':', end - begin));
   if (colon == nullptr) return;
   const char* nameEnd = colon;
   const char* valueBegin = colon + 1;
   TrimRange(begin, nameEnd);
   TrimRange(valueBegin, end);
   if (begin == nameEnd) return;
   StoreField(std::string_view(begin, static_cast<size_t>(nameEnd - begin)),
              std::string_view(valueBegin, static_cast<size_t>(end - valueBegin)), setCookie);
}

void Header::FromString(const std::string& text, bool setCookie) {
   ParseFields(text.data(), text.data() + text.size(), setCookie);
}

void Header::ParseFields(const char* pos, const char* end, bool setCookie) {
   // The logical line being gathered; only continuation lines need a copy.
   const char* lineBegin = nullptr;
   const char* lineEnd = nullptr;
   std::string joined;
   bool usingJoined = false;
   auto flush = [&]() {
      if (usingJoined) {
         ParseFieldLine(joined.data(), joined.data() + joined.size(), setCookie);
      } else if (lineBegin != nullptr) {
         ParseFieldLine(lineBegin, lineEnd, setCookie);
      }
      lineBegin = nullptr;
      usingJoined = false;
   };
   while (pos < end) {
      const char* next = pos;
      const char* lineStop = end;
      const char* after = end;
      while (next + 1 < end) {
         next = static_cast<const char*>(std::memchr(next, '\r', (end - next) - 1));
         if (next == nullptr) break;
         if (next[1] == '\n') {
            lineStop = next;
            after = next + 2;
            break;
         }
         ++next;
      }
      if (lineStop > pos) {
         if ((*pos == ' ' || *pos == '\t') && (lineBegin != nullptr || usingJoined)) {
            if (!usingJoined) {
               joined.assign(lineBegin, lineEnd);
               usingJoined = true;
            }
            joined.append(pos, lineStop);
         } else {
            flush();
            lineBegin = pos;
            lineEnd = lineStop;
         }
      }
      pos = after;
   }
   flush();
}

void RequestHeader::ClearHeader() {
   Header::ClearHeader();
   _method = UNKNOWN;
   _path.clear();
   _version = kVersion10;
}

bool RequestHeader::GetCookie(const std::string& name, Ref<Cookie>& out) const {
   for (const Ref<Cookie>& cookie : _cookies) {
      if (cookie->GetName() == name) {
         out = cookie;
         return true;
      }
   }
   return false;
}

void RequestHeader::GetCookieList(RefList<Cookie>& out) const { out = _cookies; }

void RequestHeader::FromString(const std::string& text) { FromString(text.data(), text.size()); }

void RequestHeader::FromString(const char* data, size_t length) {
   ClearHeader();
   std::string_view text(data, length);
   size_t lineEnd = text.find("\r\n");
   std::string_view line(text.data(), lineEnd == std::string_view::npos ? text.size() : lineEnd);
   struct MethodName {
      const char* name;
      size_t length;
      Method method;
   };
   static const MethodName kMethods[] = {{"GET", 3, GET},       {"PUT", 3, PUT},
                                         {"POST", 4, POST},     {"HEAD", 4, HEAD},
                                         {"DELETE", 6, DELETE}, {"CONNECT", 7, CONNECT}};
   const MethodName* matched = nullptr;
   for (const MethodName& candidate : kMethods) {
      if (line.size() >= candidate.length && line.compare(0, candidate.length, candidate.name) == 0) {
         matched = &candidate;
         break;
      }
   }
   if (matched == nullptr) throw NotSupportedException();
   const char* begin = line.data() + matched->length;
   const char* end = line.data() + line.size();
   TrimRange(begin, end);
   const char* space = static_cast<const char*>(std::memchr(begin, ' ', end - begin));
   _method = matched->method;
   _path = URLDecode(std::string(begin, space ? space : end));
   _version = line.find("HTTP/1.1") != std::string_view::npos ? kVersion11 : kVersion10;
   if (lineEnd != std::string_view::npos && lineEnd + 2 < text.size()) {
      ParseFields(data + lineEnd + 2, data + length, false);
   }
}

void ResponseHeader::SetContentLength(long long length) {
   if (length < 0) {
      RemoveField(kContentLength);
   } else {
      // Stored directly: FieldChanged would parse back the number just written.
      char digits[24];
      char* end = std::to_chars(digits, digits + sizeof digits, length).ptr;
      PutField(kContentLength, std::string_view(digits, static_cast<size_t>(end - digits)));
      _contentLength = length;
   }
}

void ResponseHeader::SetKeepAlive(bool keepAlive) { SetField("Connection", keepAlive ? "Keep-Alive" : "close"); }

void ResponseHeader::SetCacheResponse(bool cache) {
   if (cache) {
      RemoveField("Cache-Control");
   } else {
      SetField("Cache-Control", "no-cache");
   }
}

void ResponseHeader::SetTransferEncoding(const std::string& encoding) { SetField("Transfer-Encoding", encoding); }

void ResponseHeader::SetContentType(const std::string& type, const std::string& charset) {
   SetField("Content-Type", charset.empty() ? type : type + "; charset=" + charset);
}

void ResponseHeader::ClearHeader() {
   Header::ClearHeader();
   _status = &ResponseCode::Ok;
}

std::string ResponseHeader::ToString() const { return ToString(DateTime::Now().GetMicroseconds()); }

std::string ResponseHeader::ToString(long long microseconds) const {
   std::string text;
   text.reserve(256);
   text += "HTTP/1.1 ";
   text += std::to_string(_status->code);
   text += ' ';
   text += _status->reasonPhrase;
   text += "\r\nDate: ";
   text += DateText(microseconds);
   text += "\r\n";
   for (const auto& [name, value] : _fields) {
      text += name;
      text += ": ";
      text += value;
      text += "\r\n";
   }
   for (const Ref<Cookie>& cookie : _cookies) {
      text += "Set-Cookie: ";
      text += cookie->ToString();
      text += "\r\n";
   }
   text += "\r\n";
   return text;
}

void ClientResponseHeader::GetCookies(RefDeque<Cookie>& out) const {
   out.assign(_cookies.begin(), _cookies.end());
}

void ClientResponseHeader::ClearHeader() {
   Header::ClearHeader();
   _code = 0;
}

void ClientResponseHeader::FromString(const std::string& text) {
   ClearHeader();
   size_t lineEnd = text.find("\r\n");
   std::string line = text.substr(0, lineEnd);
   if (line.compare(0, 5, "HTTP/") != 0) {
      throw MalformedHeaderException("invalid protocol version in status line: " + line);
   }
   size_t first = line.find(' ');
   if (first == std::string::npos) throw MalformedHeaderException("status not found");
   size_t second = line.find(' ', first + 1);
   std::string status = line.substr(first + 1, second == std::string::npos ? std::string::npos
                                                                           : second - first - 1);
   if (status.empty()) throw MalformedHeaderException("status not found");
   long long code = ParseLong(status);
   if (code < -2147483648LL || code > 2147483647LL) throw NumberRangeException();
   _code = static_cast<int>(code);
   if (lineEnd != std::string::npos && lineEnd + 2 < text.size()) {
      ParseFields(text.data() + lineEnd + 2, text.data() + text.size(), true);
   }
}

}  // namespace Pelmora::Http
