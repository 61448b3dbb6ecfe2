#include "pelmora/http/cookie.h"

#include <cstring>
#include <ctime>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/header.h"
#include "src/http/cookieImpl.h"

namespace Pelmora::Http {

namespace {

bool IsAlnum(unsigned char c) {
   return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}

struct TokenTable {
   bool token[256];
   constexpr TokenTable() : token() {
      const char separators[] = "()<>@,;:\\\"/[]?={}";
      for (int c = 0x21; c < 0x7f; ++c) {
         bool separator = false;
         for (const char* p = separators; *p != 0; ++p) separator = separator || *p == c;
         token[c] = !separator;
      }
   }
};
constexpr TokenTable kToken;

bool IsTokenChar(unsigned char c) { return kToken.token[c]; }

bool IsCookieOctet(unsigned char c) {
   return c == 0x21 || (c >= 0x23 && c <= 0x2b) || (c >= 0x2d && c <= 0x3a) ||
          (c >= 0x3c && c <= 0x5b) || (c >= 0x5d && c <= 0x7e);
}

bool IsValidName(const std::string& name) {
   if (name.empty()) return false;
   for (unsigned char c : name) {
      if (!IsTokenChar(c)) return false;
   }
   return true;
}

// What browsers send is often looser than the grammar; only control characters and the
// separators that would change the framing are refused.
bool IsAcceptableValue(const std::string& value) {
   for (unsigned char c : value) {
      if (c < 0x20 || c == 0x7f || c == ';' || c == ',') return false;
   }
   return true;
}

// A value as kept: acceptable, without blanks at its ends that reading would trim and
// without quotes that reading would take off again.
bool IsStoredValue(const std::string& value) {
   return IsAcceptableValue(value) && value.find('"') == std::string::npos &&
          (value.empty() || (value.front() != ' ' && value.back() != ' '));
}

bool IsStrictValue(const std::string& value) {
   for (unsigned char c : value) {
      if (!IsCookieOctet(c)) return false;
   }
   return true;
}

std::string_view Trim(std::string_view text) {
   while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) text.remove_prefix(1);
   while (!text.empty() && (text.back() == ' ' || text.back() == '\t')) text.remove_suffix(1);
   return text;
}

std::string Unquote(std::string_view value) {
   if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
      value = value.substr(1, value.size() - 2);
   }
   return std::string(value);
}

bool EqualsIgnoreCase(std::string_view a, const char* b) {
   size_t n = std::strlen(b);
   if (a.size() != n) return false;
   for (size_t i = 0; i < n; ++i) {
      char x = a[i];
      if (x >= 'A' && x <= 'Z') x = static_cast<char>(x - 'A' + 'a');
      char y = b[i];
      if (y >= 'A' && y <= 'Z') y = static_cast<char>(y - 'A' + 'a');
      if (x != y) return false;
   }
   return true;
}

bool IsDelimiter(unsigned char c) {
   return c == 0x09 || (c >= 0x20 && c <= 0x2f) || (c >= 0x3b && c <= 0x40) ||
          (c >= 0x5b && c <= 0x60) || (c >= 0x7b && c <= 0x7e);
}

// Leading digits of `token` (between `minDigits` and `maxDigits`), or -1.
int LeadingNumber(std::string_view token, size_t minDigits, size_t maxDigits, size_t& used) {
   used = 0;
   int value = 0;
   while (used < token.size() && used < maxDigits && token[used] >= '0' && token[used] <= '9') {
      value = value * 10 + (token[used] - '0');
      ++used;
   }
   return used < minDigits ? -1 : value;
}

bool IsValidPath(const std::string& path) {
   if (path.empty() || path.front() != '/') return false;
   for (unsigned char c : path) {
      if (c < 0x20 || c == 0x7f || c == ';') return false;
   }
   return true;
}

// Host names and address literals only: nothing that could end the attribute.
bool IsValidDomain(const std::string& domain) {
   for (unsigned char c : domain) {
      if (!IsAlnum(c) && c != '.' && c != '-' && c != '_' && c != ':') return false;
   }
   return true;
}

// Lower case without the one leading dot a server may send. False for a domain that
// would not read back the same once written: empty, more leading dots, or characters
// that are not a host name's.
bool NormaliseDomain(const std::string& domain, std::string& out) {
   out.clear();
   for (char c : domain) out += (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c;
   if (!out.empty() && out.front() == '.') out.erase(0, 1);
   return !out.empty() && out.front() != '.' && IsValidDomain(out);
}

}  // namespace

