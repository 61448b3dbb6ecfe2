// Fuzzes the URL and URI functions: encodings round-trip, the URI split puts the parts
// back together, and only the documented exceptions leave.

#include <cstdint>
#include <cstdlib>
#include <map>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/http/url.h"

using namespace Pelmora;
using namespace Pelmora::Http;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   std::string text(reinterpret_cast<const char*>(data), size);
   if (URLDecode(URLEncode(text)) != text) abort();
   if (URLPathDecode(URLPathEncode(text)) != text) abort();
   if (DecodeURLHexValues(URLPathEncode(text)) != text) abort();
   URLDecode(text);
   try {
      URLPathDecode(text);
   } catch (const NumberFormatException&) {
   }
   std::string scheme, authority, path, query, fragment;
   if (ParseURI(text, scheme, authority, path, query, fragment)) {
      std::string joined;
      if (!scheme.empty()) joined += scheme + ":";
      if (text.find("//") == joined.size()) joined += "//" + authority;
      joined += path;
      if (text.find('?', joined.size()) == joined.size()) joined += "?" + query;
      if (text.find('#', joined.size()) == joined.size()) joined += "#" + fragment;
      if (joined != text) abort();
      std::string user, host, port;
      ParseURIAuthority(authority, user, host, port);
   }
   std::map<std::string, std::string> params;
   ParseURIQuery(text, params);
   try {
      bool https = false;
      std::string host, urlPath;
      int port = 0;
      ParseHttpURL(text, https, host, port, urlPath);
      if (host.empty() || port < 1 || port > 65535 || urlPath.empty()) abort();
   } catch (const InvalidArgumentException&) {
   }
   std::string escaped = HTMLEscapePreserveWhitespace(text);
   if (HTMLEscape(text).find_first_of("<>\"") != std::string::npos) abort();
   (void)escaped;
   (void)FormatURIHostName(text);
   return 0;
}
