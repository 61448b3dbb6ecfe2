#pragma once
// URL and URI text: percent-encoding of query values and paths, the generic URI split,
// authority and http(s) URL reading, query parameters and HTML escaping. Pure functions;
// thread-safe.

#include <map>
#include <string>

#include "pelmora/object/export.h"

namespace Pelmora::Http {

// Every byte but letters and digits as "%" and two lower-case hex digits.
PELMORA_EXPORT std::string URLEncode(const std::string& text);
// "+" as a space, "%" and two hex digits as that byte; anything else as it is.
PELMORA_EXPORT std::string URLDecode(const std::string& text);
// Escapes every byte but letters, digits and "/-._~".
PELMORA_EXPORT std::string URLPathEncode(const std::string& text);
// "%" and two hex digits as that byte; NumberFormatException for a broken escape.
PELMORA_EXPORT std::string URLPathDecode(const std::string& text);
// As URLDecode without the "+" rule.
PELMORA_EXPORT std::string DecodeURLHexValues(const std::string& text);

PELMORA_EXPORT std::string HTMLEscape(const std::string& text);
PELMORA_EXPORT void HTMLEscapeCharacter(char c, std::string& out);
// As HTMLEscape, with "<br />" for each line end (LF, CR or CR LF).
PELMORA_EXPORT std::string HTMLEscapePreserveWhitespace(const std::string& text);

// Splits a URI into its five parts; absent parts are empty. False when `uri` cannot be
// read at all.
PELMORA_EXPORT bool ParseURI(const std::string& uri, std::string& scheme, std::string& authority,
                             std::string& path, std::string& query, std::string& fragment);
// Splits an authority into user information, host and port (digits, or empty); false
// when it is not a valid authority.
PELMORA_EXPORT bool ParseURIAuthority(const std::string& authority, std::string& userInfo,
                                      std::string& host, std::string& port);
PELMORA_EXPORT bool ParseURIAuthority(const std::string& authority, std::string& host,
                                      std::string& port);
// Adds each "name=value" pair of `query` to `out` with its value URL-decoded; a later
// pair of the same name wins.
PELMORA_EXPORT void ParseURIQuery(const std::string& query, std::map<std::string, std::string>& out);
PELMORA_EXPORT void ParseParams(const std::string& text, std::map<std::string, std::string>& out);
// Reads an "http" or "https" URL. The port defaults to 80 or 443; the path keeps its
// query and is "/" when empty. InvalidArgumentException for another scheme, a missing
// host or a bad port.
PELMORA_EXPORT void ParseHttpURL(const std::string& url, bool& isHttps, std::string& host, int& port,
                                 std::string& path);
// A host for a URL: IPv6 addresses in brackets.
PELMORA_EXPORT std::string FormatURIHostName(const std::string& host);

}  // namespace Pelmora::Http
