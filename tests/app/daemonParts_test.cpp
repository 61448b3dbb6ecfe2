// The daemon as operators run it, in a child process: it tells the service manager when
// it is ready, stopping and alive, writes and removes its PID file, stops with its exit
// status on SIGTERM and reopens its log file on SIGHUP.

#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <poll.h>

#include <gtest/gtest.h>

#include <cstring>
#include <vector>

#include "tests/support/appProcess.h"

namespace {

using Pelmora::Testing::Contains;
using Pelmora::Testing::ReadText;
using Pelmora::Testing::ScratchDir;
using Pelmora::Testing::WaitUntil;
using Pelmora::Testing::WriteText;

// The service manager's end: a datagram socket bound in the scratch directory.
class NotifySocket {
public:
   explicit NotifySocket(const std::string& path) : _path(path) {
      _fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
      sockaddr_un address = {};
      address.sun_family = AF_UNIX;
      strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
      unlink(path.c_str());
      bind(_fd, reinterpret_cast<sockaddr*>(&address), sizeof(address));
   }
   ~NotifySocket() { close(_fd); }
   const std::string& Path() const { return _path; }

   // The next datagram, or "" when none comes within `limitMs`.
   std::string Receive(int limitMs = 5000) {
      pollfd p{_fd, POLLIN, 0};
      if (poll(&p, 1, limitMs) <= 0) return "";
      char buffer[4096];
      ssize_t n = recv(_fd, buffer, sizeof(buffer), 0);
      return n > 0 ? std::string(buffer, static_cast<size_t>(n)) : "";
   }
   // Receives until a datagram holds `piece`; every datagram seen is kept in `seen`.
   bool ReceiveUntil(const std::string& piece, std::vector<std::string>& seen) {
      for (;;) {
         std::string datagram = Receive();
         if (datagram.empty()) return false;
         seen.push_back(datagram);
         if (Contains(datagram, piece)) return true;
      }
   }

private:
   std::string _path;
   int _fd;
};

class DaemonTest : public testing::Test {
protected:
   // Starts the test daemon with `pelmora` inside the configuration's <pelmora>.
   pid_t Start(const std::string& pelmora, int exitStatus, const char* mode = "return",
               const char* watchdogUsec = nullptr) {
      std::string config = _dir / "daemon.xml";
      WriteText(config, "<config><log><directory>" + _dir.Path() +
                            "</directory><name>daemon.log</name><level>info</level>"
                            "<flushIntervalMs>1</flushIntervalMs></log><pelmora>" + pelmora +
                            "<threadPool><minThreads>1</minThreads></threadPool></pelmora>"
                            "</config>");
      std::string status = std::to_string(exitStatus);
      // Everything the child needs is made before fork: only exec runs after it.
      std::vector<std::string> environment;
      for (char** entry = environ; *entry; ++entry) {
         std::string text = *entry;
         if (text.rfind("NOTIFY_SOCKET=", 0) != 0 && text.rfind("WATCHDOG_", 0) != 0) {
            environment.push_back(text);
         }
      }
      environment.push_back("NOTIFY_SOCKET=" + _notify.Path());
      if (watchdogUsec) environment.push_back(std::string("WATCHDOG_USEC=") + watchdogUsec);
      std::vector<char*> envp;
      for (std::string& text : environment) envp.push_back(text.data());
      envp.push_back(nullptr);
      const char* argv[] = {PELMORA_TEST_DAEMON, config.c_str(), status.c_str(), mode, nullptr};
      pid_t child = fork();
      if (child == 0) {
         execve(PELMORA_TEST_DAEMON, const_cast<char**>(argv), envp.data());
         _exit(127);
      }
      return child;
   }

   // The child's exit status; -1 when a signal ended it or it did not end within the
   // limit (it is killed).
   int ExitStatus(pid_t child) {
      int status = -1;
      if (!WaitUntil([&] { return waitpid(child, &status, WNOHANG) == child; })) {
         kill(child, SIGKILL);
         waitpid(child, &status, 0);
         return -1;
      }
      return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
   }

   std::string Log() { return ReadText(_dir / "daemon.log"); }

