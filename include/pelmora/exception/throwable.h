#pragma once
// Throwable is the root of every exception of the library: a message and the backtrace
// of the place where the exception was constructed (captured raw, resolved on demand).
// Exception adds Clone and Throw, overridden in every class, so that a handler can keep
// an exception and rethrow it later, on any thread, with its dynamic type.
// Exceptions are plain values; copies share the backtrace.

#include <exception>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/exception/backtrace.h"

namespace Pelmora {

class PELMORA_EXPORT Throwable : public std::exception {
public:
   explicit Throwable(const std::string& message);
   ~Throwable() override;

   const char* what() const noexcept override { return _message.c_str(); }
   const Ref<System::Backtrace>& GetBacktrace() const { return _backtrace; }
   // Logs the message, type and backtrace at error level and writes out the in-memory log.
   virtual void Dump() const;
   // The backtrace as text, symbols resolved, all frames.
   virtual std::string Where() const;

   const std::string& GetMessage() const { return _message; }

private:
   std::string _message;
   Ref<System::Backtrace> _backtrace;
};

class PELMORA_EXPORT Exception : public Throwable {
public:
   using Throwable::Throwable;
   virtual Exception* Clone() const { return new Exception(*this); }
   [[noreturn]] virtual void Throw() { throw Exception(*this); }
};

// Declares the Clone and Throw overrides of an exception class.
#define PELMORA_EXCEPTION_CLONE(Class)                                      \
   Class* Clone() const override { return new Class(*this); }               \
   [[noreturn]] void Throw() override { throw Class(*this); }

}  // namespace Pelmora
