// The log file writer: buffered appends, size-based rollover by renames at line
// boundaries, reopening after an outside rotation, holding lines while the file cannot
// be opened, and the one thread that writes out buffers that have waited long enough.

#include <dirent.h>
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
#include <set>
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
// that has waited its writer's interval. Writers are flushed outside its lock, so that
// making or destroying a writer never waits behind a slow disk; Remove waits only while
// the writer being removed is being flushed.
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
      std::unique_lock<std::mutex> lock(_mutex);
      _writers.erase(writer);
      _idle.wait(lock, [&] { return _flushing.count(writer) == 0; });
   }

   void FlushAll();

private:
   void Run();
   // Calls `flush` on each writer present now, with the lock released; `lock` holds
   // _mutex on entry and on return.
   template <class Flush>
   void ForEachUnlocked(std::unique_lock<std::mutex>& lock, Flush flush);

   std::mutex _mutex;
   std::condition_variable _wake;
   std::condition_variable _idle;  // _flushing changed
   std::map<LogFileWriterImpl*, int> _writers;
   // Writers being flushed now: by the thread, and at exit by FlushAll as well.
   std::multiset<LogFileWriterImpl*> _flushing;
   bool _started = false;
};

std::string RolledName(const std::string& path, int index) {
   return path + "." + std::to_string(index);
}

class LogFileWriterImpl : public LogWriterImpl, public virtual FileLogWriter {
public:
   LogFileWriterImpl(const LogFileOptions& options, const LogFileOps& ops,
                     Logger::CombinedLevel mask)
      : LogWriterImpl(nullptr, mask, false), _options(options), _ops(ops) {
      if (_options.maxFileNum < 1) _options.maxFileNum = 1;
      if (_options.bufferSize < 0) _options.bufferSize = 0;
      if (_options.maxHeldBytes < 0) _options.maxHeldBytes = 0;
      if (_options.threadBufferSize < 0) _options.threadBufferSize = 0;
      _buffer.resize(static_cast<size_t>(_options.bufferSize));
      if (!TryOpen()) {
         throw SystemException(errno, "cannot open log file " + _options.path + ": " +
                                          strerror(errno));
      }
      _highestRolled = FindHighestRolled();
      if (_options.bufferSize > 0) LogFileFlusher::Instance().Add(this, _options.flushIntervalMs);
   }

   ~LogFileWriterImpl() override {
      LogFileFlusher::Instance().Remove(this);
      std::lock_guard<LogWriterMutex> lock(_mutex);
      CloseLocked();
   }

   uint64_t GetLostCount() const override { return _lost.load(std::memory_order_relaxed); }

   int GetLineBatchBytes() const override {
      return _options.bufferSize > 0 && _options.flushIntervalMs > 0 ? _options.threadBufferSize
                                                                     : 0;
   }

   void Flush() override {
      // Lines that threads keep for this writer come first.
      DrainLineBatches();
      LogWriterImpl::Flush();
   }

   void Reopen() override {
      std::lock_guard<LogWriterMutex> lock(_mutex);
      WriteBuffer();
      if (_fd >= 0) close(_fd);
      _fd = -1;
      TryOpen();
   }

   // From the flusher thread.
   void FlushIfDue(Clock::time_point now) {
      std::lock_guard<LogWriterMutex> lock(_mutex);
      if (_fd < 0 && !_held.empty()) RetryOpen(now);
      if (_used > 0 && _options.flushIntervalMs > 0 &&
          now - _dirtySince >= std::chrono::milliseconds(_options.flushIntervalMs)) {
         WriteBuffer();
      }
   }

protected:
   void WriteLocked(Logger::CombinedLevel level, const char* data, int length) override {
      // Several lines at once (a thread's batch) go one by one where a line boundary
      // matters: a roll falls due among them, or the file is closed and they are held or
      // dropped each whole.
      if (_atLineStart && (_fd < 0 || (_options.maxFileSize > 0 &&
                                       _size + length > _options.maxFileSize))) {
         const char* end = data + length;
         auto* first = static_cast<const char*>(memchr(data, '\n', static_cast<size_t>(length)));
         if (first != nullptr && first + 1 < end) {
            while (data < end) {
               auto* newline =
                   static_cast<const char*>(memchr(data, '\n', static_cast<size_t>(end - data)));
               const char* stop = newline ? newline + 1 : end;
               WritePiece(level, data, static_cast<int>(stop - data));
               data = stop;
            }
            return;
         }
      }
      WritePiece(level, data, length);
   }

