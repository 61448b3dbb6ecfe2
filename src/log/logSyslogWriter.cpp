// The syslog writer: one datagram per line in the local syslog format over a local
// datagram socket that may come and go, waiting a bounded time when it is full.

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <optional>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logWriters.h"
#include "src/log/logImpl.h"

extern char* program_invocation_short_name;

namespace Pelmora::Service {

namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                   "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};

// The highest level bit of the output half decides.
Logger::LogLevel HighestLevel(Logger::CombinedLevel level) {
   Logger::CombinedLevel low = level & 0xFFFF;
   if (low == 0) low = level >> Logger::kMemoryShift;
   if (low == 0) return Logger::LOG_NONE;
   return static_cast<Logger::LogLevel>(1u << (31 - __builtin_clz(low)));
}

bool IsContinuationByte(char c) { return (static_cast<unsigned char>(c) & 0xC0) == 0x80; }

class SyslogLogWriterImpl : public LogWriterImpl, public virtual SyslogLogWriter {
public:
   SyslogLogWriterImpl(const LogSyslogOptions& options, Logger::CombinedLevel mask)
      : LogWriterImpl(nullptr, mask, false), _options(options) {
      if (_options.ident.empty()) _options.ident = program_invocation_short_name;
      if (_options.maxMessageSize < 64) _options.maxMessageSize = 64;
      if (_options.sendTimeoutMs < 0) _options.sendTimeoutMs = 0;
      if (_options.sendWaitBudgetMs < 0) _options.sendWaitBudgetMs = 0;
      Connect();
   }

   ~SyslogLogWriterImpl() override {
      if (_fd >= 0) close(_fd);
   }

   uint64_t GetLostCount() const override { return _lost.load(std::memory_order_relaxed); }
   uint64_t GetTruncatedCount() const override {
      return _truncated.load(std::memory_order_relaxed);
   }

   void Reopen() override {
      std::lock_guard<LogWriterMutex> lock(_mutex);
      Disconnect();
      Connect();
   }

protected:
   void WriteLocked(Logger::CombinedLevel level, const char* data, int length) override {
      if (!_inLine) BeginMessage(level);
      bool endsLine = data[length - 1] == '\n';
      if (!_cut) AppendCut(data, static_cast<size_t>(length) - (endsLine ? 1 : 0));
      if (!endsLine) return;
      _inLine = false;
      Send();
      // One huge line (with a large maxMessageSize) must not stay resident.
      if (_message.capacity() > static_cast<size_t>(std::max(0, _options.keepBufferBytes))) {
         std::string().swap(_message);
      }
   }

   void FlushLocked() override {}
   void CloseLocked() override { Disconnect(); }

private:
   void BeginMessage(Logger::CombinedLevel level) {
      _inLine = true;
      _cut = false;
      char head[128];
      time_t now = time(nullptr);
      struct tm local;
      localtime_r(&now, &local);
      int priority = _options.facility | GetSyslogSeverity(HighestLevel(level));
      int n = snprintf(head, sizeof(head), "<%d>%s %2d %02d:%02d:%02d %s[%d]: ", priority,
                       kMonths[local.tm_mon % 12], local.tm_mday, local.tm_hour, local.tm_min,
                       local.tm_sec, _options.ident.c_str(), static_cast<int>(getpid()));
      if (n < 0) n = 0;
      if (n >= static_cast<int>(sizeof(head))) n = sizeof(head) - 1;
      _message.assign(head, static_cast<size_t>(n));
      _headerSize = _message.size();
   }

   // Appends what still fits of the line's maxMessageSize bytes; the cut never splits a
   // UTF-8 character, and the rest of the line is not kept at all.
   void AppendCut(const char* data, size_t length) {
      size_t room = _headerSize + static_cast<size_t>(_options.maxMessageSize) - _message.size();
      if (length <= room) {
         _message.append(data, length);
         return;
      }
      _cut = true;
      _truncated.fetch_add(1, std::memory_order_relaxed);
      // data[room] is the first byte left out: when it continues a character, the cut
      // goes back to that character's first byte.
      size_t take = room;
      if (IsContinuationByte(data[room])) {
         size_t first = room;
         while (first > 0 && room - first < 3 && IsContinuationByte(data[first - 1])) --first;
         if (first == 0) {
            take = 0;
            DropPartialCharacter();  // it began in an earlier piece
         } else if (static_cast<unsigned char>(data[first - 1]) >= 0xC0) {
            take = first - 1;
         }
      }
      _message.append(data, take);
   }

   // Removes a character whose first bytes end the message.
   void DropPartialCharacter() {
      size_t end = _message.size();
      size_t start = end;
      while (start > _headerSize && end - start < 3 && IsContinuationByte(_message[start - 1])) {
         --start;
      }
      if (start > _headerSize && static_cast<unsigned char>(_message[start - 1]) >= 0xC0) {
         _message.resize(start - 1);
      }
   }

