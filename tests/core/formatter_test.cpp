#include <gtest/gtest.h>

#include <time.h>

#include <cfloat>
#include <climits>
#include <cmath>
#include <cstdio>
#include <initializer_list>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "pelmora/exception.h"
#include "pelmora/formatter.h"
#include "tests/support/pieceWriter.h"

namespace Pelmora {
namespace {

using TestSupport::PieceWriter;

class ThrowingObject final : public ObjectImpl {
public:
   std::string ToString() const override { throw InvalidStateException(); }
};

class NamedObject final : public ObjectImpl {
public:
   std::string ToString() const override { return "named"; }
};

std::string Format(const PrintFormatter& formatter) {
   std::string text;
   formatter.PrintToString(text);
   return text;
}

// The message of the InvalidFormatStringException that `formatter` throws, or "no throw".
std::string FormatError(const PrintFormatter& formatter) {
   try {
      Format(formatter);
   } catch (const InvalidFormatStringException& e) {
      return e.what();
   }
   return "no throw";
}

template <class T>
std::string Printf(const char* format, T value) {
   char buffer[128];
   int length = snprintf(buffer, sizeof(buffer), format, value);
   return std::string(buffer, length);
}

TEST(MessageFormatterTest, WalksPlaceholdersPercentSignsAndOtherText) {
   EXPECT_EQ("5%", MessageFormatter::ASPrint("%1%%", 5));
   EXPECT_EQ("%s 7 %d", MessageFormatter::ASPrint("%s %1 %d", 7));
   EXPECT_EQ("a0", MessageFormatter::ASPrint("%10", 'a'));
   EXPECT_EQ("end", MessageFormatter::ASPrint("end%", 1));
   EXPECT_EQ("b a b", MessageFormatter::ASPrint("%2 %1 %2", "a", "b"));
   EXPECT_EQ("only 3", MessageFormatter::ASPrint("only %3", 1, 2, 3));
   EXPECT_EQ("%0 %x %", MessageFormatter::ASPrint("%0 %x %%", 1));
   EXPECT_EQ("9", MessageFormatter::ASPrint("%9", 1, 2, 3, 4, 5, 6, 7, 8, 9));
   EXPECT_EQ("", MessageFormatter::ASPrint("", 1));
}

TEST(MessageFormatterTest, WritesEachLiteralRunInOneCall) {
   PieceWriter writer;
   MessageFormatter::Print(&writer, "abc %1 def%%ghi%2", 5, true);
   std::vector<std::string> expected = {"abc ", "5", " def", "%", "ghi", "true"};
   EXPECT_EQ(expected, writer.pieces);
}

TEST(MessageFormatterTest, ErrorsPropagateAndKeepWhatWasWritten) {
   PieceWriter writer;
   try {
      MessageFormatter::Print(&writer, "one %1 then %2", 1);
      ADD_FAILURE() << "a placeholder beyond the arguments must throw";
   } catch (const InvalidFormatStringException& e) {
      EXPECT_STREQ("one %1 then %2", e.what());
   }
   EXPECT_EQ("one 1 then ", writer.Text());

   PieceWriter second;
   ThrowingObject object;
   EXPECT_THROW(MessageFormatter::Print(&second, "before %1 after", &object),
                InvalidStateException);
   EXPECT_EQ("before ", second.Text());
}

// The joined walk (log lines) must write what the plain walk writes, for every argument
// type it appends itself and those it leaves to their formatter, and keep what came
// before an error.
TEST(MessageFormatterTest, JoinedWalkWritesThePlainTextInFewerPieces) {
   auto both = [](const char* format, std::initializer_list<PrintFormatter> args) {
      PieceWriter plain, joined;
      MessageFormatter::PrintArgs(&plain, format, args.begin(), static_cast<int>(args.size()));
      MessageFormatter::PrintArgsJoined(&joined, format, args.begin(),
                                        static_cast<int>(args.size()));
      EXPECT_EQ(plain.Text(), joined.Text()) << format;
      return joined.pieces.size();
   };
   std::string stl = "stl";
   std::string_view view = "view";
   const char* nullString = nullptr;
   EXPECT_EQ(1u, both("a %1 b %2 c %3 d %4 e %5 %6 %7 %8 %9%%",
                      {INT_MIN, UINT_MAX, LLONG_MIN, ULLONG_MAX, 'z', true, stl, view,
                       nullString}));
   both("%1|%2|%3|%4|%5", {false, 2.5, PrintFormatter(42, "%05d"), 'q', "text"});
   both("%0 %x end%", {1});
   both("", {1});

   // Past the stack buffer, and a piece larger than it: nothing cut or reordered.
   std::string big(1000, 'b');
   std::string format = std::string(300, 'f') + "%1<%2>";
   both(format.c_str(), {big, std::string(250, 's')});

   PieceWriter partial;
   const PrintFormatter one[] = {PrintFormatter(1)};
   EXPECT_THROW(MessageFormatter::PrintArgsJoined(&partial, "one %1 then %2", one, 1),
                InvalidFormatStringException);
   EXPECT_EQ("one 1 then ", partial.Text());
   PieceWriter before;
   ThrowingObject object;
   const PrintFormatter throwing[] = {PrintFormatter(&object)};
   EXPECT_THROW(MessageFormatter::PrintArgsJoined(&before, "before %1 after", throwing, 1),
                InvalidStateException);
   EXPECT_EQ("before ", before.Text());
}

// The in-place walk (a log line's chunk) writes what the plain walk writes, and declines
// (so that the caller starts over) whatever it cannot finish alone: no room left, a kind
// of argument that writes itself, a conversion option, a null string, a bad placeholder.
TEST(MessageFormatterTest, PlainWalkIntoABufferMatchesThePlainWalkOrDeclines) {
   auto into = [](const char* format, std::initializer_list<PrintFormatter> args,
                  size_t capacity = 512) {
      std::string buffer(capacity, '\0');
      int length = MessageFormatter::PrintPlainArgs(buffer.data(), capacity, format,
                                                    args.begin(), static_cast<int>(args.size()));
      // The walk over the parsed format writes the same, or declines alike.
      ParsedFormat parsed;
      if (ParsedFormat::Parse(format, parsed)) {
         std::string again(capacity, '\0');
         int parsedLength = MessageFormatter::PrintPlainParsed(
             again.data(), capacity, parsed, args.begin(), static_cast<int>(args.size()));
         EXPECT_EQ(parsedLength, length) << format;
         if (length >= 0) {
            EXPECT_EQ(again, buffer) << format;
         }
      }
      if (length < 0) return std::string("declined");
      EXPECT_LE(static_cast<size_t>(length), capacity);
      return buffer.substr(0, static_cast<size_t>(length));
   };
   auto plain = [](const char* format, std::initializer_list<PrintFormatter> args) {
      PieceWriter writer;
      MessageFormatter::PrintArgs(&writer, format, args.begin(), static_cast<int>(args.size()));
      return writer.Text();
   };
   std::string stl = "stl", empty, longer(40, 'l');
   const char* text = "text of nineteen ch";
   const char* formats[] = {"a %1 b %2 c %3 d %4 e %5 %6 %7 %8 %9%%", "%9%8%7%6%5%4%3%2%1",
                            "%0 %x %10 end%", "", "no placeholders at all, some 35 chars"};
   for (const char* format : formats) {
      std::initializer_list<PrintFormatter> args = {INT_MIN, UINT_MAX, LLONG_MIN, ULLONG_MAX, 'z',
                                                    true, stl, text, longer};
      EXPECT_EQ(plain(format, args), into(format, args)) << format;
   }
   EXPECT_EQ("false||", into("%1|%2|%3", {false, empty, ""}));
   EXPECT_EQ("%% 1%% %", into("%%%% %1%%% %%%", {1}));
   EXPECT_EQ("declined", into("%1 %3", {1, 2}));

   // A format of more pieces than a parsed one holds is not parsed; the last that fits is.
   ParsedFormat parsed;
   std::string pieces;
   for (int i = 0; i < ParsedFormat::kMaxPieces - 1; ++i) pieces += "%%";
   EXPECT_TRUE(ParsedFormat::Parse(pieces.c_str(), parsed));
   EXPECT_EQ(parsed.count, ParsedFormat::kMaxPieces);
   pieces += "%1";
   EXPECT_FALSE(ParsedFormat::Parse(pieces.c_str(), parsed));
   EXPECT_FALSE(ParsedFormat::Parse(std::string(70000, 'x').c_str(), parsed));

   // Exactly enough room, and one byte short at each kind of piece.
   EXPECT_EQ("id 12345 ok", into("id %1 ok", {12345}, 11));
   EXPECT_EQ("declined", into("id %1 ok", {"12345"}, 10));
   EXPECT_EQ("declined", into("id %1", {12345}, 7));
   EXPECT_EQ("id -1", into("id %1", {-1}, 5));
   EXPECT_EQ("declined", into("100%%", {1}, 3));
   EXPECT_EQ("declined", into("%x", {1}, 1));

   // Declined before the argument is formatted: its formatting would throw here.
   ThrowingObject object;
   const char* nullString = nullptr;
   EXPECT_EQ("declined", into("%1 %2", {1, &object}));
   EXPECT_EQ("declined", into("%1", {2.5}));
   EXPECT_EQ("declined", into("%1", {PrintFormatter(42, "%05d")}));
   EXPECT_EQ("declined", into("%1", {nullString}));
   EXPECT_EQ("declined", into("%1 %2", {1}));
}

TEST(MessageFormatterTest, LongOutputIsComplete) {
   std::string piece(300, 'x');
   std::string text = MessageFormatter::ASPrint("<%1|%1>", piece);
   EXPECT_EQ("<" + piece + "|" + piece + ">", text);
}

TEST(PrintFormatterTest, StringsObjectsAndNullArguments) {
   const char* nullString = nullptr;
   const Object* nullObject = nullptr;
   EXPECT_EQ("(null) (null) (null)",
             MessageFormatter::ASPrint("%1 %2 %3", nullString, nullObject, nullptr));

   std::string withZero("a\0b", 3);
   std::string_view view = std::string_view("viewed text").substr(0, 6);
   EXPECT_EQ(std::string("[a\0b] viewed", 12),
             MessageFormatter::ASPrint("[%1] %2", withZero, view));

   NamedObject named;
   Ref<NamedObject> held = new NamedObject();
   EXPECT_EQ("named named named", MessageFormatter::ASPrint("%1 %2 %3", named, &named, held));

   EXPECT_EQ("true false", MessageFormatter::ASPrint("%1 %2", true, PrintFormatter(false, "%d")));

   std::string appended = "kept ";
   PrintFormatter(42).PrintToString(appended);
   EXPECT_EQ("kept 42", appended);
}

TEST(PrintFormatterTest, DefaultConversionsMatchPrintf) {
   for (int value : {0, 1, -1, 42, 2147483647, INT_MIN}) {
      EXPECT_EQ(Printf("%d", value), Format(value));
      EXPECT_EQ(Printf("%u", static_cast<unsigned>(value)), Format(static_cast<unsigned>(value)));
   }
   for (long long value : {0LL, -1LL, LLONG_MAX, LLONG_MIN, 1234567890123LL}) {
      EXPECT_EQ(Printf("%lld", value), Format(value));
      EXPECT_EQ(Printf("%ld", static_cast<long>(value)), Format(static_cast<long>(value)));
      EXPECT_EQ(Printf("%llu", static_cast<unsigned long long>(value)),
                Format(static_cast<unsigned long long>(value)));
   }
   const double doubles[] = {0.0,     -0.0,     1.0,       -2.5,  0.1,     1e-5,   1e-4,
                             123456,  1234567,  999999.5,  1e100, -1e-300, 5e-324, DBL_MAX,
                             DBL_MIN, HUGE_VAL, -HUGE_VAL, NAN,   -NAN};
   for (double value : doubles) {
      EXPECT_EQ(Printf("%g", value), Format(value)) << value;
      float single = static_cast<float>(value);
      EXPECT_EQ(Printf("%f", static_cast<double>(single)), Format(single)) << single;
   }
   EXPECT_EQ(Printf("%f", static_cast<double>(FLT_MAX)), Format(FLT_MAX));
   for (char value : {'a', ' ', '%'}) EXPECT_EQ(std::string(1, value), Format(value));

   const void* small = reinterpret_cast<const void*>(0xbeef);
   const void* large = reinterpret_cast<const void*>(0x7fff12345678);
   EXPECT_EQ("0000beef", Format(small));
   EXPECT_EQ("7fff12345678", Format(large));
}

TEST(PrintFormatterTest, OptionsShapeTheConversion) {
   EXPECT_EQ("00007", Format(PrintFormatter(7, "%05d")));
   EXPECT_EQ("[   -7]", Format(PrintFormatter(-7, "[%5d]")));
   EXPECT_EQ("ffffffff", Format(PrintFormatter(-1, "%x")));
   EXPECT_EQ("7%", Format(PrintFormatter(7, "%d%%")));
   // Length modifiers follow the argument, whatever the option says.
   EXPECT_EQ("300", Format(PrintFormatter(300, "%hhd")));
   EXPECT_EQ("-5", Format(PrintFormatter(-5, "%lld")));
   EXPECT_EQ("ffffffffffffffff", Format(PrintFormatter(-1LL, "%x")));
   EXPECT_EQ("4294967295", Format(PrintFormatter(4294967295u, "%Lu")));
   EXPECT_EQ("-1", Format(PrintFormatter(4294967295u, "%d")));
   EXPECT_EQ("ff", Format(PrintFormatter(static_cast<char>(-1), "%x")));
   EXPECT_EQ("65", Format(PrintFormatter('A', "%d")));
   EXPECT_EQ("A", Format(PrintFormatter(65, "%c")));
   EXPECT_EQ("3.14", Format(PrintFormatter(3.14159, "%.2f")));
   EXPECT_EQ("1.5e+00", Format(PrintFormatter(1.5f, "%.1e")));
   EXPECT_EQ("+2.5", Format(PrintFormatter(2.5, "%+Lg")));
   const void* address = reinterpret_cast<const void*>(0x123456789a);
   EXPECT_EQ("000000123456789a", Format(PrintFormatter(address, "%016x")));
   EXPECT_EQ("0x123456789a", Format(PrintFormatter(address, "%p")));
}

TEST(PrintFormatterTest, RejectedOptionsThrowWithTheOptionAsMessage) {
   // Output that cannot fit the conversion buffer.
   EXPECT_EQ("%100d", FormatError(PrintFormatter(1, "%100d")));
   EXPECT_EQ("%.30f", FormatError(PrintFormatter(1e20, "%.30f")));
   EXPECT_EQ("%5d", FormatError(PrintFormatter('a', "%5d")));
   EXPECT_EQ("-128", Format(PrintFormatter(static_cast<char>(-128), "%4d")));
   EXPECT_EQ("%.60d", FormatError(PrintFormatter(1LL, "%.60d")));
   std::string longText(30, 'x');
   longText += "%d";
   EXPECT_EQ(longText, FormatError(PrintFormatter(1, longText.c_str())));
   EXPECT_EQ("%020p", FormatError(PrintFormatter(&longText, "%020p")));

   // Conversions that would read an argument that is not there, or the wrong type.
   for (const char* option : {"%s", "%n", "%*d", "%.*d", "%d %d", "%f", "%p", "%ls", "%5%", "%'d",
                              "%#d", "%hld", "text", "", "%", "%l"}) {
      EXPECT_EQ(option, FormatError(PrintFormatter(1, option)));
   }
   for (const char* option : {"%d", "%s", "%c", "%x", "%n", "%Lf %f"}) {
      EXPECT_EQ(option, FormatError(PrintFormatter(1.0, option)));
   }
   for (const char* option : {"%.2c", "%05c", "%s", "%f"}) {
      EXPECT_EQ(option, FormatError(PrintFormatter('c', option)));
   }
   for (const char* option : {"%s", "%c", "%#p", "%.3p", "%i"}) {
      EXPECT_EQ(option, FormatError(PrintFormatter(&longText, option)));
   }
}

TEST(PrintFormatterTest, ExceptionsPrintTypeAndMessage) {
   std::runtime_error standard("boom");
   InvalidArgumentException own("key");
   EXPECT_EQ(std::string(typeid(standard).name()) + "(boom)", Format(standard));
   EXPECT_EQ("N7Pelmora24InvalidArgumentExceptionE(Invalid argument : key)", Format(own));
   const Exception& asBase = own;
   EXPECT_EQ(Format(own), Format(asBase));

   PieceWriter writer;
   PrintFormatter::FormatException(&writer, {.exception = nullptr}, nullptr);
   PrintFormatter::FormatThrowable(&writer, {.throwable = nullptr}, nullptr);
   EXPECT_EQ("(null)(null)", writer.Text());
}

// Stands in for the reference frames: the given addresses, innermost first.
class FixedBacktrace final : public ObjectImpl, public System::Backtrace {
public:
   explicit FixedBacktrace(std::vector<void*> frames) : _frames(std::move(frames)) {}
   int GetFrameCount() const override { return static_cast<int>(_frames.size()); }
   void* GetFrame(int index) const override { return _frames[index]; }
   std::string GetText(int, int) const override { return "fixed"; }

private:
   std::vector<void*> _frames;
};

class ThrowableBacktraceTest : public testing::Test {
protected:
   void TearDown() override {
      Service::GetDebugConfig().SetExceptionBacktrace(0);
      Service::GetDebugConfig().SetReferenceFrames(nullptr);
   }
};

TEST_F(ThrowableBacktraceTest, PrintsFramesNotSharedWithTheReference) {
   InvalidStateException error;
   const Ref<System::Backtrace>& backtrace = error.GetBacktrace();
   ASSERT_TRUE(backtrace);
   int frames = backtrace->GetFrameCount();
   ASSERT_GE(frames, 4);
   std::string head = "N7Pelmora21InvalidStateExceptionE(Invalid state)";
   EXPECT_EQ(head, Format(error));  // off by default

   // The reference shares the three outermost frames and differs further in.
   std::vector<void*> shared = {reinterpret_cast<void*>(1)};
   for (int i = frames - 3; i < frames; ++i) shared.push_back(backtrace->GetFrame(i));
   Service::GetDebugConfig().SetReferenceFrames(new FixedBacktrace(shared));
   Service::GetDebugConfig().SetExceptionBacktrace(100);
   EXPECT_EQ(head + "\n" + backtrace->GetText(0, frames - 3), Format(error));

   Service::GetDebugConfig().SetExceptionBacktrace(1);
   EXPECT_EQ(head + "\n" + backtrace->GetText(0, 1), Format(error));

   Service::GetDebugConfig().SetReferenceFrames(nullptr);
   Service::GetDebugConfig().SetExceptionBacktrace(100);
   EXPECT_EQ(head + "\n" + backtrace->GetText(0, frames), Format(error));
}

// The expected text from gmtime_r, with ISO-8601's signed form for years past 0000..9999.
std::string GmTimeText(int64_t seconds) {
   time_t time = seconds;
   struct tm fields;
   EXPECT_NE(nullptr, gmtime_r(&time, &fields));
   long long year = fields.tm_year + 1900LL;
   char buffer[64];
   snprintf(buffer, sizeof(buffer), "%s%04lld-%02d-%02dT%02d:%02d:%02dZ",
            year < 0 ? "-" : (year > 9999 ? "+" : ""), year < 0 ? -year : year, fields.tm_mon + 1,
            fields.tm_mday, fields.tm_hour, fields.tm_min, fields.tm_sec);
   return buffer;
}

TEST(DateTimeTest, TextsAreIsoInUtc) {
   DateTime sample(1795424559123456);
   EXPECT_EQ("2026-11-23T09:02:39Z", sample.ToShortString());
   EXPECT_EQ("2026-11-23T09:02:39.123456Z", sample.ToFullString());
   EXPECT_EQ("1970-01-01T00:00:00.000000Z", DateTime().ToFullString());
   EXPECT_EQ("2000-02-29T23:59:59.000007Z", DateTime(951868799000007).ToFullString());
   // Before 1970 the second and day round down, the fraction stays positive.
   EXPECT_EQ("1969-12-31T23:59:59.999999Z", DateTime(-1).ToFullString());
   EXPECT_EQ("1969-12-31T23:59:59Z", DateTime(-1).ToShortString());
   EXPECT_EQ("1969-12-31T23:59:59.000000Z", DateTime(-1000000).ToFullString());
   EXPECT_EQ("1900-03-01T00:00:00Z", DateTime(-2203891200LL * 1000000).ToShortString());
}

TEST(DateTimeTest, ShortTextAgreesWithGmtimeAcrossTheRange) {
   std::vector<int64_t> seconds = {
       0, -1, 86399, -86400, -86401, 253402300799, 253402300800, -62167219200, -62167219201};
   uint64_t state = 12345;
   for (int i = 0; i < 2000; ++i) {
      state = state * 6364136223846793005ULL + 1442695040888963407ULL;
      seconds.push_back(static_cast<int64_t>(state >> 20) % 400000000000LL - 200000000000LL);
   }
   for (int64_t second : seconds) {
      EXPECT_EQ(GmTimeText(second), DateTime(second * 1000000).ToShortString()) << second;
   }
   EXPECT_EQ(GmTimeText(INT64_MAX / 1000000), DateTime(INT64_MAX).ToShortString());
   EXPECT_EQ(GmTimeText(INT64_MIN / 1000000 - 1), DateTime(INT64_MIN).ToShortString());
}

TEST(DateTimeTest, FormattersPrintShortAndFullTexts) {
   DateTime sample(1795424559123456);
   EXPECT_EQ("at 2026-11-23T09:02:39Z / 2026-11-23T09:02:39Z / 2026-11-23T09:02:39.123456Z",
             MessageFormatter::ASPrint("at %1 / %2 / %3", DatePrintFormatter(sample),
                                       DatePrintFormatter(int64_t{1795424559123456}),
                                       DateTimePrintFormatter(sample)));
   std::string text = "t=";
   DatePrintFormatter::FormatDate(sample, text);
   text += " ";
   DateTimePrintFormatter::FormatDateTime(DateTime(-1), text);
   EXPECT_EQ("t=2026-11-23T09:02:39Z 1969-12-31T23:59:59.999999Z", text);

   int64_t before = static_cast<int64_t>(time(nullptr)) * 1000000;
   int64_t now = DateTime::Now().GetMicroseconds();
   EXPECT_GE(now, before);
   EXPECT_LT(now, before + 2000000);
}

}  // namespace
}  // namespace Pelmora
