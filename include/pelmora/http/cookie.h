#pragma once
// A Cookie is one name/value pair with the attributes a server may set on it: path,
// domain, expiry (an absolute Expires time and a relative Max-Age), Secure, HttpOnly and
// SameSite. ParseCookieHeaderString reads the value of a "Cookie" request field (many
// pairs, no attributes) or of one "Set-Cookie" response field (one pair and its
// attributes); text that is not a valid cookie is skipped, never an error.
// Setters refuse (InvalidArgumentException) text that could not go back on the wire.
// A cookie is not thread-safe; hand out copies, or do not change a shared one.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/system/functor.h"

namespace Pelmora::Http {

class PELMORA_EXPORT Cookie : public virtual Object {
public:
   // No expiry given: Expires is -1 and Max-Age is kNoMaxAge.
   static constexpr long long kNoMaxAge = -(1LL << 62);

   virtual const std::string& GetName() const = 0;
   virtual const std::string& GetValue() const = 0;
   virtual void SetValue(const std::string& value) = 0;
   // Empty when not set.
   virtual const std::string& GetPath() const = 0;
   virtual void SetPath(const std::string& path) = 0;
   // Lower-cased, without a leading dot; empty when not set.
   virtual const std::string& GetDomain() const = 0;
   virtual void SetDomain(const std::string& domain) = 0;
   // Microseconds since the epoch (UTC), -1 when not set.
   virtual long long GetExpires() const = 0;
   virtual void SetExpires(long long microseconds) = 0;
   // Seconds; zero or less asks the client to drop the cookie.
   virtual long long GetMaxAge() const = 0;
   virtual void SetMaxAge(long long seconds) = 0;
   virtual bool IsSecure() const = 0;
   virtual void SetSecure(bool secure) = 0;
   virtual bool IsHttpOnly() const = 0;
   virtual void SetHttpOnly(bool httpOnly) = 0;
   // "Strict", "Lax", "None", or empty when not set.
   virtual const std::string& GetSameSite() const = 0;
   virtual void SetSameSite(const std::string& sameSite) = 0;
   // ToString() gives the "Set-Cookie" value: "name=value" and the attributes that are
   // set, each after "; ".
};

// A cookie with no attributes set. InvalidArgumentException when `name` is empty or holds
// a character a cookie name may not hold, or `value` holds one a cookie value may not.
PELMORA_EXPORT void CreateCookie(const std::string& name, const std::string& value, Ref<Cookie>& out);

using CookieCallback = System::Functor<void, Cookie*>;
// Calls `callback` once per cookie in `text`, in order: a "Set-Cookie" value when
// `setCookie` is true, a "Cookie" value otherwise.
PELMORA_EXPORT void ParseCookieHeaderString(const std::string& text, bool setCookie,
                                            const CookieCallback& callback);

}  // namespace Pelmora::Http
