// The argument formatters and the placeholder walk behind every message of the library.

#include <algorithm>
#include <charconv>
#include <climits>
#include <cstring>
#include <typeinfo>

#include "pelmora/exception/debugConfig.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/formatter/printFormatter.h"
#include "src/core/conversion.h"
#include "src/internal/shortCopy.h"

namespace Pelmora {
namespace {

// Conversion buffer sizes, in bytes.
constexpr int kCharBuffer = 5;
constexpr int kIntBuffer = 24;
constexpr int kLongBuffer = 50;
constexpr int kFloatingBuffer = 50;
constexpr int kPointerBuffer = 20;

constexpr char kNull[] = "(null)";

// Writer::Write takes an int length; longer pieces go in several writes.
void WriteAll(Writer* writer, const char* data, size_t length) {
   while (length > static_cast<size_t>(INT_MAX)) {
      writer->Write(data, INT_MAX);
      data += INT_MAX;
      length -= INT_MAX;
   }
   writer->Write(data, static_cast<int>(length));
}

void WriteText(Writer* writer, const char* text) {
   WriteAll(writer, text, std::strlen(text));
}

void WriteNull(Writer* writer) {
   writer->Write(kNull, sizeof(kNull) - 1);
}

// The default integer conversions ("%d", "%u", "%Ld", "%Lu") without parsing a format.
template <class T>
void WriteDecimal(Writer* writer, T value) {
   char buffer[kIntBuffer];
   auto result = std::to_chars(buffer, buffer + sizeof(buffer), value);
   writer->Write(buffer, static_cast<int>(result.ptr - buffer));
}

// The default floating conversions: to_chars matches printf's "%f" and "%g" digit for digit.
void WriteFloating(Writer* writer, double value, std::chars_format style,
                   const char* defaultOption) {
   char buffer[kFloatingBuffer];
   // snprintf needs room for the terminating zero; keep the same capacity.
   auto result = std::to_chars(buffer, buffer + sizeof(buffer) - 1, value, style, 6);
   if (result.ec != std::errc()) throw InvalidFormatStringException(defaultOption);
   writer->Write(buffer, static_cast<int>(result.ptr - buffer));
}

template <int Size, class T>
void WriteConverted(Writer* writer, const char* option, T value) {
   char buffer[Size];
   int length = Internal::Convert(option, value, buffer, Size);
   writer->Write(buffer, length);
}

// Collects the text of ASPrint on the stack; only output past the inline buffer allocates.
class StackStringWriter final : public ObjectImpl, public virtual Writer {
public:
   void Write(const char* data, int length) override {
      if (length <= 0) return;
      if (_spill.empty() && _length + length <= static_cast<int>(sizeof(_inline))) {
         std::memcpy(_inline + _length, data, length);
         _length += length;
         return;
      }
      if (_spill.empty()) {
         _spill.reserve(static_cast<size_t>(_length + length) * 2);
         _spill.assign(_inline, _length);
      }
      _spill.append(data, length);
   }
   void Close() override {}

