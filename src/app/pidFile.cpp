// The PID file, replaced atomically and removed only while it is still ours.

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string>

#include "pelmora/exception/exceptions.h"
#include "src/app/appImpl.h"

namespace Pelmora::Service {

void WritePidFile(const std::string& path) {
   std::string temporary = path + ".tmp." + std::to_string(getpid());
   int fd = open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
   if (fd < 0) throw SystemException(errno, "Failed to create " + temporary + ": " +
                                                System::GetErrorMessage(errno));
   std::string text = std::to_string(getpid()) + "\n";
   bool ok = write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size()) &&
             fsync(fd) == 0;
   int error = errno;
   if (close(fd) != 0 && ok) {
      ok = false;
      error = errno;
   }
   if (ok && rename(temporary.c_str(), path.c_str()) != 0) {
      ok = false;
      error = errno;
   }
   if (!ok) {
      unlink(temporary.c_str());
      throw SystemException(error, "Failed to write " + path + ": " + System::GetErrorMessage(error));
   }
}

bool RemovePidFile(const std::string& path) {
   int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
   if (fd < 0) return false;
   char buffer[32] = {};
   ssize_t n = read(fd, buffer, sizeof(buffer) - 1);
   close(fd);
   // Another instance may have taken the file over since.
   if (n <= 0 || atoll(buffer) != static_cast<long long>(getpid())) return false;
   return unlink(path.c_str()) == 0;
}

}  // namespace Pelmora::Service
