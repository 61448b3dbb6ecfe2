#pragma once
// The exception classes of the root namespace. Each builds its message in its
// constructor; each overrides Clone and Throw.

#include <string>
#include <typeinfo>

#include "pelmora/object/export.h"
#include "pelmora/exception/throwable.h"

namespace Pelmora {

class PELMORA_EXPORT AlreadyExistsException : public Exception {
public:
   AlreadyExistsException() : Exception("Already Exists") {}
   explicit AlreadyExistsException(const std::string& name) : Exception("Already exists: " + name) {}
   PELMORA_EXCEPTION_CLONE(AlreadyExistsException)
};

class PELMORA_EXPORT AlreadyInitializedException : public Exception {
public:
   AlreadyInitializedException() : Exception("Already initialized") {}
   PELMORA_EXCEPTION_CLONE(AlreadyInitializedException)
};

class PELMORA_EXPORT AuthdException : public Exception {
public:
   explicit AuthdException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(AuthdException)
};

class PELMORA_EXPORT Base64FormatException : public Exception {
public:
   Base64FormatException() : Exception("Invalid base64-encoded string") {}
   PELMORA_EXCEPTION_CLONE(Base64FormatException)
};

class PELMORA_EXPORT CanceledException : public Exception {
public:
   CanceledException() : Exception("Operation was canceled") {}
   PELMORA_EXCEPTION_CLONE(CanceledException)
};

class PELMORA_EXPORT DateTimeFormatException : public Exception {
public:
   DateTimeFormatException() : Exception("Error formatting DateTime") {}
   PELMORA_EXCEPTION_CLONE(DateTimeFormatException)
};

class PELMORA_EXPORT FileFormatException : public Exception {
public:
   explicit FileFormatException(const std::string& text) : Exception("File Format Exception: " + text) {}
   PELMORA_EXCEPTION_CLONE(FileFormatException)
};

// A failed file operation: the message names the operation, the path the file.
class PELMORA_EXPORT FileIOException : public Exception {
public:
   FileIOException(const std::string& message, const std::string& path,
                   const std::string& secondText = std::string())
      : Exception(message + " : " + path), _path(path), _secondText(secondText) {}
   const std::string& GetPath() const { return _path; }
   const std::string& GetSecondText() const { return _secondText; }
   void SetSecondText(const std::string& text) { _secondText = text; }
   PELMORA_EXCEPTION_CLONE(FileIOException)

private:
   std::string _path;
   std::string _secondText;
};

#define PELMORA_FILEIO_EXCEPTION(Class)                          \
   class Class : public FileIOException {                        \
   public:                                                       \
      using FileIOException::FileIOException;                    \
      PELMORA_EXCEPTION_CLONE(Class)                             \
   };
PELMORA_FILEIO_EXCEPTION(FileIOAlreadyExistsException)
PELMORA_FILEIO_EXCEPTION(FileIOLockFailedException)
PELMORA_FILEIO_EXCEPTION(FileIONoSpaceException)
PELMORA_FILEIO_EXCEPTION(FileIONotFoundException)
PELMORA_FILEIO_EXCEPTION(FileIOPermissionDeniedException)
#undef PELMORA_FILEIO_EXCEPTION

// The exceptions whose message is the text given.
#define PELMORA_GIVEN_EXCEPTION(Class)                                        \
   class Class : public Exception {                                           \
   public:                                                                    \
      explicit Class(const std::string& message) : Exception(message) {}      \
      PELMORA_EXCEPTION_CLONE(Class)                                          \
   };
PELMORA_GIVEN_EXCEPTION(FullException)
PELMORA_GIVEN_EXCEPTION(InternalErrorException)
PELMORA_GIVEN_EXCEPTION(InvalidFormatStringException)
PELMORA_GIVEN_EXCEPTION(NotFoundException)
PELMORA_GIVEN_EXCEPTION(NotInProgressException)
PELMORA_GIVEN_EXCEPTION(TicketExpiredException)
PELMORA_GIVEN_EXCEPTION(TimeoutException)
#undef PELMORA_GIVEN_EXCEPTION

class PELMORA_EXPORT IOException : public Exception {
public:
   explicit IOException(const std::string& text) : Exception("IO error: " + text) {}
   PELMORA_EXCEPTION_CLONE(IOException)
};

class PELMORA_EXPORT InProgressException : public Exception {
public:
   InProgressException() : Exception("Operation is already in progress") {}
   PELMORA_EXCEPTION_CLONE(InProgressException)
};

class PELMORA_EXPORT InvalidArgumentException : public Exception {
public:
   InvalidArgumentException() : Exception("Invalid argument") {}
   explicit InvalidArgumentException(const std::string& text) : Exception("Invalid argument : " + text) {}
   PELMORA_EXCEPTION_CLONE(InvalidArgumentException)
};

class PELMORA_EXPORT InvalidStateException : public Exception {
public:
   InvalidStateException() : Exception("Invalid state") {}
   explicit InvalidStateException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(InvalidStateException)
};

class PELMORA_EXPORT NotInitializedException : public Exception {
public:
   explicit NotInitializedException(const std::string& message) : Exception(message) {}
   NotInitializedException(const std::string& first, const std::string& second)
      : Exception("Not initialized: " + first + " " + second) {}
   PELMORA_EXCEPTION_CLONE(NotInitializedException)
};

class PELMORA_EXPORT NotSupportedException : public Exception {
public:
   NotSupportedException() : Exception("Not Supported") {}
   PELMORA_EXCEPTION_CLONE(NotSupportedException)
};

class PELMORA_EXPORT NumberFormatException : public Exception {
public:
   NumberFormatException() : Exception("Error formatting number") {}
   explicit NumberFormatException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(NumberFormatException)
};

class PELMORA_EXPORT NumberRangeException : public NumberFormatException {
public:
   NumberRangeException() : NumberFormatException("Number range exception") {}
   PELMORA_EXCEPTION_CLONE(NumberRangeException)
};

class PELMORA_EXPORT ResourceInUseException : public Exception {
public:
   explicit ResourceInUseException(const std::string& name)
      : Exception("Resource is already in use: " + name) {}
   PELMORA_EXCEPTION_CLONE(ResourceInUseException)
};

// Holds errno as read at construction.
struct PELMORA_EXPORT SystemErrorCode {
   SystemErrorCode();
   int error;
};

class PELMORA_EXPORT SystemException : public Exception {
public:
   // The message is the system's text for the error number.
   explicit SystemException(int error);
   explicit SystemException(const SystemErrorCode& code);
   SystemException(int error, const std::string& message) : Exception(message), _error(error) {}
   int GetError() const { return _error; }
   PELMORA_EXCEPTION_CLONE(SystemException)

private:
   int _error;
};

class PELMORA_EXPORT TypeMismatchException : public Exception {
public:
   TypeMismatchException(const std::string& wanted, const std::string& actual)
      : Exception("Type Mismatch: expected: " + wanted + ", found: " + actual) {}
   PELMORA_EXCEPTION_CLONE(TypeMismatchException)
};

class PELMORA_EXPORT WrongThreadException : public Exception {
public:
   WrongThreadException() : Exception("Wrong Thread") {}
   PELMORA_EXCEPTION_CLONE(WrongThreadException)
};

namespace System {

// The system's text for an error number in UTF-8, or "Unknown error N (0xN)\n".
PELMORA_EXPORT std::string GetErrorMessage(int error);
// Throws SystemException with ENOMEM: the reaction to an exhausted allocation.
[[noreturn]] PELMORA_EXPORT void ThrowSystemMemoryException();

}  // namespace System

}  // namespace Pelmora
