#pragma once
// The header objects of HTTP/1.x messages: Header holds the fields (looked up without
// regard to case) and the cookies; RequestHeader adds the request line, ResponseHeader
// the status and its text form, ClientResponseHeader the status line a client reads.
// Plain values; not thread-safe.

#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "pelmora/exception/throwable.h"
#include "pelmora/formatter/printable.h"
#include "pelmora/http/cookie.h"
#include "pelmora/http/responseCode.h"
#include "pelmora/object/containers.h"
#include "pelmora/object/export.h"

namespace Pelmora::Http {

// ASCII case-insensitive ordering of field names; looks up by any string type.
struct PELMORA_EXPORT CaseInsensitiveStringLess {
   using is_transparent = void;
   bool operator()(std::string_view a, std::string_view b) const noexcept;
};

using FieldMap = std::map<std::string, std::string, CaseInsensitiveStringLess>;

// A message header that cannot be read.
class PELMORA_EXPORT MalformedHeaderException : public Exception {
public:
   explicit MalformedHeaderException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(MalformedHeaderException)
};

// Prints a time (microseconds since the epoch, UTC) as an HTTP date:
// "Tue, 24 Nov 2026 21:05:09 GMT".
class PELMORA_EXPORT HttpDateFormatter : public Printable {
public:
   explicit HttpDateFormatter(long long microseconds) : _time(microseconds) {}
   void PrintTo(Writer* writer) const override;
   std::string ToString() const;

private:
   long long _time;
};

class PELMORA_EXPORT Header {
public:
   Header() = default;
   Header(const Header& other);
   Header& operator=(const Header& other);
   virtual ~Header();

   // True when the field is present.
   bool GetField(const std::string& name, std::string& value) const;
   void SetField(const std::string& name, const std::string& value);
   void RemoveField(const std::string& name);
   void GetFields(FieldMap& out) const;
   const FieldMap& GetFields() const { return _fields; }
   // Forgets every field and cookie.
   virtual void ClearHeader();

   bool GetContentType(std::string& value) const;
   // True when "Content-Length" is present.
   bool GetContentLength(long long& length) const;
   // -1 when "Content-Length" is absent.
   long long GetContentLength() const { return _contentLength; }
   bool IsChunkedTransferEncoding() const;
   // False only for "Connection: close".
   bool GetKeepAlive() const;
   void AddCookie(Cookie* cookie);
   const RefList<Cookie>& GetCookies() const { return _cookies; }

   // Adds the fields of `text` (lines after the first line of a message). A line that
   // starts with a space or TAB continues the one before; a line without ":" is ignored;
   // a repeated name joins its values with ", ". Cookies come from "Set-Cookie" when
   // `setCookie`, else from "Cookie". MalformedHeaderException for a negative
   // "Content-Length", NumberFormatException for one that is not a number.
   void FromString(const std::string& text, bool setCookie);

protected:
   void ParseFields(const char* begin, const char* end, bool setCookie);
   void ParseFieldLine(const char* begin, const char* end, bool setCookie);
   void StoreField(std::string_view name, std::string_view value, bool setCookie);
   // Sets the field's value, replacing any, without FieldChanged.
   void PutField(std::string_view name, std::string_view value);
   // Keeps the parsed "Content-Length" in step with the field.
   void FieldChanged(const std::string& name);

   FieldMap _fields;
   RefList<Cookie> _cookies;
   long long _contentLength = -1;

private:
   // Map nodes kept from cleared fields, strings and all, so that a header read again on
   // a kept-alive connection allocates next to nothing.
   static constexpr size_t kMaxSpareNodes = 64;
   std::vector<FieldMap::node_type> _spareNodes;
};

class PELMORA_EXPORT RequestHeader : public Header {
public:
   // Method codes; 0 before a request line was read.
   enum Method { UNKNOWN = 0, GET = 1, HEAD = 2, POST = 3, PUT = 4, DELETE = 5, CONNECT = 7 };
   static constexpr int kVersion10 = 256;
   static constexpr int kVersion11 = 272;

   int GetMethod() const { return _method; }
   // URL-decoded.
   const std::string& GetPath() const { return _path; }
   // 256 for HTTP/1.0, 272 for HTTP/1.1.
   int GetHttpVersion() const { return _version; }
   // True when a cookie of that name came with the request (the first one wins).
   bool GetCookie(const std::string& name, Ref<Cookie>& out) const;
   void GetCookieList(RefList<Cookie>& out) const;
   void ClearHeader() override;

   // Replaces the header with the request line and the fields of `text`. NotSupportedException for a method other
   // than GET, PUT, POST, HEAD, DELETE and CONNECT; the exceptions of Header::FromString.
   void FromString(const std::string& text);
   void FromString(const char* text, size_t length);

private:
   int _method = UNKNOWN;
   std::string _path;
   int _version = kVersion10;
};

class PELMORA_EXPORT ResponseHeader : public Header {
public:
   ResponseHeader() : _status(&ResponseCode::Ok) {}

   const ResponseCode::Info& GetResponseCode() const { return *_status; }
   void SetResponseCode(const ResponseCode::Info& info) { _status = &info; }
   // A negative length removes the field.
   void SetContentLength(long long length);
   // "Connection: Keep-Alive" or "Connection: close".
   void SetKeepAlive(bool keepAlive);
   // False sends "Cache-Control: no-cache"; true removes it.
   void SetCacheResponse(bool cache);
   void SetTransferEncoding(const std::string& encoding);
   // `charset` is added as "; charset=" when not empty.
   void SetContentType(const std::string& type, const std::string& charset = std::string());
   void ClearHeader() override;

   // Status line, Date, the fields, one "Set-Cookie" per cookie, then an empty line.
   std::string ToString() const;
   // As ToString, dated `microseconds` since the epoch.
   std::string ToString(long long microseconds) const;

private:
   const ResponseCode::Info* _status;
};

class PELMORA_EXPORT ClientResponseHeader : public Header {
public:
   int GetResponseCode() const { return _code; }
   void GetCookies(RefDeque<Cookie>& out) const;
   void ClearHeader() override;

   // Replaces the header with the status line and the fields of `text` (cookies from
   // "Set-Cookie").
   // MalformedHeaderException for a status line that does not start with "HTTP/" or has
   // no status; NumberFormatException for a status that is not a number.
   void FromString(const std::string& text);

private:
   int _code = 0;
};

}  // namespace Pelmora::Http
