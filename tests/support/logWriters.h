#pragma once
// Files, a syslog socket of the test's own and replaceable file steps for the writer tests.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>
#include "pelmora/exception/exceptions.h"
#include "pelmora/service.h"
#include "src/log/logImpl.h"
#include "tests/support/heap.h"
#include "tests/support/watchdog.h"

namespace Pelmora::TestSupport {

using namespace Pelmora;
using namespace Pelmora::Service;
namespace fs = std::filesystem;

inline std::string ReadFile(const std::string& path) {
   std::ifstream in(path, std::ios::binary);
   std::stringstream text;
   text << in.rdbuf();
   return text.str();
}

// A temporary directory and a logger at "trivia", on a fresh manager, with one writer.
struct Files {
   Files() {
      char pattern[] = "/tmp/pelmora-log-XXXXXX";
      dir = mkdtemp(pattern);
      CreateLogger(nullptr, "files", "trivia", nullptr, logger);
   }
   ~Files() { fs::remove_all(dir); }
   void AddFile(LogFileOptions& options, const std::string& name) {
      options.path = dir + "/" + name;
      Ref<LogWriter> writer;
      CreateFileLogWriter("file", options, writer);
      logger->GetLogOutput()->AddWriter("file", writer.Get());
   }
   Ref<FileLogWriter> AddFile(LogFileOptions& options, const std::string& name,
                              const LogFileOps& ops) {
      options.path = dir + "/" + name;
      Ref<FileLogWriter> writer;
      CreateFileLogWriter("file", options, ops, writer);
      logger->GetLogOutput()->AddWriter("file", writer.Get());
      return writer;
   }
   std::string dir;
   Ref<Logger> logger;
};

// A syslog receiver on a socket in a temporary directory.
struct SyslogReceiver {
   explicit SyslogReceiver(const std::string& path) : path(path) { Bind(); }
   ~SyslogReceiver() { Unbind(); }
   void Bind() {
      fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
      sockaddr_un address{};
      address.sun_family = AF_UNIX;
      strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
      EXPECT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
      timeval wait{2, 0};
      setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &wait, sizeof(wait));
   }
   void Unbind() {
      if (fd >= 0) close(fd);
      fd = -1;
      unlink(path.c_str());
   }
   std::string Receive(int flags = 0) {
      char buffer[16384];
      ssize_t n = recv(fd, buffer, sizeof(buffer), flags);
      return n < 0 ? std::string("<nothing>") : std::string(buffer, static_cast<size_t>(n));
   }
   // Fills the receive queue from sockets of the test's own until a fresh one cannot
   // send either (each sender's own buffer may fill before the queue does).
   void Fill() {
      for (int senders = 0; senders < 1000; ++senders) {
         int sender = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
         sockaddr_un address{};
         address.sun_family = AF_UNIX;
         strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
         ASSERT_EQ(connect(sender, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
         fillers.push_back(sender);
         int sent = 0;
         while (send(sender, "f", 1, MSG_DONTWAIT) == 1) ++sent;
         if (sent == 0) return;
      }
      FAIL() << "the receive queue never filled";
   }
   // Reads what is queued without waiting.
   int Drain() {
      int n = 0;
      while (Receive(MSG_DONTWAIT) != "<nothing>") ++n;
      for (int filler : fillers) close(filler);
      fillers.clear();
      return n;
   }
   std::string path;
   int fd = -1;
   std::vector<int> fillers;
};

// The text of a syslog datagram after its header.
inline std::string SyslogLine(const std::string& message) {
   size_t end = message.find("]: ");
   return end == std::string::npos ? message : message.substr(end + 3);
}

// The open, write and rename steps of file writers made with Ops(): a test makes opens
// fail, counts renames, or holds writes until it lets them go.
struct FileOps {
   static inline std::atomic<bool> failOpen{false};
   static inline std::atomic<int> renames{0};
   static inline std::mutex mutex;
   static inline std::condition_variable changed;
   static inline bool holdWrites = false;
   static inline bool writeHeld = false;

   static int Open(const char* path, int flags, mode_t mode) {
      if (failOpen) return errno = EMFILE, -1;
      return ::open(path, flags, mode);
   }
   static ssize_t Write(int fd, const void* data, size_t length) {
      std::unique_lock<std::mutex> lock(mutex);
      if (holdWrites) {
         writeHeld = true;
         changed.notify_all();
         changed.wait(lock, [] { return !holdWrites; });
      }
      return ::write(fd, data, length);
   }
   static inline std::atomic<int> renamesOverFiles{0};

   static int Rename(const char* from, const char* to) {
      ++renames;
      if (access(to, F_OK) == 0) ++renamesOverFiles;
      return ::rename(from, to);
   }
   static const LogFileOps& Ops() {
      static const LogFileOps ops{Open, Write, Rename};
      return ops;
   }
};

inline bool IsValidUtf8(const std::string& text) {
   for (size_t i = 0; i < text.size();) {
      auto byte = static_cast<unsigned char>(text[i]);
      size_t length = byte < 0x80 ? 1 : byte >= 0xF0 ? 4 : byte >= 0xE0 ? 3 : byte >= 0xC0 ? 2 : 0;
      if (length == 0 || i + length > text.size()) return false;
      for (size_t k = 1; k < length; ++k) {
         if ((static_cast<unsigned char>(text[i + k]) & 0xC0) != 0x80) return false;
      }
      i += length;
   }
   return true;
}

}  // namespace Pelmora::TestSupport
