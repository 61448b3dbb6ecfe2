// The default logger as the process report sink: panics and exception dumps.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/writers.h"
#include "pelmora/object/ref.h"
#include "pelmora/service.h"
#include "tests/support/watchdog.h"
#include "tests/support/logLines.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;

TEST(LogMemoryDeathTest, PanicAndExceptionDumpReportTheRecentLines) {
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "recent line %1", 42);
          PELMORA_VERIFY(1 + 1 == 3);
       },
       "Panic: Assert Failed: \"1 \\+ 1 == 3\".*Recent log lines.*recent line 42");
   EXPECT_DEATH(
       {
          PELMORA_LOG_VERBOSE(GetDefaultLogger(), "before the dump");
          InvalidStateException().Dump();
          abort();
       },
       "error 'default'\\] \n\nException: Invalid state\nType: .*Recent log lines.*before the dump");
}
