// Fuzzes the placeholder walk and the argument formatters. The input's second byte gives
// the length of the format string that follows; the rest picks up to nine arguments, some
// with a fuzzed conversion text. Only InvalidFormatStringException may leave a formatting
// call; any other exception escapes and ends the run as a crash. The walk that joins
// pieces must write what the plain walk writes, and so must the walk into a buffer (of a
// size from the input's first byte) whenever it does not decline, and the walk over the
// parsed format whenever the format could be parsed.

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <string>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter.h"

using namespace Pelmora;

namespace {

class Input {
public:
   Input(const uint8_t* data, size_t size) : _data(data), _size(size) {}
   bool Empty() const { return _position >= _size; }
   uint8_t Byte() { return Empty() ? 0 : _data[_position++]; }
   template <class T>
   T Value() {
      T value{};
      size_t count = std::min(sizeof(T), _size - std::min(_position, _size));
      std::memcpy(&value, _data + _position, count);
      _position += count;
      return value;
   }
   // Up to `limit` bytes; a zero byte would end the C string early anyway.
   std::string Text(size_t limit) {
      std::string text;
      while (!Empty() && text.size() < limit) {
         char c = static_cast<char>(_data[_position++]);
         if (c == '\0') break;
         text += c;
      }
      return text;
   }

private:
   const uint8_t* _data;
   size_t _size;
   size_t _position = 0;
};

void Check(bool condition, const char* what) {
   if (!condition) {
      std::fprintf(stderr, "check failed: %s\n", what);
      std::abort();
   }
}

// Appends every piece to one string.
class TextWriter final : public virtual Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override { text.append(data, length); }
   void Close() override {}
   std::string text;
};

// The joined walk (log lines) writes what the plain walk writes, up to the same error.
void CheckJoinedWalk(const std::string& format, const std::vector<PrintFormatter>& args) {
   TextWriter plain, joined;
   bool plainThrew = false, joinedThrew = false;
   int count = static_cast<int>(args.size());
   try {
      MessageFormatter::PrintArgs(&plain, format.c_str(), args.data(), count);
   } catch (const InvalidFormatStringException&) {
      plainThrew = true;
   }
   try {
      MessageFormatter::PrintArgsJoined(&joined, format.c_str(), args.data(), count);
   } catch (const InvalidFormatStringException&) {
      joinedThrew = true;
   }
   Check(plainThrew == joinedThrew && plain.text == joined.text, "joined walk");
}

// The walk into a buffer writes what the plain walk writes, or declines; it never writes
// past `capacity` (the bytes beyond it stay as they were).
void CheckBufferWalk(const std::string& format, const std::vector<PrintFormatter>& args,
                     size_t capacity) {
   TextWriter plain;
   bool plainThrew = false;
   try {
      MessageFormatter::PrintArgs(&plain, format.c_str(), args.data(),
                                  static_cast<int>(args.size()));
   } catch (const InvalidFormatStringException&) {
      plainThrew = true;
   }
   std::string buffer(capacity + 16, '#');
   int length = MessageFormatter::PrintPlainArgs(buffer.data(), capacity, format.c_str(),
                                                 args.data(), static_cast<int>(args.size()));
   Check(buffer.compare(capacity, 16, std::string(16, '#')) == 0, "buffer walk stays in room");
   if (length < 0) return;
   Check(!plainThrew, "buffer walk declines a bad placeholder");
   Check(static_cast<size_t>(length) <= capacity, "buffer walk length");
   Check(buffer.substr(0, static_cast<size_t>(length)) == plain.text, "buffer walk");
}

// The walk over the parsed format agrees with the walk into a buffer: the same length or
// decline, the same bytes, nothing past `capacity`.
void CheckParsedWalk(const std::string& format, const std::vector<PrintFormatter>& args,
                     size_t capacity) {
   ParsedFormat parsed;
   if (!ParsedFormat::Parse(format.c_str(), parsed)) return;
   int count = static_cast<int>(args.size());
   std::string expected(capacity + 16, '#'), buffer(capacity + 16, '#');
   int expectedLength =
       MessageFormatter::PrintPlainArgs(expected.data(), capacity, format.c_str(), args.data(), count);
   int length = MessageFormatter::PrintPlainParsed(buffer.data(), capacity, parsed, args.data(), count);
   Check(buffer.compare(capacity, 16, std::string(16, '#')) == 0, "parsed walk stays in room");
   Check(length == expectedLength, "parsed walk length");
   if (length >= 0) Check(buffer.compare(0, length, expected, 0, length) == 0, "parsed walk");
}

