#pragma once
// Raw-socket HTTP clients for the server tests: they send exactly the bytes given and
// read what comes back, so malformed and slow clients can be played. Every read is
// bounded by a receive time-out.

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <cstdio>
#include <string>

namespace Pelmora::Http::Testing {

class RawClient {
public:
   explicit RawClient(int port, int receiveTimeoutMs = 5000) {
      _fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
      timeval tv{receiveTimeoutMs / 1000, (receiveTimeoutMs % 1000) * 1000};
      ::setsockopt(_fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
      sockaddr_in address{};
      address.sin_family = AF_INET;
      address.sin_port = htons(static_cast<uint16_t>(port));
      address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
      _connected = ::connect(_fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
   }
   ~RawClient() { ::close(_fd); }
   RawClient(const RawClient&) = delete;
   RawClient& operator=(const RawClient&) = delete;

   bool Connected() const { return _connected; }
   // Shrinks the receive buffer, so that a client that does not read holds the server up.
   void SetReceiveBuffer(int bytes) { ::setsockopt(_fd, SOL_SOCKET, SO_RCVBUF, &bytes, sizeof bytes); }
   bool Send(const std::string& text) {
      size_t done = 0;
      while (done < text.size()) {
         ssize_t n = ::send(_fd, text.data() + done, text.size() - done, MSG_NOSIGNAL);
         if (n <= 0) return false;
         done += static_cast<size_t>(n);
      }
      return true;
   }
   // One response: the header, then a Content-Length body or a chunked one (kept
   // raw). Empty when the server closed or went quiet first.
   std::string ReadResponse(bool head = false) {
      size_t end;
      while ((end = _pending.find("\r\n\r\n")) == std::string::npos)
         if (!Fill()) return std::string();
      std::string header = _pending.substr(0, end + 4);
      _pending.erase(0, end + 4);
      std::string body;
      size_t at = Lower(header).find("content-length:");
      if (head) {
      } else if (at != std::string::npos) {
         size_t length = std::stoul(header.substr(at + 15));
         while (_pending.size() < length)
            if (!Fill()) return header + _pending;
         body = _pending.substr(0, length);
         _pending.erase(0, length);
      } else if (Lower(header).find("transfer-encoding: chunked") != std::string::npos) {
         while ((end = _pending.find("\r\n0\r\n\r\n")) == std::string::npos && _pending.rfind("0\r\n\r\n", 0) != 0)
            if (!Fill()) return header + _pending;
         size_t stop = _pending.rfind("0\r\n\r\n", 0) == 0 ? 5 : end + 7;
         body = _pending.substr(0, stop);
         _pending.erase(0, stop);
      } else {
         while (Fill()) {
         }
         body = _pending;
         _pending.clear();
      }
      return header + body;
   }
   // Whether the server closed the connection (end of stream within the time-out).
   bool Closed() {
      char c;
      ssize_t n = ::recv(_fd, &c, 1, 0);
      return n == 0 || (n < 0 && errno == ECONNRESET);
   }

private:
   static std::string Lower(std::string text) {
      for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
      return text;
   }
   bool Fill() {
      char piece[16384];
      ssize_t n = ::recv(_fd, piece, sizeof piece, 0);
      if (n <= 0) return false;
      _pending.append(piece, static_cast<size_t>(n));
      return true;
   }

   int _fd;
   bool _connected = false;
   std::string _pending;
};

// Runs `command` through the shell and returns its standard output.
inline std::string RunCommand(const std::string& command) {
   std::string out;
   FILE* pipe = ::popen(command.c_str(), "r");
   if (pipe == nullptr) return out;
   char piece[4096];
   for (size_t n; (n = std::fread(piece, 1, sizeof piece, pipe)) > 0;) out.append(piece, n);
   ::pclose(pipe);
   return out;
}

}  // namespace Pelmora::Http::Testing