   void FlushLocked() override {
      if (_fd < 0) RetryOpen(Clock::now());
      WriteBuffer();
   }

   void CloseLocked() override {
      WriteBuffer();
      if (_fd >= 0) close(_fd);
      _fd = -1;
   }

private:
   // A piece of one line or the whole of one or more.
   void WritePiece(Logger::CombinedLevel level, const char* data, int length) {
      bool endsLine = data[length - 1] == '\n';
      if (_atLineStart) _dropping = false;
      if (_dropping) {
         _atLineStart = endsLine;  // the rest of a dropped line, even if a Reopen came
         return;
      }
      if (_fd < 0 && !RetryOpen(Clock::now())) {
         Hold(data, static_cast<size_t>(length), endsLine);
         return;
      }
      if (_atLineStart && _options.maxFileSize > 0 && _size >= _options.maxFileSize) {
         Roll();
         if (_fd < 0) {
            Hold(data, static_cast<size_t>(length), endsLine);
            return;
         }
      }
      Append(data, static_cast<size_t>(length));
      _size += length;
      _atLineStart = endsLine;
      if (_atLineStart && (level & kSevereLevels) != 0) WriteBuffer();
   }

   // Opens `path`; on success writes the held lines first. On failure errno tells why and
   // the next try waits reopenRetryMs.
   bool TryOpen() {
      int fd = _ops.open(_options.path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC,
                         static_cast<mode_t>(_options.fileMode));
      if (fd < 0) {
         int error = errno;
         _nextOpen = Clock::now() + std::chrono::milliseconds(_options.reopenRetryMs);
         errno = error;
         return false;
      }
      _fd = fd;
      struct stat info;
      _size = fstat(_fd, &info) == 0 ? info.st_size : 0;
      if (!_held.empty()) {
         std::string held;
         held.swap(_held);  // and its memory goes with it
         WriteOut(held.data(), held.size());
         _size += static_cast<long long>(held.size());
      }
      return true;
   }

   // Only between lines, so that a line is held or written whole, and a line being
   // dropped is dropped to its end.
   bool RetryOpen(Clock::time_point now) {
      if (!_atLineStart || now < _nextOpen) return false;
      return TryOpen();
   }

   // Keeps a piece while the file is closed; a line that does not fit what is left of
   // maxHeldBytes is dropped whole and counted.
   void Hold(const char* data, size_t length, bool endsLine) {
      if (_atLineStart) _heldLineStart = _held.size();
      if (!_dropping) {
         if (_held.size() + length > static_cast<size_t>(_options.maxHeldBytes)) {
            _held.resize(_heldLineStart);
            _dropping = true;
            _lost.fetch_add(1, std::memory_order_relaxed);
         } else {
            _held.append(data, length);
         }
      }
      _atLineStart = endsLine;
   }

   // The highest index below maxFileNum of the rolled files present.
   int FindHighestRolled() const {
      size_t slash = _options.path.rfind('/');
      std::string dir = slash == std::string::npos ? "." : _options.path.substr(0, slash + 1);
      std::string base = (slash == std::string::npos ? _options.path
                                                     : _options.path.substr(slash + 1)) + ".";
      int highest = 0;
      DIR* listing = opendir(dir.c_str());
      if (!listing) return _options.maxFileNum - 1;  // unknown: assume them all
      while (struct dirent* entry = readdir(listing)) {
         const char* name = entry->d_name;
         if (strncmp(name, base.c_str(), base.size()) != 0) continue;
         const char* digits = name + base.size();
         if (*digits == 0 || *digits == '0' || strlen(digits) > 9) continue;
         if (strspn(digits, "0123456789") != strlen(digits)) continue;
         int index = atoi(digits);
         if (index < _options.maxFileNum && index > highest) highest = index;
      }
      closedir(listing);
      return highest;
   }

