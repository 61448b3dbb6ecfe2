#pragma once
// A PrintFormatter wraps one argument of a message: its value, an optional printf-style
// conversion text and the function that writes it. It is built implicitly from the
// argument, refers to (never copies) strings and objects, and must not outlive them.
// A plain value; formatting has no shared state.

#include <cstddef>
#include <cstdint>
#include <exception>
#include <string>
#include <string_view>
#include <type_traits>

#include "pelmora/object/export.h"
#include "pelmora/formatter/dateTime.h"
#include "pelmora/formatter/printable.h"
#include "pelmora/io/readerWriter.h"

namespace Pelmora {

class Throwable;

class PELMORA_EXPORT PrintFormatter {
public:
   union FormatValue {
      bool boolean;
      char character;
      int32_t int32;
      uint32_t uint32;
      int64_t int64;
      uint64_t uint64;
      float float32;
      double float64;
      const void* pointer;
      const char* string;
      const std::string* stlString;
      const std::string_view* stringView;
      const Object* object;
      const Printable* printable;
      const std::exception* exception;
      const Throwable* throwable;
      const DateTime* dateTime;
   };
   using FormatFunction = void (*)(Writer*, const FormatValue&, const char* option);

   // Inline, as every log call builds one per argument.
   PrintFormatter(bool value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.boolean = value}, option, FormatBoolean) {}
   PrintFormatter(char value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.character = value}, option, FormatChar) {}
   PrintFormatter(int value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.int32 = value}, option, FormatInt) {}
   PrintFormatter(unsigned int value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.uint32 = value}, option, FormatUInt) {}
   PrintFormatter(long value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.int64 = value}, option, FormatLong) {}
   PrintFormatter(unsigned long value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.uint64 = value}, option, FormatULong) {}
   PrintFormatter(long long value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.int64 = value}, option, FormatLong) {}
   PrintFormatter(unsigned long long value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.uint64 = value}, option, FormatULong) {}
   PrintFormatter(float value, const char* option = nullptr);
   PrintFormatter(double value, const char* option = nullptr);
   PrintFormatter(const void* value, const char* option = nullptr);
   PrintFormatter(const char* value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.string = value}, option, FormatString) {}
   PrintFormatter(std::nullptr_t, const char* option = nullptr);
   PrintFormatter(const std::string& value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.stlString = &value}, option, FormatSTLString) {}
   PrintFormatter(const std::string_view& value, const char* option = nullptr);
   PrintFormatter(const Object* value, const char* option = nullptr);
   PrintFormatter(const Object& value, const char* option = nullptr);
   PrintFormatter(const std::exception& value, const char* option = nullptr);
   PrintFormatter(const Throwable& value, const char* option = nullptr);
   // A printable value (an XML node) writes itself; these forms win over the object form
   // for types that are both.
   template <class T>
      requires std::is_base_of_v<Printable, T>
   PrintFormatter(const T* value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.printable = value}, option, FormatXmlNode) {}
   template <class T>
      requires std::is_base_of_v<Printable, T>
   PrintFormatter(const T& value, const char* option = nullptr)
      : PrintFormatter(FormatValue{.printable = &value}, option, FormatXmlNode) {}
   // Picks the printable form for references to printable objects, the object form for
   // the rest.
   template <class T>
   PrintFormatter(const Ref<T>& value, const char* option = nullptr)
      : PrintFormatter(static_cast<const T*>(value.Get()), option) {}

   void Print(Writer* writer) const { _function(writer, _value, _option); }
   // Appends what Print would write to `out`.
   void PrintToString(std::string& out) const;

   static void FormatBoolean(Writer*, const FormatValue&, const char* option);
   static void FormatChar(Writer*, const FormatValue&, const char* option);
   static void FormatInt(Writer*, const FormatValue&, const char* option);
   static void FormatUInt(Writer*, const FormatValue&, const char* option);
   static void FormatLong(Writer*, const FormatValue&, const char* option);
   static void FormatULong(Writer*, const FormatValue&, const char* option);
   static void FormatFloat(Writer*, const FormatValue&, const char* option);
   static void FormatDouble(Writer*, const FormatValue&, const char* option);
   static void FormatPtr(Writer*, const FormatValue&, const char* option);
   static void FormatString(Writer*, const FormatValue&, const char* option);
   static void FormatSTLString(Writer*, const FormatValue&, const char* option);
   static void FormatStringView(Writer*, const FormatValue&, const char* option);
   static void FormatObject(Writer*, const FormatValue&, const char* option);
   static void FormatException(Writer*, const FormatValue&, const char* option);
   static void FormatThrowable(Writer*, const FormatValue&, const char* option);
   static void FormatXmlNode(Writer*, const FormatValue&, const char* option);

protected:
   PrintFormatter(FormatValue value, const char* option, FormatFunction function)
      : _value(value), _option(option), _function(function) {}

private:
   // Writes the plain forms of the common types itself, without the call through _function.
   friend class MessageFormatter;

   FormatValue _value;
   const char* _option;
   FormatFunction _function;
};

// Formats a date-time (or a 64-bit UTC time in microseconds) as its short text.
class PELMORA_EXPORT DatePrintFormatter : public PrintFormatter {
public:
   DatePrintFormatter(const DateTime& value, const char* option = nullptr);
   DatePrintFormatter(int64_t microsecondsSinceEpoch, const char* option = nullptr);

   static void FormatDate(Writer*, const FormatValue&, const char* option);
   static void FormatLongDate(Writer*, const FormatValue&, const char* option);
   // Appends the short text to `out`.
   static void FormatDate(const DateTime& value, std::string& out);
};

// Formats a date-time as its full text.
class PELMORA_EXPORT DateTimePrintFormatter : public PrintFormatter {
public:
   DateTimePrintFormatter(const DateTime& value, const char* option = nullptr);

   static void FormatDateTime(Writer*, const FormatValue&, const char* option);
   // Appends the full text to `out`.
   static void FormatDateTime(const DateTime& value, std::string& out);
};

}  // namespace Pelmora