   void Send() {
      if (_fd < 0 && !Connect()) {
         _lost.fetch_add(1, std::memory_order_relaxed);
         return;
      }
      std::optional<Clock::time_point> deadline;  // from the first time the socket is full
      bool reconnected = false;
      for (;;) {
         if (SendOnce()) {
            _stalled = false;
            return;
         }
         int error = errno;
         if (error == EAGAIN || error == EWOULDBLOCK || error == ENOBUFS) {
            if (!deadline) {
               deadline = Clock::now() + std::chrono::milliseconds(_options.sendTimeoutMs);
            }
            if (WaitForRoom(*deadline)) continue;
            break;
         }
         // The receiver went away (restarted, socket replaced): connect anew once.
         if (reconnected) break;
         reconnected = true;
         Disconnect();
         if (!Connect(true)) break;
      }
      _lost.fetch_add(1, std::memory_order_relaxed);
   }

   // Waits until the socket takes a datagram again, the line's deadline passes or the
   // budget of the current second is spent. A deadline passed in vain marks the receiver
   // as stopped, and nothing is waited for until a line gets through.
   bool WaitForRoom(Clock::time_point deadline) {
      if (_stalled) return false;
      Clock::time_point now = Clock::now();
      if (now - _windowStart >= std::chrono::seconds(1)) {
         _windowStart = now;
         _waitedInWindow = Clock::duration::zero();
      }
      Clock::duration budget =
          std::chrono::milliseconds(_options.sendWaitBudgetMs) - _waitedInWindow;
      Clock::duration wait = std::min(deadline - now, budget);
      if (wait <= Clock::duration::zero()) {
         if (deadline <= now) _stalled = true;
         return false;
      }
      struct pollfd ready = {_fd, POLLOUT, 0};
      auto waitNs = std::chrono::duration_cast<std::chrono::nanoseconds>(wait).count();
      struct timespec timeout = {static_cast<time_t>(waitNs / 1000000000),
                                 static_cast<long>(waitNs % 1000000000)};
      int n = ppoll(&ready, 1, &timeout, nullptr);
      Clock::time_point after = Clock::now();
      _waitedInWindow += after - now;
      if (n > 0) return true;
      if (n < 0 && errno == EINTR) return true;  // try the send again
      if (after >= deadline) _stalled = true;
      return false;
   }

   bool SendOnce() {
      for (;;) {
         ssize_t n = send(_fd, _message.data(), _message.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
         if (n >= 0) return true;
         if (errno != EINTR) return false;
      }
   }

   // Tries at most once per reconnect interval unless `now`.
   bool Connect(bool now = false) {
      Clock::time_point at = Clock::now();
      if (!now && at < _nextAttempt) return false;
      _nextAttempt = at + std::chrono::milliseconds(_options.reconnectIntervalMs);
      int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
      if (fd < 0) return false;
      struct sockaddr_un address;
      memset(&address, 0, sizeof(address));
      address.sun_family = AF_UNIX;
      if (_options.socketPath.size() >= sizeof(address.sun_path)) {
         close(fd);
         return false;
      }
      memcpy(address.sun_path, _options.socketPath.data(), _options.socketPath.size());
      if (connect(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) != 0) {
         close(fd);
         return false;
      }
      _fd = fd;
      return true;
   }

   void Disconnect() {
      if (_fd >= 0) close(_fd);
      _fd = -1;
   }

   LogSyslogOptions _options;
   int _fd = -1;
   Clock::time_point _nextAttempt;
   // The datagram being built: the header, then the line as far as it fits.
   std::string _message;
   size_t _headerSize = 0;
   bool _inLine = false;
   bool _cut = false;
   // Waiting for a full socket: whether the receiver looks stopped, and the time waited
   // in the second that began at _windowStart.
   bool _stalled = false;
   Clock::time_point _windowStart;
   Clock::duration _waitedInWindow{};
   std::atomic<uint64_t> _lost{0};
   std::atomic<uint64_t> _truncated{0};
};

}  // namespace

int GetSyslogSeverity(Logger::LogLevel level) {
   switch (level) {
      case Logger::LOG_QUIET: return 5;    // notice
      case Logger::LOG_PANIC: return 2;    // crit
      case Logger::LOG_ERROR: return 3;    // err
      case Logger::LOG_WARNING: return 4;  // warning
      case Logger::LOG_INFO: return 6;     // info
      default: return 7;                   // debug: verbose, trivia
   }
}

void CreateSyslogLogWriter(const std::string&, const LogSyslogOptions& options,
                           Ref<SyslogLogWriter>& out) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(options.level, mask)) {
      throw InvalidArgumentException("log level '" + options.level + "'");
   }
   out = new SyslogLogWriterImpl(options, mask);
}

}  // namespace Pelmora::Service
