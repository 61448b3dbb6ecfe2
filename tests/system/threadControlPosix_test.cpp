#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <thread>

#include "pelmora/exception.h"
#include "pelmora/system.h"
#include "tests/support/watchdog.h"

namespace Pelmora::System {
namespace {

class ThreadControlTest : public testing::Test {
protected:
   ThreadControlTest() {
      GetSystemFactory()->CreateThreadControl(control);
      control->CreatePollableSignalPair(readFd, writeFd);
   }
   ~ThreadControlTest() override {
      close(readFd);
      close(writeFd);
   }

   Ref<ThreadControl> control;
   int readFd = -1;
   int writeFd = -1;
};

TEST_F(ThreadControlTest, SetThreadNameKeepsFifteenCharacters) {
   char name[17] = {};
   std::thread([&] {
      control->SetThreadName("pelmora-worker-number-7");
      prctl(PR_GET_NAME, name, 0, 0, 0);
   }).join();
   EXPECT_STREQ("pelmora-worker-", name);
}

TEST_F(ThreadControlTest, ASignalPairIsNonBlockingAndStaysSetUntilReset) {
   EXPECT_TRUE(fcntl(readFd, F_GETFL) & O_NONBLOCK);
   EXPECT_TRUE(fcntl(writeFd, F_GETFL) & O_NONBLOCK);
   Thread* thread = GetThisThread();
   control->ResetPollableSignal(readFd);  // nothing to drain
   EXPECT_FALSE(thread->Wait(readFd));
   control->SetPollableSignal(writeFd);
   control->SetPollableSignal(writeFd);
   EXPECT_TRUE(thread->Wait(readFd));
   EXPECT_TRUE(thread->Wait(readFd));
   control->ResetPollableSignal(readFd);
   EXPECT_FALSE(thread->Wait(readFd));
}

// A full pipe is already set and a closed writer ends the draining; other failures throw.
TEST_F(ThreadControlTest, OnlyRealFailuresThrowTheSystemError) {
   int size = fcntl(writeFd, F_SETPIPE_SZ, 4096);
   ASSERT_GT(size, 0);
   for (int i = 0; i <= size; ++i) control->SetPollableSignal(writeFd);
   control->ResetPollableSignal(readFd);
   EXPECT_FALSE(GetThisThread()->Wait(readFd));
   try {
      control->SetPollableSignal(readFd);  // the wrong end
      FAIL();
   } catch (const SystemException& e) {
      EXPECT_EQ(EBADF, e.GetError());
   }
   EXPECT_THROW(control->ResetPollableSignal(-1), SystemException);
   control->SetPollableSignal(writeFd);
   close(writeFd);
   writeFd = -1;
   control->ResetPollableSignal(readFd);
}

TEST_F(ThreadControlTest, DoPollReturnsTheReadyPositionsInOrder) {
   int otherRead, otherWrite;
   control->CreatePollableSignalPair(otherRead, otherWrite);
   using Entry = std::pair<int, ThreadControl::POLL_EVENT>;
   std::vector<Entry> pollables = {{readFd, ThreadControl::POLL_EVENT_READ},
                                   {otherWrite, ThreadControl::POLL_EVENT_WRITE},
                                   {otherRead, ThreadControl::POLL_EVENT_READ},
                                   {writeFd, ThreadControl::POLL_EVENT_WRITE}};
   std::vector<int> ready = {99};
   control->SetPollableSignal(otherWrite);
   control->DoPoll(pollables, ready);
   EXPECT_EQ((std::vector<int>{1, 2, 3}), ready);

   // Waits without limit until something is ready.
   pollables = {{readFd, ThreadControl::POLL_EVENT_READ}};
   std::thread waker([&] {
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
      control->SetPollableSignal(writeFd);
   });
   control->DoPoll(pollables, ready);
   Pelmora::Testing::Join(waker, "waker to finish");
   EXPECT_EQ((std::vector<int>{0}), ready);
   close(otherRead);
   close(otherWrite);
}

}  // namespace
}  // namespace Pelmora::System