   void Roll() {
      WriteBuffer();
      if (_fd >= 0) close(_fd);
      _fd = -1;
      if (_options.maxFileNum == 1) {
         // Only the current file is kept: start it again.
         unlink(_options.path.c_str());
      } else {
         // Renames that find no file (one deleted from outside) cost a call each, at
         // most one per index up to the highest present.
         int top = std::min(_highestRolled + 1, _options.maxFileNum - 1);
         // The file that falls out goes first: a rename over an existing file makes the
         // file system write the renamed one out at once (tens of milliseconds for a
         // large log, with every logging thread waiting), a rename to a free name does not.
         unlink(RolledName(_options.path, top).c_str());
         for (int i = top; i >= 2; --i) {
            _ops.rename(RolledName(_options.path, i - 1).c_str(),
                        RolledName(_options.path, i).c_str());
         }
         _ops.rename(_options.path.c_str(), RolledName(_options.path, 1).c_str());
         _highestRolled = top;
      }
      TryOpen();
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
      while (length > 0 && _fd >= 0) {
         ssize_t n = _ops.write(_fd, data, length);
         if (n < 0 && errno == EINTR) continue;
         if (n <= 0) break;
         data += n;
         length -= static_cast<size_t>(n);
      }
      // What could not be written (disk full) is lost; logging goes on.
   }

   LogFileOptions _options;
   const LogFileOps _ops;
   int _fd = -1;
   long long _size = 0;
   int _highestRolled = 0;
   std::vector<char> _buffer;
   size_t _used = 0;
   bool _atLineStart = true;
   Clock::time_point _dirtySince;
   // While the file is closed: the held lines, where the current one starts among them,
   // whether it is being dropped, and when the next open may be tried.
   std::string _held;
   size_t _heldLineStart = 0;
   bool _dropping = false;
   Clock::time_point _nextOpen;
   std::atomic<uint64_t> _lost{0};
};

template <class Flush>
void LogFileFlusher::ForEachUnlocked(std::unique_lock<std::mutex>& lock, Flush flush) {
   std::vector<LogFileWriterImpl*> writers;
   for (auto& [writer, interval] : _writers) writers.push_back(writer);
   for (LogFileWriterImpl* writer : writers) {
      // Removed meanwhile (and perhaps destroyed): skip it.
      if (_writers.count(writer) == 0) continue;
      auto flushing = _flushing.insert(writer);
      lock.unlock();
      flush(writer);
      lock.lock();
      _flushing.erase(flushing);
      _idle.notify_all();
   }
}

void LogFileFlusher::FlushAll() {
   std::unique_lock<std::mutex> lock(_mutex);
   ForEachUnlocked(lock, [](LogFileWriterImpl* writer) { writer->Flush(); });
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
      lock.unlock();
      DrainLineBatches();
      lock.lock();
      Clock::time_point now = Clock::now();
      ForEachUnlocked(lock, [now](LogFileWriterImpl* writer) { writer->FlushIfDue(now); });
   }
}

}  // namespace

const LogFileOps& LogFileOps::Posix() {
   static const LogFileOps ops{
       [](const char* path, int flags, mode_t mode) { return ::open(path, flags, mode); },
       ::write, ::rename};
   return ops;
}

void CreateFileLogWriter(const std::string&, const LogFileOptions& options, const LogFileOps& ops,
                         Ref<FileLogWriter>& out) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(options.level, mask)) {
      throw InvalidArgumentException("log level '" + options.level + "'");
   }
   if (options.path.empty()) throw InvalidArgumentException("empty log file path");
   out = new LogFileWriterImpl(options, ops, mask);
}

void CreateFileLogWriter(const std::string& name, const LogFileOptions& options,
                         Ref<FileLogWriter>& out) {
   CreateFileLogWriter(name, options, LogFileOps::Posix(), out);
}

void CreateFileLogWriter(const std::string& name, const LogFileOptions& options,
                         Ref<LogWriter>& out) {
   Ref<FileLogWriter> writer;
   CreateFileLogWriter(name, options, LogFileOps::Posix(), writer);
   out = writer.Get();
}

}  // namespace Pelmora::Service
