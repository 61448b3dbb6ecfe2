// One journal file: the file header, then length-prefixed records appended with one write
// each and made durable with fdatasync before WriteRecord returns.

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <libgen.h>
#include <sys/stat.h>
#include <unistd.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/service/journal.h"

namespace Pelmora::Service {

namespace {

uint32_t ReadU32(const char* p) {
   const auto* b = reinterpret_cast<const unsigned char*>(p);
   return uint32_t(b[0]) | uint32_t(b[1]) << 8 | uint32_t(b[2]) << 16 | uint32_t(b[3]) << 24;
}

// The directory entry of a new file is durable only once its directory is synced.
void SyncParent(const std::string& path) {
   std::string copy = path;
   int fd = ::open(::dirname(copy.data()), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
   if (fd < 0) return;
   ::fsync(fd);
   ::close(fd);
}

class JrnlFilePersistenceProviderImpl : public virtual JrnlPersistenceProvider, public ObjectImpl {
public:
   JrnlFilePersistenceProviderImpl(const std::string& path, bool create) : _path(path) {
      if (create) {
         _fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
         if (_fd < 0) {
            if (errno == EEXIST) throw JrnlException("The journal already exists");
            throw JrnlException(MessageFormatter::ASPrint("Failed to create journal file: %1.", path));
         }
         WriteAll(kJrnlFileHeader, kJrnlFileHeaderLength);
         Sync();
         SyncParent(path);
         _end = kJrnlFileHeaderLength;
      } else {
         _fd = ::open(path.c_str(), O_RDWR | O_CLOEXEC);
         if (_fd < 0) {
            int error = errno;
            throw SystemException(error, "Failed to open journal " + path + ": " + std::strerror(error));
         }
         _end = FindEnd();
      }
      _readOffset = kJrnlFileHeaderLength;
   }

   ~JrnlFilePersistenceProviderImpl() override {
      if (_fd >= 0) ::close(_fd);
   }

   void WriteRecord(const char* data, unsigned int length) override {
      if (!data || length == 0) throw InvalidArgumentException("empty journal record");
      std::string record(4 + length, '\0');
      for (int i = 0; i < 4; ++i) record[i] = static_cast<char>(length >> (8 * i));
      std::memcpy(&record[4], data, length);
      // A torn tail left by an earlier crash goes before anything follows it.
      if (_tornTail) {
         if (::ftruncate(_fd, static_cast<off_t>(_end)) != 0) FailWrite();
         _tornTail = false;
      }
      ssize_t written = ::pwrite(_fd, record.data(), record.size(), static_cast<off_t>(_end));
      if (written != static_cast<ssize_t>(record.size())) FailWrite();
      _end += record.size();
      Sync();
   }

   bool ReadRecord(char*& buffer, unsigned int& length) override {
      if (_readOffset >= _end) return false;
      char prefix[4];
      if (!ReadAt(_readOffset, prefix, 4)) return false;
      uint32_t n = ReadU32(prefix);
      if (n > _end - _readOffset - 4) return false;  // never allocate for a length past the end
      buffer = new char[size_t(n) + 1];
      if (!ReadAt(_readOffset + 4, buffer, n)) {
         delete[] buffer;
         buffer = nullptr;
         return false;
      }
      buffer[n] = '\0';
      length = n;
      _readOffset += 4 + size_t(n);
      return true;
   }

   void RewindToStart() override { _readOffset = kJrnlFileHeaderLength; }

   bool IsValidFileHeader() override {
      char header[kJrnlFileHeaderLength];
      if (!ReadAt(0, header, kJrnlFileHeaderLength)) return false;
      for (unsigned i = 0; i < kJrnlFileHeaderLength; ++i)
         if (header[i] != kJrnlFileHeader[i]) return false;
      return true;
   }

   void Remove() override {
      ::close(_fd);
      _fd = -1;
      ::unlink(_path.c_str());
      SyncParent(_path);
   }

   const std::string& GetPath() const override { return _path; }

private:
   [[noreturn]] void FailWrite() { throw JrnlException("Failed to write to " + _path); }

   void WriteAll(const char* data, size_t size) {
      if (::write(_fd, data, size) != static_cast<ssize_t>(size)) FailWrite();
   }

   void Sync() {
      if (::fdatasync(_fd) != 0) FailWrite();
   }

   bool ReadAt(size_t offset, char* out, size_t size) {
      if (offset > _end || _end - offset < size) return false;
      size_t done = 0;
      while (done < size) {
         ssize_t n = ::pread(_fd, out + done, size - done, static_cast<off_t>(offset + done));
         if (n < 0 && errno == EINTR) continue;
         if (n <= 0) return false;
         done += size_t(n);
      }
      return true;
   }

   // The end of the last whole record. Past it lies nothing, a record whose length runs
   // past the end of the file, or zeros where the file grew but its data never landed (a
   // zero length is never written): a write cut short, ignored and cut off before the next
   // append.
   size_t FindEnd() {
      struct stat st;
      if (::fstat(_fd, &st) != 0) return 0;
      size_t size = size_t(st.st_size);
      _end = size;
      size_t offset = kJrnlFileHeaderLength;
      if (size < offset) return size;
      while (offset < size) {
         char prefix[4];
         if (size - offset < 4 || !ReadAt(offset, prefix, 4)) break;
         uint32_t n = ReadU32(prefix);
         if (n == 0 || size - offset - 4 < n) break;
         offset += 4 + size_t(n);
      }
      _tornTail = offset < size;
      return offset;
   }

   std::string _path;
   int _fd = -1;
   size_t _end = 0;
   size_t _readOffset = 0;
   bool _tornTail = false;
};

}  // namespace

void CreateJrnlFilePersistenceProvider(const std::string& path, bool create, Ref<JrnlPersistenceProvider>& out) {
   out = new JrnlFilePersistenceProviderImpl(path, create);
}

std::string GetJrnlFileHeader(const std::string& path) {
   int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
   if (fd < 0) return std::string();
   char header[kJrnlFileHeaderLength];
   ssize_t n = ::read(fd, header, sizeof header);
   ::close(fd);
   return n > 0 ? std::string(header, size_t(n)) : std::string();
}

}  // namespace Pelmora::Service
