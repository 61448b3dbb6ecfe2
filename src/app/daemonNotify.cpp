// Service-manager notifications over its datagram socket, and the watchdog thread.

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

namespace {

class NotifierImpl : public virtual Notifier, public ObjectImpl {
public:
   explicit NotifierImpl(const std::string& name) {
      if (name.empty() || name.size() >= sizeof(_address.sun_path)) return;
      if (name[0] != '/' && name[0] != '@') return;
      _address.sun_family = AF_UNIX;
      memcpy(_address.sun_path, name.data(), name.size());
      // "@name" is the abstract namespace: a leading NUL, and no terminator counted.
      if (name[0] == '@') _address.sun_path[0] = '\0';
      _length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + name.size() +
                                       (name[0] == '@' ? 0 : 1));
      _fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
   }
   ~NotifierImpl() override {
      StopWatchdog();
      if (_fd >= 0) close(_fd);
   }

   bool IsEnabled() const override { return _fd >= 0; }

   bool Send(const std::string& state) override {
      if (_fd < 0) return false;
      ssize_t n;
      do {
         n = sendto(_fd, state.data(), state.size(), MSG_NOSIGNAL,
                    reinterpret_cast<const sockaddr*>(&_address), _length);
      } while (n < 0 && errno == EINTR);
      return n == static_cast<ssize_t>(state.size());
   }

   void StartWatchdog(long long intervalMicroseconds) override {
      if (intervalMicroseconds <= 0 || _fd < 0) return;
      std::lock_guard<std::mutex> lock(_mutex);
      if (_thread.joinable()) return;
      _stopping = false;
      _thread = std::thread([this, intervalMicroseconds] {
         std::unique_lock<std::mutex> lock(_mutex);
         while (!_stopping) {
            lock.unlock();
            Send("WATCHDOG=1");
            lock.lock();
            _wake.wait_for(lock, std::chrono::microseconds(intervalMicroseconds),
                           [this] { return _stopping; });
         }
      });
   }

   void StopWatchdog() override {
      std::thread thread;
      {
         std::lock_guard<std::mutex> lock(_mutex);
         _stopping = true;
         thread = std::move(_thread);
      }
      _wake.notify_all();
      if (thread.joinable()) thread.join();
   }

private:
   int _fd = -1;
   sockaddr_un _address = {};
   socklen_t _length = 0;
   std::mutex _mutex;
   std::condition_variable _wake;
   bool _stopping = false;
   std::thread _thread;
};

}  // namespace

void CreateNotifier(const std::string& socketName, Ref<Notifier>& out) {
   out = new NotifierImpl(socketName);
}

void CreateNotifier(Ref<Notifier>& out) {
   const char* name = getenv("NOTIFY_SOCKET");
   CreateNotifier(name ? name : "", out);
}

long long GetWatchdogPeriodFromEnvironment() {
   const char* usec = getenv("WATCHDOG_USEC");
   if (!usec || !*usec) return 0;
   const char* pid = getenv("WATCHDOG_PID");
   if (pid && *pid && atoll(pid) != static_cast<long long>(getpid())) return 0;
   char* end = nullptr;
   long long value = strtoll(usec, &end, 10);
   if (*end != '\0' || value <= 0) return 0;
   return value / 2;
}

}  // namespace Pelmora::Service
