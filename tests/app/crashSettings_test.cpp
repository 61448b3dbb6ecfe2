// Dying badly: panic reports in the panic file, backtraces of fatal signals, and the
// allocation-failure handler.

#include <csignal>
#include <cstdint>
#include <new>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/service.h"
#include "tests/support/appProcess.h"

namespace Pelmora::Service {
namespace {

using Testing::Contains;
using Testing::ReadText;
using Testing::ScratchDir;

TEST(CrashSettingsDeathTest, PanicReportsGoToThePanicFile) {
   ScratchDir dir;
   std::string panicDir = dir / "panics/deeper";
   EXPECT_DEATH(([&] {
                   SetPanicLocation(panicDir, "svc.panic");
                   PELMORA_LOG_INFO(GetDefaultLogger(), "a line before the panic");
                   PELMORA_VERIFY(1 + 1 == 3);
                })(),
                "");
   std::string report = ReadText(panicDir + "/svc.panic");
   EXPECT_TRUE(Contains(report, "Assert Failed:")) << report;
   EXPECT_TRUE(Contains(report, "1 + 1 == 3")) << report;
   // The recent lines come with the report; ordinary lines do not go to the file alone.
   EXPECT_TRUE(Contains(report, "a line before the panic")) << report;
   EXPECT_TRUE(Contains(report, "Recent log lines")) << report;
}

TEST(CrashSettingsTest, ThePanicLocationIsKept) {
   ScratchDir dir;
   SetPanicLocation(dir.Path(), "kept.panic");
   EXPECT_EQ(GetPanicLocation(), dir / "kept.panic");
   EXPECT_THROW(SetPanicLocation("", "x"), InvalidArgumentException);
   Ref<LogOutput> output;
   GetDefaultLogManager()->FindLogOutput(LogManager::kDefaultOutput, output);
   Ref<LogWriter> writer;
   output->RemoveWriter("panic", writer);  // other tests of this binary log on
   ASSERT_TRUE(writer);
   writer->Close();
}

TEST(CrashSettingsDeathTest, AFatalSignalWritesABacktraceAndStillKills) {
   EXPECT_EXIT(([] {
                  EnableStackTracer();
                  raise(SIGSEGV);
               })(),
               testing::KilledBySignal(SIGSEGV), "Fatal signal 11\n.*");
}

TEST(CrashSettingsDeathTest, AFailedAllocationPanicsWithTheOutOfMemoryMessage) {
   // Sanitizer allocators refuse such a size themselves before the handler is asked.
   EXPECT_DEATH(([] {
                   InstallNewHandler();
                   void* volatile block = ::operator new(SIZE_MAX / 4);
                   (void)block;
                })(),
                "Out of memory: an allocation failed|allocation-size-too-big|"
                "requested allocation size");
}

}  // namespace
}  // namespace Pelmora::Service
