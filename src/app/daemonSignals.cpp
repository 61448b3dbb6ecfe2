// Termination and reload signals: the handler writes the signal's number to a pipe; a
// thread of its own reads it and does the work.

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <mutex>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

namespace {

constexpr int kSignals[] = {SIGTERM, SIGINT, SIGHUP};
// Written by the owner of the thread to end it; no signal has number 0.
constexpr unsigned char kStopByte = 0;

std::mutex g_mutex;
std::atomic<int> g_writeFd{-1};
int g_readFd = -1;
std::thread* g_thread = nullptr;
struct sigaction g_previous[3];

void OnSignal(int number) {
   int saved = errno;
   unsigned char byte = static_cast<unsigned char>(number);
   int fd = g_writeFd.load(std::memory_order_relaxed);
   // A full pipe already holds a wake-up; losing a repeat is harmless.
   if (fd >= 0) {
      ssize_t ignored = write(fd, &byte, 1);
      (void)ignored;
   }
   errno = saved;
}

void SignalLoop(int readFd, SignalCallback callback) {
   for (;;) {
      pollfd p{readFd, POLLIN, 0};
      if (poll(&p, 1, -1) < 0) {
         if (errno == EINTR) continue;
         return;
      }
      unsigned char bytes[16];
      ssize_t n = read(readFd, bytes, sizeof(bytes));
      if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
      if (n <= 0) return;
      for (ssize_t i = 0; i < n; ++i) {
         if (bytes[i] == kStopByte) return;
         try {
            callback(bytes[i]);
         } catch (...) {
            // A failed reaction must not end signal handling.
         }
      }
   }
}

}  // namespace

void StartSignalThread(const SignalCallback& onSignal) {
   std::lock_guard<std::mutex> lock(g_mutex);
   if (g_thread) throw AlreadyInitializedException();
   int fds[2];
   if (pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0) throw SystemException(errno);
   g_readFd = fds[0];
   g_writeFd.store(fds[1]);
   g_thread = new std::thread(SignalLoop, fds[0], onSignal);
   struct sigaction action = {};
   action.sa_handler = &OnSignal;
   action.sa_flags = SA_RESTART;
   sigemptyset(&action.sa_mask);
   for (int i = 0; i < 3; ++i) sigaction(kSignals[i], &action, &g_previous[i]);
}

void StopSignalThread() {
   std::lock_guard<std::mutex> lock(g_mutex);
   if (!g_thread) return;
   for (int i = 0; i < 3; ++i) sigaction(kSignals[i], &g_previous[i], nullptr);
   unsigned char stop = kStopByte;
   int fd = g_writeFd.load();
   // The pipe is non-blocking; a full one is drained by the loop, so try until it fits.
   while (write(fd, &stop, 1) < 0 && (errno == EAGAIN || errno == EINTR)) {
      pollfd p{fd, POLLOUT, 0};
      poll(&p, 1, 10);
   }
   g_thread->join();
   delete g_thread;
   g_thread = nullptr;
   g_writeFd.store(-1);
   close(fd);
   close(g_readFd);
   g_readFd = -1;
}

}  // namespace Pelmora::Service
