// Backtraces start at the caller, name exported functions and never name a hidden one
// after its exported neighbour.

#include <algorithm>
#include <string>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "pelmora/exception/backtrace.h"

namespace Pelmora::System {
namespace {

using testing::HasSubstr;
using testing::Not;
using testing::StartsWith;

// Not in the dynamic symbol table: internal linkage.
__attribute__((noinline)) void CaptureFromHidden(int skip, Ref<Backtrace>& out) {
   CaptureBacktrace(skip, out);
   asm volatile("" ::: "memory");
}

}  // namespace

// Exported (the test binary exports its symbols), so its frame can be named.
__attribute__((noinline, visibility("default"))) void BacktraceTestExportedCaller(Ref<Backtrace>& out) {
   CaptureFromHidden(0, out);
   asm volatile("" ::: "memory");
}

namespace {

TEST(BacktraceTest, FramesStartAtTheCallerAndHiddenFunctionsStayUnnamed) {
   Ref<Backtrace> backtrace;
   BacktraceTestExportedCaller(backtrace);
   ASSERT_GE(backtrace->GetFrameCount(), 2);
   // Frame 0 is the hidden function: no symbol spans it, so no name is made up.
   std::string hidden = backtrace->GetText(0, 1);
   EXPECT_THAT(hidden, StartsWith("#0 "));
   EXPECT_THAT(hidden, HasSubstr(" ?? ("));
   EXPECT_THAT(hidden, Not(HasSubstr("BacktraceTestExportedCaller")));
   EXPECT_THAT(backtrace->GetText(1, 1), HasSubstr("BacktraceTestExportedCaller"));

}

TEST(BacktraceTest, TextIsLimitedToTheAskedFrames) {
   Ref<Backtrace> backtrace;
   BacktraceTestExportedCaller(backtrace);
   int count = backtrace->GetFrameCount();
   ASSERT_LE(count, kMaxBacktraceFrames);
   std::string all = backtrace->GetText();
   EXPECT_EQ(count, static_cast<int>(std::count(all.begin(), all.end(), '\n')));
   std::string two = backtrace->GetText(1, 2);
   EXPECT_THAT(two, StartsWith("#0 "));
   EXPECT_EQ(2, static_cast<int>(std::count(two.begin(), two.end(), '\n')));
   EXPECT_EQ(nullptr, backtrace->GetFrame(count));
}

}  // namespace
}  // namespace Pelmora::System
