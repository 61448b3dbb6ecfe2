#pragma once
// DateTime is an instant in UTC with microsecond resolution. Its two texts are ISO-8601:
// short "2026-11-23T09:02:39Z" (whole seconds) and full "2026-11-23T09:02:39.123456Z".
// A plain value.

#include <compare>
#include <cstdint>
#include <string>

#include "pelmora/object/export.h"

namespace Pelmora {

class PELMORA_EXPORT DateTime {
public:
   constexpr DateTime() = default;
   constexpr explicit DateTime(int64_t microsecondsSinceEpoch) : _micros(microsecondsSinceEpoch) {}
   static DateTime Now();

   constexpr int64_t GetMicroseconds() const { return _micros; }
   std::string ToShortString() const;
   std::string ToFullString() const;

   auto operator<=>(const DateTime&) const = default;

private:
   int64_t _micros = 0;
};

}  // namespace Pelmora
