// The file and string sources of configurations. A file is written next to itself under
// ".tmp" and renamed over the old one, with fsync of the file and of its directory, so a
// crash or power loss leaves the old file or the new one, never a torn one.

#include "src/config/configBackend.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/io.h"
#include "pelmora/service/config.h"
#include "src/config/configLog.h"

namespace Pelmora::Service {

namespace {

constexpr int kWriteBufferSize = 65536;

[[noreturn]] void ThrowErrno(const std::string& message) {
   int error = errno;
   throw SystemException(error, message + ": " + System::GetErrorMessage(error));
}

// Reads a descriptor the backend owns.
class FdReader : public Reader, public ObjectImpl {
public:
   explicit FdReader(int fd) : _fd(fd) {}
   int Read(char* buffer, int length) override {
      for (;;) {
         ssize_t n = ::read(_fd, buffer, static_cast<size_t>(length));
         if (n > 0) return static_cast<int>(n);
         if (n == 0) return -1;
         if (errno != EINTR) ThrowErrno("Failed to read configuration");
      }
   }
   void Close() override {}

private:
   int _fd;
};

// Writes a descriptor the backend owns.
class FdWriter : public Writer, public ObjectImpl {
public:
   FdWriter(int fd, const ConfigFileOps& ops) : _fd(fd), _ops(ops) {}
   void Write(const char* data, int length) override {
      while (length > 0) {
         ssize_t n = _ops.write(_fd, data, static_cast<size_t>(length));
         if (n < 0) {
            if (errno == EINTR) continue;
            ThrowErrno("Failed to write configuration");
         }
         data += n;
         length -= static_cast<int>(n);
      }
   }
   void Close() override {}

private:
   int _fd;
   ConfigFileOps _ops;
};

// Counts the bytes that pass and refuses more than the limit.
class LimitReader : public Reader, public ObjectImpl {
public:
   LimitReader(Reader* source, long long limit, const std::string& path)
       : _source(source), _limit(limit), _path(path) {}
   int Read(char* buffer, int length) override {
      int n = _source->Read(buffer, length);
      if (n > 0) {
         _count += n;
         if (_count > _limit) ThrowLimit(_limit, _path);
      }
      return n;
   }
   void Close() override { _source->Close(); }

   static void ThrowLimit(long long limit, const std::string& path) {
      throw FileIOException(
          MessageFormatter::ASPrint("Configuration exceeds its size limit of %1 bytes", limit),
          path);
   }

private:
   Ref<Reader> _source;
   long long _limit;
   std::string _path;
   long long _count = 0;
};

class LimitWriter : public Writer, public ObjectImpl {
public:
   LimitWriter(Writer* target, long long limit, const std::string& path)
       : _target(target), _limit(limit), _path(path) {}
   void Write(const char* data, int length) override {
      _count += length;
      if (_count > _limit) LimitReader::ThrowLimit(_limit, _path);
      _target->Write(data, length);
   }
   void Flush() override { _target->Flush(); }
   void Close() override { _target->Close(); }

private:
   Ref<Writer> _target;
   long long _limit;
   std::string _path;
   long long _count = 0;
};

// What tells one version of a file from another without reading it.
struct FileStamp {
   bool exists = false;
   dev_t dev = 0;
   ino_t ino = 0;
   off_t size = 0;
   timespec mtime{};
   timespec ctime{};

   static FileStamp Of(const struct stat& st) {
      FileStamp s;
      s.exists = true;
      s.dev = st.st_dev;
      s.ino = st.st_ino;
      s.size = st.st_size;
      s.mtime = st.st_mtim;
      s.ctime = st.st_ctim;
      return s;
   }
   bool operator==(const FileStamp& o) const {
      return exists == o.exists && dev == o.dev && ino == o.ino && size == o.size &&
             mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec &&
             ctime.tv_sec == o.ctime.tv_sec && ctime.tv_nsec == o.ctime.tv_nsec;
   }
};

class FileConfigBackendImpl : public FileConfigBackend, public ObjectImpl {
public:
   FileConfigBackendImpl(const std::string& path, int sizeLimit, unsigned flags,
                         const ConfigFileOps& ops)
       : _ops(ops),
         _gzip((flags & kConfigFlagGzip) != 0),
         _limit(sizeLimit < 0 ? kConfigDefaultSizeLimit : sizeLimit) {
      if (_gzip && path.find(_gzExt) != std::string::npos) {
         throw InvalidArgumentException("fileName (" + path + ") contains .gz extension");
      }
      _path = _gzip ? path + _gzExt : path;
      _tmpPath = _path + ".tmp";
      size_t slash = _path.rfind('/');
      _directory = slash == std::string::npos ? "." : slash == 0 ? "/" : _path.substr(0, slash);
   }

   ~FileConfigBackendImpl() override {
      try {
         Close();
      } catch (const Exception& e) {
         LogConfig(kConfigLogWarning, "Closing configuration %1 failed: %2", _path, e.what());
      }
   }

   void Open(Ref<Reader>& out) override {
      if (_fd >= 0) throw InProgressException();
      int fd = ::open(_path.c_str(), O_RDONLY | O_CLOEXEC);
      if (fd < 0) {
         int error = errno;
         throw SystemException(error, "Failed to open read file " + _path);
      }
      struct stat st;
      if (::fstat(fd, &st) == 0) _stamp = FileStamp::Of(st);
      _fd = fd;
      _writing = false;
      Ref<Reader> reader = new FdReader(fd);
      if (_gzip) {
         Ref<Reader> inflated;
         CreateGzippedFileReader(reader.Get(), _path, inflated);
         reader = inflated;
      }
      out = new LimitReader(reader.Get(), _limit, _path);
   }

