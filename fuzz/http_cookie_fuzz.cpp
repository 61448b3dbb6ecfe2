// Fuzzes cookie reading in both forms: no input is fatal, every cookie read has a name,
// and a Set-Cookie cookie written out reads back the same.

#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "pelmora/http/cookie.h"

using namespace Pelmora;
using namespace Pelmora::Http;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   std::string text(reinterpret_cast<const char*>(data), size);
   std::vector<Ref<Cookie>> cookies;
   ParseCookieHeaderString(text, false, [&](Cookie* c) { cookies.emplace_back(c); });
   for (const Ref<Cookie>& c : cookies) {
      if (c->GetName().empty()) abort();
   }
   std::vector<Ref<Cookie>> set;
   ParseCookieHeaderString(text, true, [&](Cookie* c) { set.emplace_back(c); });
   if (set.size() > 1) abort();
   for (const Ref<Cookie>& c : set) {
      std::string written = c->ToString();
      std::vector<Ref<Cookie>> again;
      ParseCookieHeaderString(written, true, [&](Cookie* r) { again.emplace_back(r); });
      if (again.size() != 1) abort();
      const Cookie* r = again[0].Get();
      if (r->GetName() != c->GetName() || r->GetValue() != c->GetValue() || r->GetPath() != c->GetPath() ||
          r->GetDomain() != c->GetDomain() || r->GetMaxAge() != c->GetMaxAge() ||
          r->IsSecure() != c->IsSecure() || r->IsHttpOnly() != c->IsHttpOnly() ||
          r->GetSameSite() != c->GetSameSite()) {
         abort();
      }
      // Expires is written to the second.
      if (c->GetExpires() >= 0 && r->GetExpires() != c->GetExpires() - c->GetExpires() % 1000000) abort();
   }
   return 0;
}