   ScratchDir _dir;
   NotifySocket _notify{_dir / "notify"};
   std::vector<std::string> _seen;
};

TEST_F(DaemonTest, SigtermStopsTheDaemonWithItsExitStatusAndTheManagerIsTold) {
   std::string pidFile = _dir / "daemon.pid";
   pid_t child = Start("<daemon><pidFile>" + pidFile + "</pidFile></daemon>", 5);
   ASSERT_TRUE(_notify.ReceiveUntil("READY=1", _seen));
   EXPECT_TRUE(Contains(_seen.back(), "MAINPID=" + std::to_string(child)));
   EXPECT_EQ(ReadText(pidFile), std::to_string(child) + "\n");
   kill(child, SIGTERM);
   ASSERT_TRUE(_notify.ReceiveUntil("STOPPING=1", _seen));
   EXPECT_EQ(ExitStatus(child), 5);
   EXPECT_NE(access(pidFile.c_str(), F_OK), 0) << "the PID file stays after exit";
   EXPECT_TRUE(Contains(Log(), "Received signal 15, stopping"));
   EXPECT_TRUE(Contains(Log(), "Application exiting with status 5"));
}

TEST_F(DaemonTest, SigintStopsTooAndQuickExitKeepsTheStatus) {
   pid_t child = Start("", 3, "quick");
   ASSERT_TRUE(_notify.ReceiveUntil("READY=1", _seen));
   kill(child, SIGINT);
   EXPECT_EQ(ExitStatus(child), 3);
}

TEST_F(DaemonTest, SighupReopensARenamedLogFile) {
   pid_t child = Start("", 0);
   ASSERT_TRUE(_notify.ReceiveUntil("READY=1", _seen));
   ASSERT_TRUE(WaitUntil([&] { return Contains(Log(), "Logging uses fast path"); }));
   // What an outside log rotation does: rename, then ask for a reopen.
   ASSERT_EQ(rename((_dir / "daemon.log").c_str(), (_dir / "daemon.log.1").c_str()), 0);
   kill(child, SIGHUP);
   EXPECT_TRUE(WaitUntil([&] { return Contains(Log(), "Reopened log files"); }));
   EXPECT_FALSE(Contains(ReadText(_dir / "daemon.log.1"), "Reopened log files"));
   kill(child, SIGTERM);
   EXPECT_EQ(ExitStatus(child), 0);
   EXPECT_TRUE(Contains(Log(), "Received signal 15"));
}

TEST_F(DaemonTest, SighupAppliesTheLevelsOfAChangedConfiguration) {
   pid_t child = Start("", 0);
   ASSERT_TRUE(_notify.ReceiveUntil("READY=1", _seen));
   std::string config = ReadText(_dir / "daemon.xml");
   size_t at = config.find("<level>info</level>");
   ASSERT_NE(at, std::string::npos);
   // The unknown memory level is complained about at warning: a sign the reload happened.
   config.replace(at, strlen("<level>info</level>"),
                  "<level>warning</level><memoryLevel>bogus</memoryLevel>");
   WriteText(_dir / "daemon.xml", config);
   kill(child, SIGHUP);
   ASSERT_TRUE(WaitUntil([&] { return Contains(Log(), "Unrecognized log/memoryLevel 'bogus'"); }));
   kill(child, SIGTERM);
   ASSERT_EQ(ExitStatus(child), 0);
   // Info lines from the reload on are no longer written.
   EXPECT_FALSE(Contains(Log(), "Reopened log files")) << Log();
   EXPECT_FALSE(Contains(Log(), "Received signal 15")) << Log();
}

TEST_F(DaemonTest, TheWatchdogIsFedAtHalfItsInterval) {
   pid_t child = Start("", 0, "return", "40000");  // 40 ms: fed every 20 ms
   ASSERT_TRUE(_notify.ReceiveUntil("READY=1", _seen));
   auto start = std::chrono::steady_clock::now();
   int fed = 0;
   for (int i = 0; i < 50 && fed < 5; ++i) {
      std::string datagram = _notify.Receive(1000);
      if (datagram == "WATCHDOG=1") ++fed;
   }
   auto elapsed = std::chrono::steady_clock::now() - start;
   EXPECT_EQ(fed, 5);
   // Five feeds at 20 ms take about 80-100 ms; a period of the whole interval would take 160.
   EXPECT_LT(elapsed, std::chrono::milliseconds(150));
   kill(child, SIGTERM);
   EXPECT_EQ(ExitStatus(child), 0);
}

}  // namespace
