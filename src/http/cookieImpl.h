#pragma once
// The one cookie implementation, and the date reading of the Expires attribute.

#include <string>
#include <string_view>

#include "pelmora/http/cookie.h"

namespace Pelmora::Http {

class CookieImpl : public virtual Cookie, public ObjectImpl {
public:
   CookieImpl(const std::string& name, const std::string& value);

   const std::string& GetName() const override { return _name; }
   const std::string& GetValue() const override { return _value; }
   void SetValue(const std::string& value) override;
   const std::string& GetPath() const override { return _path; }
   void SetPath(const std::string& path) override;
   const std::string& GetDomain() const override { return _domain; }
   void SetDomain(const std::string& domain) override;
   long long GetExpires() const override { return _expires; }
   void SetExpires(long long microseconds) override { _expires = microseconds; }
   long long GetMaxAge() const override { return _maxAge; }
   void SetMaxAge(long long seconds) override { _maxAge = seconds; }
   bool IsSecure() const override { return _secure; }
   void SetSecure(bool secure) override { _secure = secure; }
   bool IsHttpOnly() const override { return _httpOnly; }
   void SetHttpOnly(bool httpOnly) override { _httpOnly = httpOnly; }
   const std::string& GetSameSite() const override { return _sameSite; }
   void SetSameSite(const std::string& sameSite) override;
   using ObjectImpl::ToString;
   std::string ToString() const override;

private:
   std::string _name;
   std::string _value;
   std::string _path;
   std::string _domain;
   long long _expires = -1;
   long long _maxAge = kNoMaxAge;
   bool _secure = false;
   bool _httpOnly = false;
   std::string _sameSite;
};

// Microseconds since the epoch, or -1 when `text` holds no valid date.
long long ParseCookieDate(std::string_view text);

}  // namespace Pelmora::Http
