// Validation and rewriting of caller-supplied printf conversions, then the bounded snprintf.

#include "src/core/conversion.h"

#include <cstdio>
#include <cstring>

#include "pelmora/exception/exceptions.h"

namespace Pelmora::Internal {
namespace {

enum class ValueType { Char, Int32, UInt32, Int64, UInt64, Double, Pointer };

constexpr int kFlagMinus = 1;
constexpr int kFlagPlus = 2;
constexpr int kFlagSpace = 4;
constexpr int kFlagHash = 8;
constexpr int kFlagZero = 16;

// Large enough for the longest text that can still fit a 50-byte buffer: at most 49
// literal bytes from up to 98 source bytes ("%%"), plus one canonical conversion.
constexpr int kFormatCapacity = 160;
// A floating conversion of inf or nan ignores its precision, so a large precision may still
// fit; beyond this bound it is refused instead of handed to snprintf.
constexpr int kMaxFloatingPrecision = 1000;

struct Conversion {
   char format[kFormatCapacity];
   char letter;
};

[[noreturn]] void Reject(const char* option) {
   throw InvalidFormatStringException(option);
}

bool IsOneOf(char letter, const char* letters) {
   return letter != '\0' && std::strchr(letters, letter) != nullptr;
}

const char* LettersFor(ValueType type) {
   switch (type) {
      case ValueType::Double:
         return "fFeEgGaA";
      case ValueType::Pointer:
         return "pxXduo";
      default:
         return "cdiouxX";
   }
}

// The length modifier that matches the argument each conversion is handed below.
const char* ModifierFor(ValueType type, char letter) {
   switch (type) {
      case ValueType::Char:
         return IsOneOf(letter, "ouxX") ? "hh" : "";
      case ValueType::Int64:
      case ValueType::UInt64:
         return letter == 'c' ? "" : "ll";
      case ValueType::Pointer:
         return letter == 'p' ? "" : "ll";
      default:
         return "";
   }
}

// Reads a decimal number, saturating well above any useful width or precision.
int ReadNumber(const char*& cursor) {
   int number = 0;
   while (*cursor >= '0' && *cursor <= '9') {
      if (number < 100000) number = number * 10 + (*cursor - '0');
      ++cursor;
   }
   return number;
}

void SkipLengthModifier(const char*& cursor) {
   switch (*cursor) {
      case 'h':
      case 'l':
         if (cursor[1] == cursor[0]) ++cursor;
         ++cursor;
         break;
      case 'L':
      case 'q':
      case 'j':
      case 'z':
      case 't':
         ++cursor;
         break;
      default:
         break;
   }
}

class FormatBuilder {
public:
   explicit FormatBuilder(const char* option) : _option(option) {}
   void Append(char c) {
      if (_length + 1 >= kFormatCapacity) Reject(_option);
      _text[_length++] = c;
      _text[_length] = '\0';
   }
   void Append(const char* text) {
      while (*text) Append(*text++);
   }
   void AppendNumber(int number) {
      char digits[12];
      int count = 0;
      do {
         digits[count++] = static_cast<char>('0' + number % 10);
         number /= 10;
      } while (number > 0);
      while (count > 0) Append(digits[--count]);
   }
   int GetLength() const { return _length; }
   void CopyTo(char* out) const { std::memcpy(out, _text, _length + 1); }

private:
   const char* _option;
   char _text[kFormatCapacity] = {};
   int _length = 0;
};

// Parses the conversion after a '%' and appends its canonical form.
char ParseConversion(const char* option, const char*& cursor, ValueType type, int size,
                     FormatBuilder& format) {
   int flags = 0;
   for (;; ++cursor) {
      if (*cursor == '-') {
         flags |= kFlagMinus;
      } else if (*cursor == '+') {
         flags |= kFlagPlus;
      } else if (*cursor == ' ') {
         flags |= kFlagSpace;
      } else if (*cursor == '#') {
         flags |= kFlagHash;
      } else if (*cursor == '0') {
         flags |= kFlagZero;
      } else {
         break;
      }
   }
   int width = ReadNumber(cursor);
   int precision = -1;
   if (*cursor == '.') {
      ++cursor;
      precision = ReadNumber(cursor);
   }
   SkipLengthModifier(cursor);
   char letter = *cursor;
   if (!IsOneOf(letter, LettersFor(type))) Reject(option);
   ++cursor;

   // Refuse the combinations whose behaviour C leaves undefined, and sizes that cannot fit.
   bool floating = type == ValueType::Double;
   bool noNumberFlags = letter == 'c' || letter == 'p';
   if ((flags & kFlagHash) && !floating && !IsOneOf(letter, "oxX")) Reject(option);
   if ((flags & (kFlagZero | kFlagPlus | kFlagSpace)) && noNumberFlags) Reject(option);
   if (precision >= 0 && noNumberFlags) Reject(option);
   if (width >= size) Reject(option);
   if (precision > (floating ? kMaxFloatingPrecision : size - 1)) Reject(option);

   format.Append('%');
   if (flags & kFlagMinus) format.Append('-');
   if (flags & kFlagPlus) format.Append('+');
   if (flags & kFlagSpace) format.Append(' ');
   if (flags & kFlagHash) format.Append('#');
   if (flags & kFlagZero) format.Append('0');
   if (width > 0) format.AppendNumber(width);
   if (precision >= 0) {
      format.Append('.');
      format.AppendNumber(precision);
   }
   format.Append(ModifierFor(type, letter));
   format.Append(letter);
   return letter;
}

Conversion Parse(const char* option, ValueType type, int size) {
   FormatBuilder format(option);
   int literalBytes = 0;
   char letter = '\0';
   for (const char* cursor = option; *cursor != '\0';) {
      if (*cursor != '%') {
         // Literal text alone already too long for the buffer can never fit.
         if (++literalBytes >= size) Reject(option);
         format.Append(*cursor++);
      } else if (cursor[1] == '%') {
         if (++literalBytes >= size) Reject(option);
         format.Append("%%");
         cursor += 2;
      } else {
         if (letter != '\0') Reject(option);
         ++cursor;
         letter = ParseConversion(option, cursor, type, size, format);
      }
   }
   if (letter == '\0') Reject(option);
   Conversion conversion;
   format.CopyTo(conversion.format);
   conversion.letter = letter;
   return conversion;
}

template <class T>
int Emit(const char* option, const Conversion& conversion, T value, char* buffer, int size) {
   int length = std::snprintf(buffer, size, conversion.format, value);
   if (length < 0 || length >= size) Reject(option);
   return length;
}

// Signed and unsigned conversions of one integer, each handed the type its modifier names.
template <class Signed, class Unsigned>
int ConvertInteger(const char* option, ValueType type, Signed asSigned, Unsigned asUnsigned,
                   char* buffer, int size) {
   Conversion conversion = Parse(option, type, size);
   switch (conversion.letter) {
      case 'c':
         return Emit(option, conversion, static_cast<int>(asUnsigned & 0xFF), buffer, size);
      case 'd':
      case 'i':
         return Emit(option, conversion, asSigned, buffer, size);
      default:
         return Emit(option, conversion, asUnsigned, buffer, size);
   }
}

}  // namespace

int Convert(const char* option, char value, char* buffer, int size) {
   return ConvertInteger(option, ValueType::Char, static_cast<int>(value),
                         static_cast<unsigned int>(static_cast<unsigned char>(value)), buffer,
                         size);
}

int Convert(const char* option, int32_t value, char* buffer, int size) {
   return ConvertInteger(option, ValueType::Int32, value, static_cast<uint32_t>(value), buffer,
                         size);
}

int Convert(const char* option, uint32_t value, char* buffer, int size) {
   return ConvertInteger(option, ValueType::UInt32, static_cast<int32_t>(value), value, buffer,
                         size);
}

int Convert(const char* option, int64_t value, char* buffer, int size) {
   return ConvertInteger(option, ValueType::Int64, static_cast<long long>(value),
                         static_cast<unsigned long long>(value), buffer, size);
}

int Convert(const char* option, uint64_t value, char* buffer, int size) {
   return ConvertInteger(option, ValueType::UInt64, static_cast<long long>(value),
                         static_cast<unsigned long long>(value), buffer, size);
}

int Convert(const char* option, double value, char* buffer, int size) {
   return Emit(option, Parse(option, ValueType::Double, size), value, buffer, size);
}

int Convert(const char* option, const void* value, char* buffer, int size) {
   Conversion conversion = Parse(option, ValueType::Pointer, size);
   auto address = reinterpret_cast<uintptr_t>(value);
   switch (conversion.letter) {
      case 'p':
         return Emit(option, conversion, value, buffer, size);
      case 'd':
         return Emit(option, conversion, static_cast<long long>(address), buffer, size);
      default:
         return Emit(option, conversion, static_cast<unsigned long long>(address), buffer, size);
   }
}

}  // namespace Pelmora::Internal