// The tolerant date reading browsers apply to Expires: tokens in any order, the first
// time, day, month and year found win. -1 when the date is not valid.
long long ParseCookieDate(std::string_view text) {
   int hour = -1, minute = -1, second = -1, day = -1, month = -1, year = -1;
   size_t pos = 0;
   while (pos < text.size()) {
      while (pos < text.size() && IsDelimiter(static_cast<unsigned char>(text[pos]))) ++pos;
      size_t start = pos;
      while (pos < text.size() && !IsDelimiter(static_cast<unsigned char>(text[pos]))) ++pos;
      std::string_view token = text.substr(start, pos - start);
      if (token.empty()) continue;
      size_t used = 0;
      if (hour < 0) {
         int h = LeadingNumber(token, 1, 2, used);
         if (h >= 0 && used < token.size() && token[used] == ':') {
            std::string_view rest = token.substr(used + 1);
            int m = LeadingNumber(rest, 1, 2, used);
            if (m >= 0 && used < rest.size() && rest[used] == ':') {
               rest = rest.substr(used + 1);
               int s = LeadingNumber(rest, 1, 2, used);
               if (s >= 0) {
                  hour = h;
                  minute = m;
                  second = s;
                  continue;
               }
            }
         }
      }
      if (day < 0) {
         int d = LeadingNumber(token, 1, 2, used);
         if (d >= 0 && (used == token.size() || token[used] < '0' || token[used] > '9')) {
            day = d;
            continue;
         }
      }
      if (month < 0 && token.size() >= 3) {
         static const char* const kMonths[] = {"jan", "feb", "mar", "apr", "may", "jun",
                                               "jul", "aug", "sep", "oct", "nov", "dec"};
         bool found = false;
         for (int i = 0; i < 12; ++i) {
            if (EqualsIgnoreCase(token.substr(0, 3), kMonths[i])) {
               month = i;
               found = true;
               break;
            }
         }
         if (found) continue;
      }
      if (year < 0) {
         int y = LeadingNumber(token, 2, 4, used);
         if (y >= 0 && (used == token.size() || token[used] < '0' || token[used] > '9')) {
            year = y;
            continue;
         }
      }
   }
   if (year >= 70 && year <= 99) year += 1900;
   if (year >= 0 && year <= 69) year += 2000;
   if (hour < 0 || day < 0 || month < 0 || year < 0) return -1;
   if (day < 1 || day > 31 || year < 1601 || hour > 23 || minute > 59 || second > 59) return -1;
   struct tm parts {};
   parts.tm_year = year - 1900;
   parts.tm_mon = month;
   parts.tm_mday = day;
   parts.tm_hour = hour;
   parts.tm_min = minute;
   parts.tm_sec = second;
   time_t seconds = timegm(&parts);
   // timegm rolls 31 February over into March: such a day does not exist.
   if (parts.tm_mday != day) return -1;
   // Any day before 1970 has passed as surely as the epoch has.
   return seconds < 0 ? 0 : static_cast<long long>(seconds) * 1000000LL;
}

CookieImpl::CookieImpl(const std::string& name, const std::string& value)
   : _name(name), _value(value) {}

void CookieImpl::SetValue(const std::string& value) {
   // Whatever is set here goes into a response header: it must not end the field.
   if (!IsStoredValue(value)) {
      throw InvalidArgumentException("cookie value '" + value + "'");
   }
   _value = value;
}

void CookieImpl::SetPath(const std::string& path) {
   if (!path.empty() && !IsValidPath(path)) throw InvalidArgumentException("cookie path '" + path + "'");
   _path = path;
}

void CookieImpl::SetDomain(const std::string& domain) {
   if (domain.empty()) {
      _domain.clear();
      return;
   }
   std::string normalised;
   if (!NormaliseDomain(domain, normalised)) throw InvalidArgumentException("cookie domain '" + domain + "'");
   _domain = normalised;
}

void CookieImpl::SetSameSite(const std::string& sameSite) {
   if (!sameSite.empty() && sameSite != "Strict" && sameSite != "Lax" && sameSite != "None") {
      throw InvalidArgumentException("cookie SameSite '" + sameSite + "'");
   }
   _sameSite = sameSite;
}

