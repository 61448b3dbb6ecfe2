// Throwable, the system error texts and the exceptions built in code rather than headers.

#include <errno.h>
#include <iconv.h>
#include <langinfo.h>
#include <string.h>

#include <cstdio>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/exception/backtrace.h"
#include "src/internal/report.h"

namespace Pelmora {

Throwable::Throwable(const std::string& message) : _message(message) {
   System::CaptureBacktrace(1, _backtrace);
   // Keeps this frame on the stack (no tail call), so the frames to skip stay right.
   asm volatile("" ::: "memory");
}

Throwable::~Throwable() = default;

std::string Throwable::Where() const { return _backtrace ? _backtrace->GetText() : std::string(); }

void Throwable::Dump() const {
   Internal::ReportSink& sink = Internal::GetReportSink();
   if (sink.IsLevelEnabled(Internal::kReportErrorLevel)) {
      sink.Log(Internal::kReportErrorLevel,
               MessageFormatter::ASPrint("\n\nException: %1\nType: %2\nBacktrace:\n%3", _message,
                                         TypeName(typeid(*this)), Where()));
   }
   sink.LogMemoryBuffer(Internal::kReportErrorLevel, _message, false);
}

SystemErrorCode::SystemErrorCode() : error(errno) {}

SystemException::SystemException(int error)
   : Exception(System::GetErrorMessage(error)), _error(error) {}

SystemException::SystemException(const SystemErrorCode& code) : SystemException(code.error) {}

void ThrowTypeMismatchException(const std::type_info& wanted, const std::type_info& actual) {
   throw TypeMismatchException(TypeName(wanted), TypeName(actual));
}

namespace System {

namespace {

constexpr size_t kMaxErrorText = 2048;

// Converts `text` from the locale's code set to UTF-8; false when it cannot.
bool ToUtf8(const char* text, std::string& out) {
   const char* codeset = nl_langinfo(CODESET);
   if (!codeset || strcmp(codeset, "UTF-8") == 0 || strcmp(codeset, "ANSI_X3.4-1968") == 0) {
      out = text;
      return true;
   }
   iconv_t cd = iconv_open("UTF-8", codeset);
   if (cd == reinterpret_cast<iconv_t>(-1)) return false;
   char buffer[kMaxErrorText * 4];
   char* in = const_cast<char*>(text);
   size_t inLeft = strlen(text);
   char* outPtr = buffer;
   size_t outLeft = sizeof(buffer);
   bool ok = iconv(cd, &in, &inLeft, &outPtr, &outLeft) != static_cast<size_t>(-1) && inLeft == 0;
   iconv_close(cd);
   if (ok) out.assign(buffer, static_cast<size_t>(outPtr - buffer));
   return ok;
}

}  // namespace

std::string GetErrorMessage(int error) {
   char buffer[kMaxErrorText];
   const char* text = strerror_r(error, buffer, sizeof(buffer));
   std::string converted;
   if (text && ToUtf8(text, converted) && converted.size() < kMaxErrorText) return converted;
   char fallback[64];
   snprintf(fallback, sizeof(fallback), "Unknown error %d (0x%x)\n", error,
            static_cast<unsigned>(error));
   return fallback;
}

void ThrowSystemMemoryException() { throw SystemException(ENOMEM); }

}  // namespace System

}  // namespace Pelmora
