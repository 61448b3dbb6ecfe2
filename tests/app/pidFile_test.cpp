// The PID file: whole when written, removed only while it is ours.

#include <unistd.h>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/daemon.h"
#include "tests/support/appProcess.h"

namespace Pelmora::Service {
namespace {

using Testing::ReadText;
using Testing::ScratchDir;
using Testing::WriteText;

TEST(PidFileTest, ReplacesAnOldFileAndRemovesOnlyItsOwn) {
   ScratchDir dir;
   std::string path = dir / "run.pid";
   WriteText(path, "999999999 stale and longer than the new text\n");
   WritePidFile(path);
   EXPECT_EQ(ReadText(path), std::to_string(getpid()) + "\n");
   EXPECT_NE(access((path + ".tmp." + std::to_string(getpid())).c_str(), F_OK), 0);
   EXPECT_TRUE(RemovePidFile(path));
   EXPECT_NE(access(path.c_str(), F_OK), 0);
   EXPECT_FALSE(RemovePidFile(path));
   // Taken over by another instance: left alone.
   WriteText(path, "1\n");
   EXPECT_FALSE(RemovePidFile(path));
   EXPECT_EQ(ReadText(path), "1\n");
   EXPECT_THROW(WritePidFile(dir / "missing/run.pid"), SystemException);
}

}  // namespace
}  // namespace Pelmora::Service
