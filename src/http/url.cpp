#include "pelmora/http/url.h"

#include <boost/regex.hpp>

#include <cstring>
#include <string_view>

#include "pelmora/exception/exceptions.h"

namespace Pelmora::Http {

namespace {

int HexValue(char c) {
   if (c >= '0' && c <= '9') return c - '0';
   if (c >= 'a' && c <= 'f') return c - 'a' + 10;
   if (c >= 'A' && c <= 'F') return c - 'A' + 10;
   return -1;
}

bool IsAlnum(unsigned char c) {
   return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}

void AppendEscape(std::string& out, unsigned char c, const char* digits) {
   out += '%';
   out += digits[c >> 4];
   out += digits[c & 15];
}

std::string DecodeHex(const std::string& text, bool plusIsSpace) {
   if (text.find_first_of(plusIsSpace ? "%+" : "%") == std::string::npos) return text;
   std::string out;
   out.reserve(text.size());
   for (size_t i = 0; i < text.size(); ++i) {
      char c = text[i];
      if (c == '+' && plusIsSpace) {
         out += ' ';
      } else if (c == '%' && i + 2 < text.size() && HexValue(text[i + 1]) >= 0 &&
                 HexValue(text[i + 2]) >= 0) {
         out += static_cast<char>(HexValue(text[i + 1]) * 16 + HexValue(text[i + 2]));
         i += 2;
      } else {
         out += c;
      }
   }
   return out;
}

const boost::regex& UriExpression() {
   static const boost::regex expression("^(([^:/?#]+):)?(//([^/?#]*))?([^?#]*)(\\?([^#]*))?(#(.*))?");
   return expression;
}

const boost::regex& AuthorityExpression() {
   static const boost::regex expression(
      "^((([\\w.~-]?(%[0-9a-fA-F][0-9a-fA-F])?[!$&'()*+,;=]?[:]?)+)@)?"
      "((([\\w.~-]?(%[0-9a-fA-F][0-9a-fA-F])?[!$&'()*+,;=]?)+)(:([0-9]+))?)$");
   return expression;
}

// Whether `text` is made of the authority's characters: letters, digits, "_.~-", "%"
// with two hex digits, the sub-delimiters and, when `colonAllowed`, ":".
bool IsAuthorityText(std::string_view text, bool colonAllowed) {
   for (size_t i = 0; i < text.size(); ++i) {
      unsigned char c = static_cast<unsigned char>(text[i]);
      if (IsAlnum(c) || (c != 0 && std::strchr("_.~-!$&'()*+,;=", c) != nullptr)) continue;
      if (c == ':' && colonAllowed) continue;
      if (c == '%' && i + 2 < text.size() && HexValue(text[i + 1]) >= 0 && HexValue(text[i + 2]) >= 0) {
         i += 2;
         continue;
      }
      return false;
   }
   return true;
}

// The authority expression nests optional groups inside a repetition, so a near miss
// makes the matcher try every way of splitting the text; the same language is checked
// here in one pass first, and only text that will match goes to the expression.
bool CouldBeAuthority(std::string_view authority, std::string& userInfo, std::string& host, std::string& port) {
   size_t at = authority.find('@');
   std::string_view hostPort = authority;
   std::string_view user;
   if (at != std::string_view::npos) {
      user = authority.substr(0, at);
      if (!IsAuthorityText(user, true)) return false;
      hostPort = authority.substr(at + 1);
   }
   std::string_view portText;
   size_t colon = hostPort.find(':');
   if (colon != std::string_view::npos) {
      portText = hostPort.substr(colon + 1);
      if (portText.empty()) return false;
      for (char c : portText) {
         if (c < '0' || c > '9') return false;
      }
      hostPort = hostPort.substr(0, colon);
   }
   if (!IsAuthorityText(hostPort, false)) return false;
   userInfo.assign(user);
   host.assign(hostPort);
   port.assign(portText);
   return true;
}

}  // namespace

std::string URLEncode(const std::string& text) {
   std::string out;
   out.reserve(text.size() * 3);
   for (unsigned char c : text) {
      if (IsAlnum(c)) {
         out += static_cast<char>(c);
      } else {
         AppendEscape(out, c, "0123456789abcdef");
      }
   }
   return out;
}

std::string URLDecode(const std::string& text) { return DecodeHex(text, true); }

std::string DecodeURLHexValues(const std::string& text) { return DecodeHex(text, false); }

std::string URLPathEncode(const std::string& text) {
   std::string out;
   out.reserve(text.size());
   for (unsigned char c : text) {
      if (IsAlnum(c) || c == '/' || c == '-' || c == '.' || c == '_' || c == '~') {
         out += static_cast<char>(c);
      } else {
         AppendEscape(out, c, "0123456789ABCDEF");
      }
   }
   return out;
}

std::string URLPathDecode(const std::string& text) {
   std::string out;
   out.reserve(text.size());
   for (size_t i = 0; i < text.size(); ++i) {
      if (text[i] != '%') {
         out += text[i];
         continue;
      }
      if (i + 2 >= text.size() || HexValue(text[i + 1]) < 0 || HexValue(text[i + 2]) < 0) {
         throw NumberFormatException("Malformed escape in URL path: " + text);
      }
      out += static_cast<char>(HexValue(text[i + 1]) * 16 + HexValue(text[i + 2]));
      i += 2;
   }
   return out;
}

void HTMLEscapeCharacter(char c, std::string& out) {
   switch (c) {
      case '&': out += "&amp;"; break;
      case '<': out += "&lt;"; break;
      case '>': out += "&gt;"; break;
      case '"': out += "&quot;"; break;
      default: out += c; break;
   }
}

std::string HTMLEscape(const std::string& text) {
   std::string out;
   out.reserve(text.size());
   for (char c : text) HTMLEscapeCharacter(c, out);
   return out;
}

std::string HTMLEscapePreserveWhitespace(const std::string& text) {
   std::string out;
   out.reserve(text.size());
   for (size_t i = 0; i < text.size(); ++i) {
      char c = text[i];
      if (c == '\r') {
         out += "<br />";
         if (i + 1 < text.size() && text[i + 1] == '\n') ++i;
      } else if (c == '\n') {
         out += "<br />";
      } else {
         HTMLEscapeCharacter(c, out);
      }
   }
   return out;
}

bool ParseURI(const std::string& uri, std::string& scheme, std::string& authority, std::string& path,
              std::string& query, std::string& fragment) {
   boost::smatch match;
   // The expression matches a prefix of any text; a match must cover all of it.
   bool found = false;
   try {
      found = boost::regex_search(uri, match, UriExpression()) && match[0].length() == static_cast<long>(uri.size());
   } catch (const std::runtime_error&) {
      found = false;
   }
   if (!found || match.size() != 10) return false;
   scheme = match[2].str();
   authority = match[4].str();
   path = match[5].str();
   query = match[7].str();
   fragment = match[9].str();
   return true;
}

bool ParseURIAuthority(const std::string& authority, std::string& userInfo, std::string& host,
                       std::string& port) {
   std::string splitUser, splitHost, splitPort;
   if (!CouldBeAuthority(authority, splitUser, splitHost, splitPort)) return false;
   boost::smatch match;
   try {
      if (!boost::regex_match(authority, match, AuthorityExpression()) || match.size() != 11) return false;
      userInfo = match[2].str();
      host = match[6].str();
      port = match[10].str();
   } catch (const std::runtime_error&) {
      // A long text the expression gives up on; the one-pass split found the same parts.
      userInfo = splitUser;
      host = splitHost;
      port = splitPort;
   }
   return true;
}

bool ParseURIAuthority(const std::string& authority, std::string& host, std::string& port) {
   std::string userInfo;
   return ParseURIAuthority(authority, userInfo, host, port);
}

void ParseURIQuery(const std::string& query, std::map<std::string, std::string>& out) {
   std::string name;
   std::string value;
   bool inValue = false;
   auto finish = [&]() {
      if (!name.empty() || inValue) out[name] = URLDecode(value);
      name.clear();
      value.clear();
      inValue = false;
   };
   for (char c : query) {
      if (c == '&') {
         finish();
      } else if (c == '=' && !inValue) {
         inValue = true;
      } else if (inValue) {
         value += c;
      } else {
         name += c;
      }
   }
   finish();
}

void ParseParams(const std::string& text, std::map<std::string, std::string>& out) { ParseURIQuery(text, out); }

void ParseHttpURL(const std::string& url, bool& isHttps, std::string& host, int& port, std::string& path) {
   std::string scheme, authority, rawPath, query, fragment;
   if (!ParseURI(url, scheme, authority, rawPath, query, fragment)) {
      throw InvalidArgumentException("URL '" + url + "'");
   }
   for (char& c : scheme) {
      if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
   }
   if (scheme != "http" && scheme != "https") throw InvalidArgumentException("URL scheme '" + scheme + "'");
   isHttps = scheme == "https";
   size_t at = authority.rfind('@');
   std::string hostPort = at == std::string::npos ? authority : authority.substr(at + 1);
   std::string portText;
   if (!hostPort.empty() && hostPort.front() == '[') {
      size_t close = hostPort.find(']');
      if (close == std::string::npos) throw InvalidArgumentException("URL host '" + hostPort + "'");
      host = hostPort.substr(1, close - 1);
      std::string rest = hostPort.substr(close + 1);
      if (!rest.empty()) {
         if (rest.front() != ':') throw InvalidArgumentException("URL host '" + hostPort + "'");
         portText = rest.substr(1);
      }
   } else {
      size_t colon = hostPort.find(':');
      host = hostPort.substr(0, colon);
      if (colon != std::string::npos) portText = hostPort.substr(colon + 1);
   }
   if (host.empty()) throw InvalidArgumentException("URL without host '" + url + "'");
   port = isHttps ? 443 : 80;
   if (!portText.empty()) {
      if (portText.size() > 5) throw InvalidArgumentException("URL port '" + portText + "'");
      int value = 0;
      for (char c : portText) {
         if (c < '0' || c > '9') throw InvalidArgumentException("URL port '" + portText + "'");
         value = value * 10 + (c - '0');
      }
      if (value < 1 || value > 65535) throw InvalidArgumentException("URL port '" + portText + "'");
      port = value;
   }
   path = rawPath.empty() ? "/" : rawPath;
   if (!query.empty()) path += "?" + query;
}

std::string FormatURIHostName(const std::string& host) {
   if (host.find(':') != std::string::npos) return "[" + host + "]";
   return host;
}

}  // namespace Pelmora::Http
