// The date-time's clock and ISO-8601 texts, and the formatters that print them.

#include <time.h>

#include "pelmora/formatter/dateTime.h"
#include "pelmora/formatter/printFormatter.h"

namespace Pelmora {
namespace {

constexpr int64_t kMicrosPerSecond = 1000000;
constexpr int64_t kSecondsPerDay = 86400;
// "-290308-12-21T19:59:05.224192Z" is the longest text an int64 of microseconds gives.
constexpr int kTextCapacity = 40;

// Division rounding towards negative infinity, so instants before 1970 fall into the
// right second and day.
int64_t FloorDivide(int64_t value, int64_t divisor, int64_t& remainder) {
   int64_t quotient = value / divisor;
   remainder = value % divisor;
   if (remainder < 0) {
      --quotient;
      remainder += divisor;
   }
   return quotient;
}

// Proleptic Gregorian year, month and day of a count of days since 1970-01-01.
void CivilFromDays(int64_t days, int64_t& year, int& month, int& day) {
   days += 719468;  // days from 0000-03-01 to 1970-01-01
   int64_t remainder;
   int64_t era = FloorDivide(days, 146097, remainder);
   int64_t dayOfEra = remainder;
   int64_t yearOfEra = (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
   int64_t dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
   int64_t shiftedMonth = (5 * dayOfYear + 2) / 153;  // March is 0
   day = static_cast<int>(dayOfYear - (153 * shiftedMonth + 2) / 5 + 1);
   month = static_cast<int>(shiftedMonth < 10 ? shiftedMonth + 3 : shiftedMonth - 9);
   year = yearOfEra + era * 400 + (month <= 2 ? 1 : 0);
}

char* PutDigits(char* out, int64_t value, int width) {
   for (int i = width - 1; i >= 0; --i) {
      out[i] = static_cast<char>('0' + value % 10);
      value /= 10;
   }
   return out + width;
}

// Years outside 0000..9999 take ISO-8601's expanded form: a sign and more digits.
char* PutYear(char* out, int64_t year) {
   if (year < 0) {
      *out++ = '-';
      year = -year;
   } else if (year > 9999) {
      *out++ = '+';
   }
   int width = 4;
   for (int64_t limit = 10000; year >= limit; limit *= 10) ++width;
   return PutDigits(out, year, width);
}

// Writes the text into `out` (kTextCapacity bytes) and returns its length.
int FormatText(int64_t micros, bool withMicros, char* out) {
   int64_t fraction;
   int64_t seconds = FloorDivide(micros, kMicrosPerSecond, fraction);
   int64_t secondOfDay;
   int64_t days = FloorDivide(seconds, kSecondsPerDay, secondOfDay);
   int64_t year;
   int month;
   int day;
   CivilFromDays(days, year, month, day);

   char* cursor = PutYear(out, year);
   *cursor++ = '-';
   cursor = PutDigits(cursor, month, 2);
   *cursor++ = '-';
   cursor = PutDigits(cursor, day, 2);
   *cursor++ = 'T';
   cursor = PutDigits(cursor, secondOfDay / 3600, 2);
   *cursor++ = ':';
   cursor = PutDigits(cursor, secondOfDay / 60 % 60, 2);
   *cursor++ = ':';
   cursor = PutDigits(cursor, secondOfDay % 60, 2);
   if (withMicros) {
      *cursor++ = '.';
      cursor = PutDigits(cursor, fraction, 6);
   }
   *cursor++ = 'Z';
   return static_cast<int>(cursor - out);
}

void WriteText(Writer* writer, int64_t micros, bool withMicros) {
   char text[kTextCapacity];
   writer->Write(text, FormatText(micros, withMicros, text));
}

void AppendText(std::string& out, int64_t micros, bool withMicros) {
   char text[kTextCapacity];
   out.append(text, FormatText(micros, withMicros, text));
}

}  // namespace

DateTime DateTime::Now() {
   struct timespec now;
   clock_gettime(CLOCK_REALTIME, &now);
   return DateTime(static_cast<int64_t>(now.tv_sec) * kMicrosPerSecond + now.tv_nsec / 1000);
}

std::string DateTime::ToShortString() const {
   std::string text;
   AppendText(text, _micros, false);
   return text;
}

std::string DateTime::ToFullString() const {
   std::string text;
   AppendText(text, _micros, true);
   return text;
}

DatePrintFormatter::DatePrintFormatter(const DateTime& value, const char* option)
    : PrintFormatter(FormatValue{.dateTime = &value}, option, FormatDate) {}

DatePrintFormatter::DatePrintFormatter(int64_t microsecondsSinceEpoch, const char* option)
    : PrintFormatter(FormatValue{.int64 = microsecondsSinceEpoch}, option, FormatLongDate) {}

void DatePrintFormatter::FormatDate(Writer* writer, const FormatValue& value, const char*) {
   WriteText(writer, value.dateTime->GetMicroseconds(), false);
}

void DatePrintFormatter::FormatLongDate(Writer* writer, const FormatValue& value, const char*) {
   WriteText(writer, value.int64, false);
}

void DatePrintFormatter::FormatDate(const DateTime& value, std::string& out) {
   AppendText(out, value.GetMicroseconds(), false);
}

DateTimePrintFormatter::DateTimePrintFormatter(const DateTime& value, const char* option)
    : PrintFormatter(FormatValue{.dateTime = &value}, option, FormatDateTime) {}

void DateTimePrintFormatter::FormatDateTime(Writer* writer, const FormatValue& value, const char*) {
   WriteText(writer, value.dateTime->GetMicroseconds(), true);
}

void DateTimePrintFormatter::FormatDateTime(const DateTime& value, std::string& out) {
   AppendText(out, value.GetMicroseconds(), true);
}

}  // namespace Pelmora
