// Test main: no core files from death tests, and death tests that re-execute the binary
// so that they are safe next to the library's threads. Panic reports are written by the
// dying process itself, so a death test reads all of it; the forked report has a test of
// its own.
#include <sys/resource.h>

#include <gtest/gtest.h>

#include "pelmora/exception/panic.h"

int main(int argc, char** argv) {
   struct rlimit noCore = {0, 0};
   setrlimit(RLIMIT_CORE, &noCore);
   Pelmora::SetPanicMayFork(false);
   GTEST_FLAG_SET(death_test_style, "threadsafe");
   testing::InitGoogleTest(&argc, argv);
   return RUN_ALL_TESTS();
}
