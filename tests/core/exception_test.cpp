#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <thread>
#include <typeinfo>

#include "pelmora/exception.h"

namespace Pelmora {

// Outside the anonymous namespace: backtraces resolve exported symbols only.
[[gnu::noinline]] void ThrowFromHere() { throw InvalidStateException(); }

namespace {

TEST(ExceptionTest, ConstructorsBuildTheirMessages) {
   EXPECT_STREQ("Already Exists", AlreadyExistsException().what());
   EXPECT_STREQ("Already exists: x", AlreadyExistsException("x").what());
   EXPECT_STREQ("Invalid argument", InvalidArgumentException().what());
   EXPECT_STREQ("Invalid argument : x", InvalidArgumentException("x").what());
   EXPECT_STREQ("IO error: x", IOException("x").what());
   EXPECT_STREQ("Not initialized: a b", NotInitializedException("a", "b").what());
   EXPECT_STREQ("Number range exception", NumberRangeException().what());
   EXPECT_STREQ("Resource is already in use: x", ResourceInUseException("x").what());
   EXPECT_STREQ("File Format Exception: x", FileFormatException("x").what());
   EXPECT_STREQ("Write failed : /var/log/a",
                FileIONoSpaceException("Write failed", "/var/log/a", "second").what());
}

// `catch (const Exception&)` is the documented way to catch whatever the library throws;
// Throw must also keep the dynamic type.
TEST(ExceptionTest, EveryClassIsCaughtAsException) {
   const std::string s = "x";
   const std::unique_ptr<Exception> all[] = {
       std::make_unique<AlreadyExistsException>(), std::make_unique<AlreadyInitializedException>(),
       std::make_unique<AuthdException>(s), std::make_unique<Base64FormatException>(),
       std::make_unique<CanceledException>(), std::make_unique<DateTimeFormatException>(),
       std::make_unique<FileFormatException>(s), std::make_unique<FileIOException>(s, s),
       std::make_unique<FileIOAlreadyExistsException>(s, s),
       std::make_unique<FileIOLockFailedException>(s, s),
       std::make_unique<FileIONoSpaceException>(s, s),
       std::make_unique<FileIONotFoundException>(s, s),
       std::make_unique<FileIOPermissionDeniedException>(s, s),
       std::make_unique<FullException>(s), std::make_unique<InternalErrorException>(s),
       std::make_unique<InvalidFormatStringException>(s), std::make_unique<NotFoundException>(s),
       std::make_unique<NotInProgressException>(s), std::make_unique<TicketExpiredException>(s),
       std::make_unique<TimeoutException>(s), std::make_unique<IOException>(s),
       std::make_unique<InProgressException>(), std::make_unique<InvalidArgumentException>(),
       std::make_unique<InvalidStateException>(), std::make_unique<NotInitializedException>(s),
       std::make_unique<NotSupportedException>(), std::make_unique<NumberFormatException>(),
       std::make_unique<NumberRangeException>(), std::make_unique<ResourceInUseException>(s),
       std::make_unique<SystemException>(EIO), std::make_unique<TypeMismatchException>(s, s),
       std::make_unique<WrongThreadException>()};
   for (const auto& exception : all) {
      bool caught = false;
      try {
         exception->Throw();
      } catch (const Exception& e) {
         caught = typeid(e) == typeid(*exception);
      }
      EXPECT_TRUE(caught) << typeid(*exception).name();
   }
}

// An exception class of the application's own, with Throw in its documented form.
class ApplicationException : public Exception {
public:
   ApplicationException() : Exception("application") {}
   ApplicationException* Clone() const override { return new ApplicationException(*this); }
   [[noreturn]] void Throw() override { throw ApplicationException(*this); }
};

TEST(ExceptionTest, AnApplicationExceptionRethrowsAsItself) {
   std::unique_ptr<Exception> kept(ApplicationException().Clone());
   EXPECT_THROW(kept->Throw(), ApplicationException);
}

TEST(ExceptionTest, CloneAndThrowKeepTheDynamicTypeAcrossThreads) {
   std::unique_ptr<Exception> kept;
   try {
      throw FileIONotFoundException("Failed to open read file", "/etc/x");
   } catch (const Exception& e) {
      kept.reset(e.Clone());
   }
   const System::Backtrace* site = kept->GetBacktrace().Get();
   bool caught = false;
   std::thread([&] {
      try {
         kept->Throw();
      } catch (const FileIONotFoundException& e) {
         caught = true;
         EXPECT_EQ("/etc/x", e.GetPath());
         EXPECT_EQ(site, e.GetBacktrace().Get());  // copies share the first backtrace
      }
   }).join();
   EXPECT_TRUE(caught);
   EXPECT_THROW(std::unique_ptr<Exception>(NumberRangeException().Clone())->Throw(),
                NumberFormatException);
}

TEST(ExceptionTest, SystemExceptionCarriesTheErrorAndItsText) {
   SystemException noEntry(ENOENT);
   EXPECT_EQ(ENOENT, noEntry.GetError());
   EXPECT_STREQ(strerror(ENOENT), noEntry.what());
   errno = EACCES;
   SystemErrorCode code;
   EXPECT_EQ(EACCES, SystemException(code).GetError());
   EXPECT_STREQ("mine", SystemException(EIO, "mine").what());
   try {
      System::ThrowSystemMemoryException();
   } catch (const SystemException& e) {
      EXPECT_EQ(12, e.GetError());
   }
   // Numbers the system does not know still give a text.
   EXPECT_FALSE(System::GetErrorMessage(987654).empty());
   EXPECT_FALSE(System::GetErrorMessage(-3).empty());
}

TEST(ExceptionTest, WhereResolvesTheConstructionSite) {
   try {
      ThrowFromHere();
   } catch (const Throwable& e) {
      std::string where = e.Where();
      EXPECT_NE(std::string::npos, where.find("ThrowFromHere")) << where;
      EXPECT_EQ(0u, where.find("#0 0x")) << where;
      EXPECT_EQ(where, e.GetBacktrace()->GetText());
   }
}

TEST(ExceptionTest, DumpWritesMessageTypeAndBacktrace) {
   testing::internal::CaptureStderr();
   InvalidArgumentException("bad key").Dump();
   std::string text = testing::internal::GetCapturedStderr();
   EXPECT_EQ(0u, text.find("\n\nException: Invalid argument : bad key\n"
                           "Type: N7Pelmora24InvalidArgumentExceptionE\nBacktrace:\n#0 "))
      << text;
}

}  // namespace
}  // namespace Pelmora