   std::string TakeString() {
      if (_spill.empty()) return std::string(_inline, _length);
      return std::move(_spill);
   }

private:
   char _inline[256];
   int _length = 0;
   std::string _spill;
};

// Appends everything written to a caller's string.
class AppendWriter final : public ObjectImpl, public virtual Writer {
public:
   explicit AppendWriter(std::string& out) : _out(out) {}
   void Write(const char* data, int length) override {
      if (length > 0) _out.append(data, length);
   }
   void Close() override {}

private:
   std::string& _out;
};

}  // namespace

PrintFormatter::PrintFormatter(float value, const char* option)
    : PrintFormatter(FormatValue{.float32 = value}, option, FormatFloat) {}
PrintFormatter::PrintFormatter(double value, const char* option)
    : PrintFormatter(FormatValue{.float64 = value}, option, FormatDouble) {}
PrintFormatter::PrintFormatter(const void* value, const char* option)
    : PrintFormatter(FormatValue{.pointer = value}, option, FormatPtr) {}
PrintFormatter::PrintFormatter(std::nullptr_t, const char* option)
    : PrintFormatter(FormatValue{.string = nullptr}, option, FormatString) {}
PrintFormatter::PrintFormatter(const std::string_view& value, const char* option)
    : PrintFormatter(FormatValue{.stringView = &value}, option, FormatStringView) {}
PrintFormatter::PrintFormatter(const Object* value, const char* option)
    : PrintFormatter(FormatValue{.object = value}, option, FormatObject) {}
PrintFormatter::PrintFormatter(const Object& value, const char* option)
    : PrintFormatter(FormatValue{.object = &value}, option, FormatObject) {}
PrintFormatter::PrintFormatter(const std::exception& value, const char* option)
    : PrintFormatter(FormatValue{.exception = &value}, option, FormatException) {}
PrintFormatter::PrintFormatter(const Throwable& value, const char* option)
    : PrintFormatter(FormatValue{.throwable = &value}, option, FormatThrowable) {}

void PrintFormatter::PrintToString(std::string& out) const {
   AppendWriter writer(out);
   Print(&writer);
}

void PrintFormatter::FormatBoolean(Writer* writer, const FormatValue& value, const char*) {
   if (value.boolean) {
      writer->Write("true", 4);
   } else {
      writer->Write("false", 5);
   }
}

void PrintFormatter::FormatChar(Writer* writer, const FormatValue& value, const char* option) {
   if (!option) {
      writer->Write(&value.character, 1);
      return;
   }
   WriteConverted<kCharBuffer>(writer, option, value.character);
}

void PrintFormatter::FormatInt(Writer* writer, const FormatValue& value, const char* option) {
   if (!option) return WriteDecimal(writer, value.int32);
   WriteConverted<kIntBuffer>(writer, option, value.int32);
}

void PrintFormatter::FormatUInt(Writer* writer, const FormatValue& value, const char* option) {
   if (!option) return WriteDecimal(writer, value.uint32);
   WriteConverted<kIntBuffer>(writer, option, value.uint32);
}

void PrintFormatter::FormatLong(Writer* writer, const FormatValue& value, const char* option) {
   if (!option) return WriteDecimal(writer, value.int64);
   WriteConverted<kLongBuffer>(writer, option, value.int64);
}

void PrintFormatter::FormatULong(Writer* writer, const FormatValue& value, const char* option) {
   if (!option) return WriteDecimal(writer, value.uint64);
   WriteConverted<kLongBuffer>(writer, option, value.uint64);
}

void PrintFormatter::FormatFloat(Writer* writer, const FormatValue& value, const char* option) {
   double promoted = value.float32;
   if (!option) return WriteFloating(writer, promoted, std::chars_format::fixed, "%f");
   WriteConverted<kFloatingBuffer>(writer, option, promoted);
}

void PrintFormatter::FormatDouble(Writer* writer, const FormatValue& value, const char* option) {
   if (!option) return WriteFloating(writer, value.float64, std::chars_format::general, "%g");
   WriteConverted<kFloatingBuffer>(writer, option, value.float64);
}

void PrintFormatter::FormatPtr(Writer* writer, const FormatValue& value, const char* option) {
   if (option) return WriteConverted<kPointerBuffer>(writer, option, value.pointer);
   // "%08x" over the whole address: at least eight hexadecimal digits, zero-padded.
   char digits[kPointerBuffer];
   auto result = std::to_chars(digits, digits + sizeof(digits),
                               reinterpret_cast<uintptr_t>(value.pointer), 16);
   int length = static_cast<int>(result.ptr - digits);
   if (length < 8) {
      char padded[8];
      std::memset(padded, '0', 8 - length);
      std::memcpy(padded + 8 - length, digits, length);
      writer->Write(padded, 8);
   } else {
      writer->Write(digits, length);
   }
}

void PrintFormatter::FormatString(Writer* writer, const FormatValue& value, const char*) {
   if (!value.string) return WriteNull(writer);
   WriteText(writer, value.string);
}

void PrintFormatter::FormatSTLString(Writer* writer, const FormatValue& value, const char*) {
   if (!value.stlString) return WriteNull(writer);
   WriteAll(writer, value.stlString->data(), value.stlString->size());
}

void PrintFormatter::FormatStringView(Writer* writer, const FormatValue& value, const char*) {
   if (!value.stringView) return WriteNull(writer);
   WriteAll(writer, value.stringView->data(), value.stringView->size());
}

void PrintFormatter::FormatObject(Writer* writer, const FormatValue& value, const char*) {
   if (!value.object) return WriteNull(writer);
   // Describing an object does not change it; ToString is not const for its overriders.
   std::string text = const_cast<Object*>(value.object)->ToString();
   WriteAll(writer, text.data(), text.size());
}

void PrintFormatter::FormatException(Writer* writer, const FormatValue& value, const char*) {
   const std::exception* exception = value.exception;
   if (!exception) return WriteNull(writer);
   WriteText(writer, TypeName(typeid(*exception)));
   writer->Write("(", 1);
   WriteText(writer, exception->what());
   writer->Write(")", 1);
}

void PrintFormatter::FormatXmlNode(Writer* writer, const FormatValue& value, const char*) {
   if (!value.printable) {
      writer->Write("(null)", 6);
      return;
   }
   value.printable->PrintTo(writer);
}

void PrintFormatter::FormatThrowable(Writer* writer, const FormatValue& value, const char* option) {
   const Throwable* throwable = value.throwable;
   FormatValue asException{.exception = throwable};
   FormatException(writer, asException, option);
   if (!throwable) return;

   Service::DebugConfig& config = Service::GetDebugConfig();
   int maxFrames = config.GetExceptionBacktrace();
   if (maxFrames == 0) return;
   const Ref<System::Backtrace>& backtrace = throwable->GetBacktrace();
   if (!backtrace) return;

   // The outer frames every thread shares (start-up, thread entry) say nothing; drop them.
   int frames = backtrace->GetFrameCount();
   Ref<System::Backtrace> reference = config.GetReferenceFrames();
   if (reference) {
      int referenceFrames = reference->GetFrameCount();
      while (frames > 0 && referenceFrames > 0 &&
             backtrace->GetFrame(frames - 1) == reference->GetFrame(referenceFrames - 1)) {
         --frames;
         --referenceFrames;
      }
   }
   if (maxFrames > 0) frames = std::min(frames, maxFrames);
   if (frames == 0) return;
   std::string text = backtrace->GetText(0, frames);
   writer->Write("\n", 1);
   WriteAll(writer, text.data(), text.size());
}

namespace {

// Hands each piece to the writer as it comes.
class DirectPieces {
public:
   explicit DirectPieces(Writer* writer) : _writer(writer) {}
   void Append(const char* data, size_t length) { WriteAll(_writer, data, length); }
   // The writer, with everything appended so far written to it.
   Writer* GetWriter() { return _writer; }

private:
   Writer* _writer;
};

// Gathers pieces on the stack; the writer sees them when the buffer fills, before an
// argument writes itself, and at the end.
class JoinedPieces {
public:
   explicit JoinedPieces(Writer* writer) : _writer(writer) {}
   void Append(const char* data, size_t length) {
      if (length > sizeof(_data) - _used) {
         Drain();
         if (length > sizeof(_data)) return WriteAll(_writer, data, length);
      }
      std::memcpy(_data + _used, data, length);
      _used += length;
   }
   // Room for at least `length` bytes; Commit says where the bytes written there end.
   char* Room(size_t length) {
      if (length > sizeof(_data) - _used) Drain();
      return _data + _used;
   }
   void Commit(const char* end) { _used = static_cast<size_t>(end - _data); }
   void Drain() {
      if (_used == 0) return;
      size_t used = _used;
      _used = 0;
      _writer->Write(_data, static_cast<int>(used));
   }
   Writer* GetWriter() {
      Drain();
      return _writer;
   }

private:
   Writer* _writer;
   size_t _used = 0;
   char _data[256];
};

template <class T>
void AppendDecimal(JoinedPieces& pieces, T value) {
   char* room = pieces.Room(kIntBuffer);
   pieces.Commit(std::to_chars(room, room + kIntBuffer, value).ptr);
}

// Converts into [out, end) and moves `out` past the digits; false when they do not fit.
template <class T>
bool AppendNumber(char*& out, char* end, T value) {
   auto result = std::to_chars(out, end, value);
   if (result.ec != std::errc()) return false;
   out = result.ptr;
   return true;
}

// The placeholder walk: literal runs go to `pieces`, each argument to `argument`.
template <class Pieces, class Argument>
void Walk(Pieces& pieces, const char* format, const PrintFormatter* args, int count,
          Argument argument) {
   const char* at = format;
   for (;;) {
      const char* percent = strchrnul(at, '%');
      if (percent > at) pieces.Append(at, static_cast<size_t>(percent - at));
      if (*percent == '\0') return;
      char next = percent[1];
      if (next == '\0') return;
      if (next >= '1' && next <= '9') {
         int number = next - '0';
         if (number > count) {
            pieces.GetWriter();  // what came before stays written
            throw InvalidFormatStringException(format);
         }
         argument(args[number - 1]);
      } else if (next == '%') {
         pieces.Append("%", 1);
      } else {
         pieces.Append(percent, 2);
      }
      at = percent + 2;
   }
}

}  // namespace

void MessageFormatter::PrintArgs(Writer* writer, const char* format, const PrintFormatter* args,
                                 int count) {
   DirectPieces pieces(writer);
   Walk(pieces, format, args, count, [writer](const PrintFormatter& arg) { arg.Print(writer); });
}

void MessageFormatter::PrintArgsJoined(Writer* writer, const char* format,
                                       const PrintFormatter* args, int count) {
   JoinedPieces pieces(writer);
   // The plain forms of the common types are appended here; the call through the
   // argument's function and the writer's per piece cost more than the conversion.
   auto argument = [&pieces](const PrintFormatter& arg) {
      const PrintFormatter::FormatValue& value = arg._value;
      PrintFormatter::FormatFunction function = arg._function;
      if (arg._option == nullptr) {
         if (function == PrintFormatter::FormatInt) return AppendDecimal(pieces, value.int32);
         if (function == PrintFormatter::FormatUInt) return AppendDecimal(pieces, value.uint32);
         if (function == PrintFormatter::FormatLong) return AppendDecimal(pieces, value.int64);
         if (function == PrintFormatter::FormatULong) return AppendDecimal(pieces, value.uint64);
         if (function == PrintFormatter::FormatChar) return pieces.Append(&value.character, 1);
      }
      if (function == PrintFormatter::FormatString) {
         if (!value.string) return pieces.Append(kNull, sizeof(kNull) - 1);
         return pieces.Append(value.string, std::strlen(value.string));
      }
      if (function == PrintFormatter::FormatSTLString && value.stlString) {
         return pieces.Append(value.stlString->data(), value.stlString->size());
      }
      if (function == PrintFormatter::FormatStringView && value.stringView) {
         return pieces.Append(value.stringView->data(), value.stringView->size());
      }
      if (function == PrintFormatter::FormatBoolean) {
         return value.boolean ? pieces.Append("true", 4) : pieces.Append("false", 5);
      }
      arg.Print(pieces.GetWriter());
   };
   Walk(pieces, format, args, count, argument);
   pieces.Drain();
}

namespace {

// Appends the plain form of `arg` at `out`: 1 when done, 0 when it does not fit, -1 when
// the argument is not of a plain kind.
int AppendPlainArgument(char*& out, char* end, const PrintFormatter::FormatValue& value,
                        PrintFormatter::FormatFunction function, const char* option) {
   auto append = [&out, end](const char* data, size_t length) {
      if (length > static_cast<size_t>(end - out)) return 0;
      Internal::CopyShort(out, data, length);
      out += length;
      return 1;
   };
   if (function == PrintFormatter::FormatSTLString && value.stlString) {
      return append(value.stlString->data(), value.stlString->size());
   }
   if (function == PrintFormatter::FormatString && value.string) {
      return append(value.string, std::strlen(value.string));
   }
   if (option != nullptr) return -1;
   if (function == PrintFormatter::FormatInt) return AppendNumber(out, end, value.int32);
   if (function == PrintFormatter::FormatUInt) return AppendNumber(out, end, value.uint32);
   if (function == PrintFormatter::FormatLong) return AppendNumber(out, end, value.int64);
   if (function == PrintFormatter::FormatULong) return AppendNumber(out, end, value.uint64);
   if (function == PrintFormatter::FormatChar) {
      if (out == end) return 0;
      *out++ = value.character;
      return 1;
   }
   if (function == PrintFormatter::FormatBoolean) {
      return value.boolean ? append("true", 4) : append("false", 5);
   }
   return -1;
}

}  // namespace

int MessageFormatter::PrintPlainArgs(char* buffer, size_t capacity, const char* format,
                                     const PrintFormatter* args, int count) {
   char* out = buffer;
   char* const end = buffer + capacity;
   auto append = [&out, end](const char* data, size_t length) {
      if (length > static_cast<size_t>(end - out)) return false;
      Internal::CopyShort(out, data, length);
      out += length;
      return true;
   };
   // The same walk as Walk's, in one function: no writer to drain, and no argument that
   // could write itself.
   const char* at = format;
   for (;;) {
      const char* percent = strchrnul(at, '%');
      if (!append(at, static_cast<size_t>(percent - at))) return -1;
      if (*percent == '\0' || percent[1] == '\0') break;
      char next = percent[1];
      at = percent + 2;
      if (next == '%') {
         if (out == end) return -1;
         *out++ = '%';
         continue;
      }
      if (next < '1' || next > '9') {
         if (!append(percent, 2)) return -1;
         continue;
      }
      int number = next - '0';
      if (number > count) return -1;
      const PrintFormatter& arg = args[number - 1];
      if (AppendPlainArgument(out, end, arg._value, arg._function, arg._option) <= 0) return -1;
   }
   return static_cast<int>(out - buffer);
}

bool ParsedFormat::Parse(const char* format, ParsedFormat& out) {
   out.format = format;
   out.count = 0;
   out.arguments = 0;
   size_t run = 0;  // where the current literal run starts
   size_t at = 0;
   auto add = [&out](size_t start, size_t length, int argument) {
      if (out.count == kMaxPieces) return false;
      out.pieces[out.count++] = {static_cast<uint16_t>(start), static_cast<uint16_t>(length),
                                 static_cast<int8_t>(argument)};
      return true;
   };
   for (;;) {
      const char* percent = strchrnul(format + at, '%');
      size_t position = static_cast<size_t>(percent - format);
      if (position > 0xFFFF) return false;
      char next = *percent == '\0' ? '\0' : percent[1];
      if (next == '\0') return add(run, position - run, -1);  // a lone '%' ends the text
      if (next >= '1' && next <= '9') {
         if (!add(run, position - run, next - '1')) return false;
         if (next - '0' > out.arguments) out.arguments = next - '0';
         run = at = position + 2;
      } else if (next == '%') {
         // The first '%' ends the run; the second is skipped.
         if (!add(run, position + 1 - run, -1)) return false;
         run = at = position + 2;
      } else {
         at = position + 2;  // "%x" stays in the run as it is
      }
   }
}

int MessageFormatter::PrintPlainParsed(char* buffer, size_t capacity, const ParsedFormat& parsed,
                                       const PrintFormatter* args, int count) {
   if (parsed.arguments > count) return -1;
   char* out = buffer;
   char* const end = buffer + capacity;
   const ParsedFormat::Piece* piece = parsed.pieces;
   for (const ParsedFormat::Piece* last = piece + parsed.count; piece != last; ++piece) {
      if (piece->length > static_cast<size_t>(end - out)) return -1;
      Internal::CopyShort(out, parsed.format + piece->at, piece->length);
      out += piece->length;
      if (piece->argument < 0) continue;
      const PrintFormatter& arg = args[piece->argument];
      if (AppendPlainArgument(out, end, arg._value, arg._function, arg._option) <= 0) return -1;
   }
   return static_cast<int>(out - buffer);
}

std::string MessageFormatter::ASPrintArgs(const char* format, const PrintFormatter* args,
                                          int count) {
   StackStringWriter writer;
   PrintArgs(&writer, format, args, count);
   return writer.TakeString();
}

}  // namespace Pelmora