std::string CookieImpl::ToString() const {
   std::string text = _name + "=" + _value;
   if (!_path.empty()) text += "; Path=" + _path;
   if (!_domain.empty()) text += "; Domain=" + _domain;
   if (_expires >= 0) text += "; Expires=" + HttpDateFormatter(_expires).ToString();
   if (_maxAge != kNoMaxAge) text += "; Max-Age=" + std::to_string(_maxAge);
   if (_secure) text += "; Secure";
   if (_httpOnly) text += "; HttpOnly";
   if (!_sameSite.empty()) text += "; SameSite=" + _sameSite;
   return text;
}

void CreateCookie(const std::string& name, const std::string& value, Ref<Cookie>& out) {
   if (!IsValidName(name)) throw InvalidArgumentException("cookie name '" + name + "'");
   if (!IsStrictValue(value)) throw InvalidArgumentException("cookie value '" + value + "'");
   out = new CookieImpl(name, value);
}

namespace {

void ApplyAttribute(CookieImpl* cookie, std::string_view name, std::string_view value) {
   if (EqualsIgnoreCase(name, "Expires")) {
      long long when = ParseCookieDate(value);
      if (when >= 0) cookie->SetExpires(when);
   } else if (EqualsIgnoreCase(name, "Max-Age")) {
      std::string_view digits = value;
      bool negative = !digits.empty() && digits.front() == '-';
      if (negative) digits.remove_prefix(1);
      if (digits.empty()) return;
      long long seconds = 0;
      for (char c : digits) {
         if (c < '0' || c > '9') return;
         // A huge age is as good as forever; cap it rather than overflow.
         if (seconds < 1000000000000LL) seconds = seconds * 10 + (c - '0');
      }
      cookie->SetMaxAge(negative ? -seconds : seconds);
   } else if (EqualsIgnoreCase(name, "Domain")) {
      std::string domain;
      if (NormaliseDomain(std::string(value), domain)) cookie->SetDomain(domain);
   } else if (EqualsIgnoreCase(name, "Path")) {
      if (IsValidPath(std::string(value))) cookie->SetPath(std::string(value));
   } else if (EqualsIgnoreCase(name, "Secure")) {
      cookie->SetSecure(true);
   } else if (EqualsIgnoreCase(name, "HttpOnly")) {
      cookie->SetHttpOnly(true);
   } else if (EqualsIgnoreCase(name, "SameSite")) {
      if (EqualsIgnoreCase(value, "Strict")) cookie->SetSameSite("Strict");
      else if (EqualsIgnoreCase(value, "Lax")) cookie->SetSameSite("Lax");
      else if (EqualsIgnoreCase(value, "None")) cookie->SetSameSite("None");
   }
}

// Splits "name=value" at the first '='; false when there is none.
bool SplitPair(std::string_view pair, std::string_view& name, std::string_view& value) {
   size_t eq = pair.find('=');
   if (eq == std::string_view::npos) return false;
   name = Trim(pair.substr(0, eq));
   value = Trim(pair.substr(eq + 1));
   return true;
}

}  // namespace

void ParseCookieHeaderString(const std::string& text, bool setCookie, const CookieCallback& callback) {
   std::string_view rest(text);
   if (setCookie) {
      size_t semi = rest.find(';');
      std::string_view name, value;
      if (!SplitPair(rest.substr(0, semi), name, value)) return;
      std::string unquoted = Unquote(value);
      if (!IsValidName(std::string(name)) || !IsStoredValue(unquoted)) return;
      Ref<CookieImpl> cookie = new CookieImpl(std::string(name), unquoted);
      while (semi != std::string_view::npos) {
         rest = rest.substr(semi + 1);
         semi = rest.find(';');
         std::string_view attribute = rest.substr(0, semi);
         std::string_view attrName, attrValue;
         if (!SplitPair(attribute, attrName, attrValue)) attrName = Trim(attribute);
         ApplyAttribute(cookie.Get(), attrName, attrValue);
      }
      callback(cookie.Get());
      return;
   }
   while (!rest.empty()) {
      size_t semi = rest.find(';');
      std::string_view pair = rest.substr(0, semi);
      rest = semi == std::string_view::npos ? std::string_view() : rest.substr(semi + 1);
      std::string_view name, value;
      if (!SplitPair(pair, name, value)) continue;
      std::string unquoted = Unquote(value);
      std::string nameText(name);
      if (!IsValidName(nameText) || !IsStoredValue(unquoted)) continue;
      Ref<CookieImpl> cookie = new CookieImpl(nameText, unquoted);
      callback(cookie.Get());
   }
}

}  // namespace Pelmora::Http
