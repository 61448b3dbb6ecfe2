// Notifications to the service manager: addresses, datagrams and the watchdog period.

#include <sys/socket.h>
#include <sys/un.h>
#include <poll.h>

#include <gtest/gtest.h>

#include <cstring>

#include "pelmora/service/daemon.h"

namespace Pelmora::Service {
namespace {

// An abstract-namespace receiver, so nothing is left on disk.
class AbstractReceiver {
public:
   explicit AbstractReceiver(const std::string& name) {
      _fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
      sockaddr_un address = {};
      address.sun_family = AF_UNIX;
      memcpy(address.sun_path + 1, name.data(), name.size());
      bind(_fd, reinterpret_cast<sockaddr*>(&address),
           static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + name.size()));
   }
   ~AbstractReceiver() { close(_fd); }
   std::string Receive(int limitMs = 2000) {
      pollfd p{_fd, POLLIN, 0};
      if (poll(&p, 1, limitMs) <= 0) return "";
      char buffer[512];
      ssize_t n = recv(_fd, buffer, sizeof(buffer), 0);
      return n > 0 ? std::string(buffer, static_cast<size_t>(n)) : "";
   }

private:
   int _fd;
};

TEST(NotifierTest, SendsDatagramsToAnAbstractSocketAndFeedsTheWatchdog) {
   std::string name = "pelmora-notify-test-" + std::to_string(getpid());
   AbstractReceiver receiver(name);
   Ref<Notifier> notifier;
   CreateNotifier("@" + name, notifier);
   ASSERT_TRUE(notifier->IsEnabled());
   EXPECT_TRUE(notifier->Send("READY=1\nSTATUS=up"));
   EXPECT_EQ(receiver.Receive(), "READY=1\nSTATUS=up");
   notifier->StartWatchdog(2000);
   EXPECT_EQ(receiver.Receive(), "WATCHDOG=1");
   EXPECT_EQ(receiver.Receive(), "WATCHDOG=1");
   notifier->StopWatchdog();
   while (!receiver.Receive(20).empty()) {
   }
   EXPECT_EQ(receiver.Receive(50), "") << "fed after StopWatchdog";
}

TEST(NotifierTest, WithoutAUsableAddressNothingIsSent) {
   Ref<Notifier> notifier;
   for (const char* name : {"relative/path", "/nonexistent/pelmora/notify", ""}) {
      CreateNotifier(name, notifier);
      EXPECT_FALSE(notifier->Send("READY=1")) << name;
   }
   EXPECT_FALSE(notifier->IsEnabled());  // no address at all
   notifier->StartWatchdog(1000);  // nothing to feed: no thread
   notifier->StopWatchdog();
}

TEST(NotifierTest, TheWatchdogPeriodIsHalfTheIntervalGivenToThisProcess) {
   unsetenv("WATCHDOG_PID");
   setenv("WATCHDOG_USEC", "3000000", 1);
   EXPECT_EQ(GetWatchdogPeriodFromEnvironment(), 1500000);
   setenv("WATCHDOG_PID", std::to_string(getpid()).c_str(), 1);
   EXPECT_EQ(GetWatchdogPeriodFromEnvironment(), 1500000);
   setenv("WATCHDOG_PID", std::to_string(getpid() + 1).c_str(), 1);
   EXPECT_EQ(GetWatchdogPeriodFromEnvironment(), 0);
   unsetenv("WATCHDOG_PID");
   setenv("WATCHDOG_USEC", "soon", 1);
   EXPECT_EQ(GetWatchdogPeriodFromEnvironment(), 0);
   unsetenv("WATCHDOG_USEC");
   EXPECT_EQ(GetWatchdogPeriodFromEnvironment(), 0);
}

}  // namespace
}  // namespace Pelmora::Service
