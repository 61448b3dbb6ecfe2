#pragma once
// MessageFormatter fills "%1".."%9" placeholders of a format string with its arguments.
// "%%" writes one percent sign; any other "%x" is copied unchanged (so printf-style
// conversions pass through as text); a trailing lone "%" ends the text; "%10" is argument
// 1 followed by "0". A placeholder beyond the arguments throws
// InvalidFormatStringException with the format string as its message. Thread-safe.

#include <cstdint>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/formatter/printFormatter.h"

namespace Pelmora {

// A format string taken apart once: its literal runs, each followed by the index of an
// argument or by none. Only for a format whose text never changes (a string literal), so
// that a call site can keep it and skip the placeholder scan on later calls.
struct ParsedFormat {
   static constexpr int kMaxPieces = 12;
   struct Piece {
      uint16_t at;      // the run's first byte in the format
      uint16_t length;
      int8_t argument;  // 0-based; -1 when the run ends the text
   };
   const char* format = nullptr;
   int count = 0;
   int arguments = 0;  // the highest argument number used
   Piece pieces[kMaxPieces];

   // False when `format` needs more than kMaxPieces pieces or is longer than 65535 bytes.
   PELMORA_EXPORT static bool Parse(const char* format, ParsedFormat& out);
};

class PELMORA_EXPORT MessageFormatter {
public:
   template <class... Args>
   static void Print(Writer* writer, const char* format, const Args&... args) {
      static_assert(sizeof...(Args) >= 1 && sizeof...(Args) <= 9, "one to nine arguments");
      const PrintFormatter formatters[] = {PrintFormatter(args)...};
      PrintArgs(writer, format, formatters, sizeof...(Args));
   }

   template <class... Args>
   static std::string ASPrint(const char* format, const Args&... args) {
      static_assert(sizeof...(Args) >= 1 && sizeof...(Args) <= 9, "one to nine arguments");
      const PrintFormatter formatters[] = {PrintFormatter(args)...};
      return ASPrintArgs(format, formatters, sizeof...(Args));
   }

   // The walk behind every overload: one Write per literal run and per argument.
   static void PrintArgs(Writer* writer, const char* format, const PrintFormatter* args, int count);
   // The same text, gathered on the stack so that `writer` sees few and larger pieces; for
   // writers that buffer anyway and pay per call (a log line).
   static void PrintArgsJoined(Writer* writer, const char* format, const PrintFormatter* args,
                               int count);
   // The same text straight into `buffer`, for the plain forms of the common types only
   // (integers, characters, strings, booleans): the length written, or -1 when the text
   // needs more than `capacity` bytes, an argument of another kind or a bad placeholder.
   // Then nothing has been formatted that has side effects, and the caller starts over
   // with PrintArgsJoined.
   static int PrintPlainArgs(char* buffer, size_t capacity, const char* format,
                             const PrintFormatter* args, int count);
   // PrintPlainArgs for the format that `parsed` was made from, without scanning it.
   static int PrintPlainParsed(char* buffer, size_t capacity, const ParsedFormat& parsed,
                               const PrintFormatter* args, int count);
   static std::string ASPrintArgs(const char* format, const PrintFormatter* args, int count);
};

}  // namespace Pelmora