template <class T>
void CheckDefault(const PrintFormatter& formatter, const char* printfFormat, T value) {
   char expected[64];
   int length = std::snprintf(expected, sizeof(expected), printfFormat, value);
   std::string text;
   formatter.PrintToString(text);
   Check(text == std::string(expected, length), printfFormat);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
   Input input(data, size);
   size_t capacity = input.Byte();
   std::string format = input.Text(input.Byte());

   // Values and texts stay put while the formatters refer to them.
   std::deque<std::string> texts;
   std::deque<DateTime> dates;
   std::vector<PrintFormatter> args;
   while (args.size() < 9 && !input.Empty()) {
      uint8_t choice = input.Byte();
      const char* option = nullptr;
      if (choice & 0x80) option = texts.emplace_back(input.Text(24)).c_str();
      switch (choice & 0x0F) {
         case 0: {
            auto value = input.Value<int32_t>();
            args.emplace_back(value, option);
            if (!option) CheckDefault(args.back(), "%d", value);
            break;
         }
         case 1: {
            auto value = input.Value<uint32_t>();
            args.emplace_back(value, option);
            if (!option) CheckDefault(args.back(), "%u", value);
            break;
         }
         case 2: {
            auto value = input.Value<long long>();
            args.emplace_back(value, option);
            if (!option) CheckDefault(args.back(), "%lld", value);
            break;
         }
         case 3: {
            auto value = input.Value<unsigned long long>();
            args.emplace_back(value, option);
            if (!option) CheckDefault(args.back(), "%llu", value);
            break;
         }
         case 4: {
            auto value = input.Value<double>();
            args.emplace_back(value, option);
            if (!option) CheckDefault(args.back(), "%g", value);
            break;
         }
         case 5: {
            auto value = input.Value<float>();
            args.emplace_back(value, option);
            if (!option) CheckDefault(args.back(), "%f", static_cast<double>(value));
            break;
         }
         case 6:
            args.emplace_back(static_cast<char>(input.Byte()), option);
            break;
         case 7:
            args.emplace_back(reinterpret_cast<const void*>(input.Value<uintptr_t>()), option);
            break;
         case 8:
            args.emplace_back(texts.emplace_back(input.Text(32)), option);
            break;
         case 9:
            args.emplace_back(texts.emplace_back(input.Text(32)).c_str(), option);
            break;
         case 10:
            args.emplace_back(static_cast<const char*>(nullptr), option);
            break;
         case 11:
            args.emplace_back((input.Byte() & 1) != 0, option);
            break;
         case 12:
            args.emplace_back(DatePrintFormatter(dates.emplace_back(input.Value<int64_t>())));
            break;
         case 13:
            args.emplace_back(DateTimePrintFormatter(dates.emplace_back(input.Value<int64_t>())));
            break;
         default:
            args.emplace_back(DatePrintFormatter(input.Value<int64_t>()));
            break;
      }
   }

   try {
      std::string text =
          MessageFormatter::ASPrintArgs(format.c_str(), args.data(), static_cast<int>(args.size()));
      if (format.find('%') == std::string::npos) Check(text == format, "literal format");
   } catch (const InvalidFormatStringException&) {
   }
   CheckJoinedWalk(format, args);
   CheckBufferWalk(format, args, capacity);
   CheckParsedWalk(format, args, capacity);
   for (const PrintFormatter& arg : args) {
      try {
         std::string text;
         arg.PrintToString(text);
      } catch (const InvalidFormatStringException&) {
      }
   }
   for (const DateTime& date : dates) {
      // The short text is the full text without its fraction.
      std::string full = date.ToFullString();
      Check(full.size() > 8 && full.substr(0, full.size() - 8) + "Z" == date.ToShortString(),
            "short and full date texts");
   }
   return 0;
}
