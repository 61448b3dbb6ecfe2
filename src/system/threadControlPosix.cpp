// Thread control on POSIX: starting threads, naming them, and the pipe pairs and poll
// loop that wake the pools' I/O threads.

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "src/internal/report.h"
#include "src/system/systemImpl.h"
#include "src/system/threadPosix.h"

namespace Pelmora::System {

namespace {

constexpr int kMaxPollables = 8192;
constexpr int kReportWarningLevel = 8;

// Open descriptors of this process, counted in /proc; -1 when it cannot be read.
int CountOpenDescriptors() {
   DIR* dir = opendir("/proc/self/fd");
   if (!dir) return -1;
   int count = 0;
   while (dirent* entry = readdir(dir)) {
      if (entry->d_name[0] != '.') ++count;
   }
   closedir(dir);
   return count - 1;  // the directory's own descriptor
}

class ThreadControlPosix : public virtual ThreadControl, public ObjectImpl {
public:
   bool HasIoThreadAffinity() override { return false; }

   void StartThread(const ThreadFunction& function, long long stackSizeKb,
                    Ref<Thread>& out) override {
      ThreadPosix::CreateThread(function, stackSizeKb, out);
   }

   void InitializeThisThread() override {}
   void UninitializeThisThread() override {}

   void SetThreadName(const std::string& name) override {
      if (prctl(PR_SET_NAME, name.c_str(), 0, 0, 0) == 0) return;
      int error = errno;
      Internal::GetReportSink().Log(
          Internal::kReportErrorLevel,
          MessageFormatter::ASPrint("prctl(PR_SET_NAME, '%1') failed; errno: %2(%3)", name, error,
                                    GetErrorMessage(error)));
   }

   int GetMaxPollables() override { return kMaxPollables; }

   void CreatePollableSignalPair(int& readFd, int& writeFd) override {
      int fds[2];
      // Close-on-exec too: child processes must not hold a pool's wake-up pipe.
      if (pipe2(fds, O_NONBLOCK | O_CLOEXEC) != 0) throw SystemException(errno);
      readFd = fds[0];
      writeFd = fds[1];
   }

   void SetPollableSignal(int writeFd) override {
      for (;;) {
         if (write(writeFd, "a", 1) == 1) return;
         // A full pipe already holds a pending wake-up.
         if (errno == EAGAIN) return;
         if (errno != EINTR) throw SystemException(errno);
      }
   }

   void ResetPollableSignal(int readFd) override {
      char byte;
      for (;;) {
         ssize_t n = read(readFd, &byte, 1);
         if (n == 1) continue;
         if (n == 0 || errno == EAGAIN) return;
         if (errno != EINTR) throw SystemException(errno);
      }
   }

   void DoPoll(const std::vector<std::pair<int, POLL_EVENT>>& pollables,
               std::vector<int>& readyIndices) override {
      std::vector<pollfd> entries(pollables.size());
      for (size_t i = 0; i < pollables.size(); ++i) {
         entries[i].fd = pollables[i].first;
         entries[i].events = pollables[i].second == POLL_EVENT_WRITE ? POLLOUT : POLLIN;
      }
      while (poll(entries.data(), entries.size(), -1) < 0) {
         if (errno != EINTR) throw SystemException(errno);
      }
      readyIndices.clear();
      for (size_t i = 0; i < entries.size(); ++i) {
         if (entries[i].revents != 0) readyIndices.push_back(static_cast<int>(i));
      }
   }

   void OnThreadPoolStartup(int maxFdsPerThread) override {
      _maxFdsPerThread.store(maxFdsPerThread > 0 ? maxFdsPerThread : 0);
   }

   void OnThreadPoolShutdown() override { _maxFdsPerThread.store(0); }

   int CheckDescriptors(int threadCount) override {
      int count = CountOpenDescriptors();
      long long limit = static_cast<long long>(_maxFdsPerThread.load()) * std::max(threadCount, 1);
      if (limit > 0 && count > limit) {
         Internal::GetReportSink().Log(
             kReportWarningLevel,
             MessageFormatter::ASPrint("Open descriptors %1 exceed MaxFdsPerThread %2 for %3 threads",
                                       count, _maxFdsPerThread.load(), threadCount));
      }
      return count;
   }

private:
   std::atomic<int> _maxFdsPerThread{0};
};

}  // namespace

void CreateThreadControlPosix(Ref<ThreadControl>& out) {
   out = new ThreadControlPosix();
}

}  // namespace Pelmora::System
