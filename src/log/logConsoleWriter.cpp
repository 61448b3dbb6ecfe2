// The console writer: each piece straight to standard error or standard output.

#include <unistd.h>

#include <cerrno>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logWriters.h"
#include "src/log/logImpl.h"

namespace Pelmora::Service {

namespace {

class ConsoleLogWriterImpl : public LogWriterImpl {
public:
   ConsoleLogWriterImpl(int fd, Logger::CombinedLevel mask)
      : LogWriterImpl(nullptr, mask, false), _fd(fd) {}

protected:
   void WriteLocked(Logger::CombinedLevel, const char* data, int length) override {
      // Unbuffered: a console reader sees a line when it is written. A closed or full
      // console loses the piece; logging goes on.
      while (length > 0) {
         ssize_t n = write(_fd, data, static_cast<size_t>(length));
         if (n < 0 && errno == EINTR) continue;
         if (n <= 0) return;
         data += n;
         length -= static_cast<int>(n);
      }
   }
   void FlushLocked() override {}
   void CloseLocked() override {}

private:
   const int _fd;
};

}  // namespace

void CreateConsoleLogWriter(const std::string&, const std::string& level, bool toStdout,
                            Ref<LogWriter>& out) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(level, mask)) throw InvalidArgumentException("log level '" + level + "'");
   out = new ConsoleLogWriterImpl(toStdout ? STDOUT_FILENO : STDERR_FILENO, mask);
}

}  // namespace Pelmora::Service
