// The log file writer: buffered appends, size-based rollover by renames at line
// boundaries, reopening after an outside rotation, and the one thread that writes out
// buffers that have waited long enough.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logWriters.h"
#include "src/log/logImpl.h"

namespace Pelmora::Service {

namespace {

using Clock = std::chrono::steady_clock;

class LogFileWriterImpl;

// Wakes every half of the shortest interval of its writers and writes out each buffer
// that has waited its writer's interval. Its lock comes before a writer's lock.
class LogFileFlusher {
public:
   static LogFileFlusher& Instance() {
      // Lives until exit: writers may be flushed from other threads then.
      static LogFileFlusher* const flusher = [] {
         auto* made = new LogFileFlusher();
         // Buffered lines of a process that ends through exit() reach their files.
         atexit([] { Instance().FlushAll(); });
         return made;
      }();
      return *flusher;
   }

   void Add(LogFileWriterImpl* writer, int intervalMs) {
      std::lock_guard<std::mutex> lock(_mutex);
      _writers[writer] = intervalMs;
      if (!_started && intervalMs > 0) {
         _started = true;
         std::thread([this] { Run(); }).detach();
      }
      _wake.notify_one();
   }

   void Remove(LogFileWriterImpl* writer) {
      std::lock_guard<std::mutex> lock(_mutex);
      _writers.erase(writer);
   }

   void FlushAll();

private:
   void Run();

   std::mutex _mutex;
   std::condition_variable _wake;
   std::map<LogFileWriterImpl*, int> _writers;
   bool _started = false;
};

std::string RolledName(const std::string& path, int index) {
   return path + "." + std::to_string(index);
}

class LogFileWriterImpl : public LogWriterImpl {
public:
   LogFileWriterImpl(const LogFileOptions& options, Logger::CombinedLevel mask)
      : LogWriterImpl(nullptr, mask, false), _options(options) {
      if (_options.maxFileNum < 1) _options.maxFileNum = 1;
      if (_options.bufferSize < 0) _options.bufferSize = 0;
      _buffer.resize(static_cast<size_t>(_options.bufferSize));
      Open(true);
      if (_options.bufferSize > 0) LogFileFlusher::Instance().Add(this, _options.flushIntervalMs);
   }

   ~LogFileWriterImpl() override {
      LogFileFlusher::Instance().Remove(this);
      std::lock_guard<std::mutex> lock(_mutex);
      CloseLocked();
   }

   void Reopen() override {
      std::lock_guard<std::mutex> lock(_mutex);
      WriteBuffer();
      if (_fd >= 0) close(_fd);
      _fd = -1;
      Open(false);
   }

   // From the flusher thread.
   void FlushIfDue(Clock::time_point now) {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_used > 0 && _options.flushIntervalMs > 0 &&
          now - _dirtySince >= std::chrono::milliseconds(_options.flushIntervalMs)) {
         WriteBuffer();
      }
   }

protected:
   void WriteLocked(Logger::CombinedLevel level, const char* data, int length) override {
      if (_atLineStart && _options.maxFileSize > 0 && _size >= _options.maxFileSize) Roll();
      Append(data, static_cast<size_t>(length));
      _size += length;
      _atLineStart = data[length - 1] == '\n';
      if (_atLineStart && (level & kSevereLevels) != 0) WriteBuffer();
   }

   void FlushLocked() override { WriteBuffer(); }

   void CloseLocked() override {
      WriteBuffer();
      if (_fd >= 0) close(_fd);
      _fd = -1;
   }

private:
   // `first`: the constructor's open, whose failure the caller sees.
   void Open(bool first) {
      _fd = open(_options.path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC,
                 static_cast<mode_t>(_options.fileMode));
      if (_fd < 0) {
         if (first) throw SystemException(errno, "cannot open log file " + _options.path + ": " +
                                                     strerror(errno));
         return;
      }
      struct stat info;
      _size = fstat(_fd, &info) == 0 ? info.st_size : 0;
   }

   void Roll() {
      WriteBuffer();
      if (_fd >= 0) close(_fd);
      _fd = -1;
      if (_options.maxFileNum == 1) {
         // Only the current file is kept: start it again.
         unlink(_options.path.c_str());
      } else {
         for (int i = _options.maxFileNum - 1; i >= 2; --i) {
            rename(RolledName(_options.path, i - 1).c_str(), RolledName(_options.path, i).c_str());
         }
         rename(_options.path.c_str(), RolledName(_options.path, 1).c_str());
      }
      Open(false);
   }

   void Append(const char* data, size_t length) {
      size_t capacity = _buffer.size();
      if (length >= capacity) {
         WriteBuffer();
         WriteOut(data, length);
         return;
      }
      if (_used + length > capacity) WriteBuffer();
      if (_used == 0) _dirtySince = Clock::now();
      memcpy(_buffer.data() + _used, data, length);
      _used += length;
   }

   void WriteBuffer() {
      if (_used == 0) return;
      size_t used = _used;
      _used = 0;
      WriteOut(_buffer.data(), used);
   }

   void WriteOut(const char* data, size_t length) {
      if (_fd < 0) Open(false);  // a failed roll or reopen: try again
      while (length > 0 && _fd >= 0) {
         ssize_t n = write(_fd, data, length);
         if (n < 0 && errno == EINTR) continue;
         if (n <= 0) break;
         data += n;
         length -= static_cast<size_t>(n);
      }
      // What could not be written (disk full, no file) is lost; logging goes on.
   }

   LogFileOptions _options;
   int _fd = -1;
   long long _size = 0;
   std::vector<char> _buffer;
   size_t _used = 0;
   bool _atLineStart = true;
   Clock::time_point _dirtySince;
};

void LogFileFlusher::FlushAll() {
   std::lock_guard<std::mutex> lock(_mutex);
   for (auto& [writer, interval] : _writers) writer->Flush();
}

void LogFileFlusher::Run() {
   std::unique_lock<std::mutex> lock(_mutex);
   for (;;) {
      int shortest = 0;
      for (auto& [writer, interval] : _writers) {
         if (interval > 0 && (shortest == 0 || interval < shortest)) shortest = interval;
      }
      if (shortest == 0) {
         _wake.wait(lock);
         continue;
      }
      _wake.wait_for(lock, std::chrono::milliseconds(std::max(1, shortest / 2)));
      Clock::time_point now = Clock::now();
      for (auto& [writer, interval] : _writers) writer->FlushIfDue(now);
   }
}

}  // namespace

void CreateFileLogWriter(const std::string&, const LogFileOptions& options, Ref<LogWriter>& out) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(options.level, mask)) {
      throw InvalidArgumentException("log level '" + options.level + "'");
   }
   if (options.path.empty()) throw InvalidArgumentException("empty log file path");
   out = new LogFileWriterImpl(options, mask);
}

}  // namespace Pelmora::Service