   void Open(Ref<Writer>& out) override {
      if (_fd >= 0) throw InProgressException();
      // Keep the permissions of the file being replaced: it may hold secrets.
      mode_t mode = 0644;
      struct stat st;
      if (::stat(_path.c_str(), &st) == 0) mode = st.st_mode & 07777;
      int fd = ::open(_tmpPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
      if (fd < 0) ThrowErrno("Failed to open write file " + _tmpPath);
      if (::fchmod(fd, mode) != 0) {
         // The umask may have narrowed the mode; a wider one is not worth failing for.
         LogConfig(kConfigLogWarning, "Failed to set the mode of %1", _tmpPath);
      }
      _fd = fd;
      _writing = true;
      _committed = false;
      Ref<Writer> sink = new FdWriter(fd, _ops);
      if (_gzip) {
         Ref<Writer> deflated;
         CreateGzippedFileWriter(sink.Get(), _path, deflated);
         sink = deflated;
      }
      _sink = sink;
      Ref<BufferedWriter> buffered;
      CreateBufferedWriter(kWriteBufferSize, sink.Get(), buffered);
      _buffered = buffered;
      out = new LimitWriter(buffered.Get(), _limit, _path);
   }

   void Commit() override {
      if (_fd < 0 || !_writing || _committed) throw InvalidStateException();
      _buffered->Flush();
      _sink->Close();  // the gzip trailer, when compressed
      if (_ops.fsync(_fd) != 0) ThrowErrno("Failed to sync " + _tmpPath);
      // The new file's directory entry must be durable before it replaces the old one.
      SyncDirectory();
      if (_ops.rename(_tmpPath.c_str(), _path.c_str()) != 0) {
         int error = errno;
         throw SystemException(error, "Failed to replace " + _path + " with " + _tmpPath + ": " +
                                          System::GetErrorMessage(error));
      }
      _committed = true;
      SyncDirectory();
      struct stat st;
      if (::fstat(_fd, &st) == 0) _stamp = FileStamp::Of(st);
   }

   void Close() override {
      if (_fd < 0) return;
      int fd = _fd;
      _fd = -1;
      _buffered.Reset();
      _sink.Reset();
      ::close(fd);
      if (_writing && !_committed && ::unlink(_tmpPath.c_str()) != 0 && errno != ENOENT) {
         LogConfig(kConfigLogWarning, "Failed to remove %1", _tmpPath);
      }
      _writing = false;
   }

   bool HasChanged() override {
      struct stat st;
      FileStamp now;
      if (::stat(_path.c_str(), &st) == 0) now = FileStamp::Of(st);
      return !(now == _stamp);
   }

private:
   void SyncDirectory() {
      int dir = ::open(_directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
      if (dir < 0) ThrowErrno("Failed to open directory " + _directory);
      int rc = _ops.fsync(dir);
      int error = errno;
      ::close(dir);
      if (rc != 0 && error != EINVAL) {  // EINVAL: a file system without directory sync
         errno = error;
         ThrowErrno("Failed to sync directory " + _directory);
      }
   }

   ConfigFileOps _ops;
   std::string _path;
   std::string _tmpPath;
   std::string _directory;
   bool _gzip;
   long long _limit;
   int _fd = -1;
   bool _writing = false;
   bool _committed = false;
   Ref<Writer> _sink;
   Ref<BufferedWriter> _buffered;
   FileStamp _stamp;
};

class StringConfigBackend : public ConfigBackend, public ObjectImpl {
public:
   explicit StringConfigBackend(std::string& text) : _text(text) {}

   void Open(Ref<Reader>& out) override {
      if (_open) throw InProgressException();
      _seen = _text;
      Ref<StringReader> reader;
      CreateStringReader(_seen.data(), static_cast<int>(_seen.size()), reader);
      _open = true;
      out = reader;
   }

   void Open(Ref<Writer>& out) override {
      if (_open) throw InProgressException();
      CreateStringWriter(_writer);
      _open = true;
      out = _writer;
   }

   void Commit() override {
      if (!_open || !_writer) throw InvalidStateException();
      _text = _writer->GetString();
      _seen = _text;
   }

   void Close() override {
      _open = false;
      _writer.Reset();
   }

   bool HasChanged() override { return _text != _seen; }

private:
   std::string& _text;
   // The text as last read or written; the reader reads this copy, so the caller's string
   // may change meanwhile.
   std::string _seen;
   Ref<StringWriter> _writer;
   bool _open = false;
};

}  // namespace

const ConfigFileOps& ConfigFileOps::Posix() {
   static const ConfigFileOps ops{::write, ::fsync, ::rename};
   return ops;
}

void CreateFileConfigBackend(const std::string& path, int sizeLimit, unsigned flags,
                             Ref<FileConfigBackend>& out) {
   out = new FileConfigBackendImpl(path, sizeLimit, flags, ConfigFileOps::Posix());
}

void CreateFileConfigBackend(const std::string& path, int sizeLimit, unsigned flags,
                             const ConfigFileOps& ops, Ref<FileConfigBackend>& out) {
   out = new FileConfigBackendImpl(path, sizeLimit, flags, ops);
}

void CreateStringConfigBackend(std::string& text, Ref<ConfigBackend>& out) {
   out = new StringConfigBackend(text);
}

}  // namespace Pelmora::Service
