// SOAP over standard input and output, and as a CGI program: one request per process.

#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <mutex>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/service/app.h"
#include "pelmora/service/logMacros.h"
#include "src/soap/soapImpl.h"
#include "src/soap/soapLog.h"

namespace Pelmora::Soap {

namespace {

// How often an empty standard input is looked at again before the request counts as empty.
constexpr int kZeroReadRetries = 3;
constexpr int kZeroReadWaitMs = 20;

// Reads a descriptor, up to `length` bytes when that is not negative.
class FdReader final : public virtual Reader, public ObjectImpl {
public:
   FdReader(Service::Logger* logger, int fd, long long length, bool retryEmpty)
       : _logger(logger), _fd(fd), _left(length), _retryEmpty(retryEmpty) {}

   int Read(char* buffer, int length) override {
      if (_left == 0) return -1;
      if (_left > 0 && length > _left) length = static_cast<int>(_left);
      for (;;) {
         ssize_t n = ::read(_fd, buffer, static_cast<size_t>(length));
         if (n < 0) {
            if (errno == EINTR) continue;
            throw SystemException(errno);
         }
         if (n == 0 && !_gotAny && _retryEmpty && _zeroReads < kZeroReadRetries) {
            // A caller that opens the pipe late may not have written yet.
            ++_zeroReads;
            PELMORA_LOG_VERBOSE(_logger.Get(), "Zero-length read on stdin, retrying");
            pollfd wait{_fd, POLLIN, 0};
            ::poll(&wait, 1, kZeroReadWaitMs);
            continue;
         }
         if (n == 0) {
            _left = 0;
            return -1;
         }
         _gotAny = true;
         if (_left > 0) _left -= n;
         return static_cast<int>(n);
      }
   }
   void Close() override {}

private:
   Ref<Service::Logger> _logger;
   int _fd;
   long long _left;
   bool _retryEmpty;
   bool _gotAny = false;
   int _zeroReads = 0;
};

class StdinSoapSvcImpl final : public virtual StdinSoapSvc, public ObjectImpl {
public:
   StdinSoapSvcImpl(Service::Logger* logger, bool cgi, int inFd, int outFd, EnvironmentLookup environment)
       : _cgi(cgi), _in(inFd), _out(outFd), _environment(std::move(environment)) {
      OrSoapLogger(logger)->CreateLogger(cgi ? "CgiSoapSvc" : "SoapSvcOnStdio", _logger);
      _instanceId = "stdin-" + std::to_string(static_cast<long long>(::getpid()));
   }

   void SetSoapRequestHandler(SoapRequestHandler* handler) override {
      std::lock_guard<std::mutex> lock(_mutex);
      _handler = handler;
   }
   void GetSoapRequestHandler(Ref<SoapRequestHandler>& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      out = _handler;
   }
   const std::string& GetInstanceId() const override { return _instanceId; }

   void Start() override {
      Ref<Service::Config::View> view;
      Service::App* app = Service::GetApp();
      if (app != nullptr) {
         Ref<Service::Config> config = app->GetConfig();
         if (config) config->GetView("pelmora/soap", view);
      }
      if (view) view->Get("maxRequestBytes", &_maxBytes);
   }
   void Stop() override {}

   int HandleStdin() override { return _cgi ? HandleCgi() : HandleStdio(); }

   [[noreturn]] void Exit(int status) override {
      PELMORA_LOG_INFO(_logger.Get(), "Stdin request completed, exit status %1", status);
      PELMORA_LOG_INFO(_logger.Get(), "Server stopping...");
      PELMORA_LOG_INFO(_logger.Get(), "Server exiting...");
      std::exit(status);
   }

private:
   int HandleStdio() {
      PELMORA_LOG_INFO(_logger.Get(), "Dispatching stdin request");
      Ref<Reader> input(new FdReader(_logger.Get(), _in, -1, true));
      Ref<SoapRequestImpl> request(new SoapRequestImpl(_logger.Get(), input.Get(), {}, _maxBytes));
      Ref<StdioReply> reply(new StdioReply(_logger.Get(), _out));
      int status = Dispatch(request.Get(), reply.Get());
      PELMORA_LOG_INFO(_logger.Get(), "Request dispatch complete");
      return status != 0 || reply->WasFault() ? 1 : 0;
   }

   int HandleCgi() {
      const char* method = _environment("REQUEST_METHOD");
      if (method == nullptr) {
         PELMORA_LOG_ERROR(_logger.Get(), "Missing environment variable REQUEST_METHOD");
         std::string text = "Missing environment variable REQUEST_METHOD";
         WriteAnswer(Http::ResponseCode::BadRequest, {}, text);
         return 1;
      }
      if (std::string(method) != "POST") {
         const char* uri = _environment("REQUEST_URI");
         std::string text = std::string("HTTP method ") + method + " not supported for URL: ";
         if (uri != nullptr) {
            text += uri;
         } else {
            text += Env("SCRIPT_NAME") + "/" + Env("PATH_INFO") + "?" + Env("QUERY_STRING");
         }
         PELMORA_LOG_WARNING(_logger.Get(), "%1", text);
         WriteAnswer(Http::ResponseCode::MethodNotAllowed, {{"Allow", "POST"}}, text);
         return 1;
      }
      PELMORA_LOG_INFO(_logger.Get(), "Dispatching stdin request");
      long long length = -1;
      if (const char* given = _environment("CONTENT_LENGTH"); given != nullptr && *given != '\0') {
         char* end = nullptr;
         errno = 0;
         long long parsed = std::strtoll(given, &end, 10);
         if (errno == 0 && *end == '\0' && parsed >= 0) length = parsed;
      }
      SoapRequestImpl::Fields fields;
      fields.hasSoapAction = Lookup("HTTP_SOAPACTION", fields.soapAction);
      if (fields.hasSoapAction && fields.soapAction.size() >= 2 && fields.soapAction.front() == '"' &&
          fields.soapAction.back() == '"')
         fields.soapAction = fields.soapAction.substr(1, fields.soapAction.size() - 2);
      fields.hasUserAgent = Lookup("HTTP_USER_AGENT", fields.userAgent);
      fields.hasClient = Lookup("HTTP_NORVEX_CLIENT", fields.client);
      Ref<CgiReply> reply(new CgiReply(_logger.Get(), _out));
      int status;
      if (_maxBytes >= 0 && length > _maxBytes) {
         // Refused before any of it is read.
         std::string text = "SOAP request exceeds " + std::to_string(_maxBytes) + " bytes";
         PELMORA_LOG_INFO(_logger.Get(), "Client sent us an invalid SOAP request: %1", text);
         reply->WriteFault(kClientFault, text);
         status = 1;
      } else {
         Ref<Reader> input(new FdReader(_logger.Get(), _in, length, false));
         Ref<SoapRequestImpl> request(new SoapRequestImpl(_logger.Get(), input.Get(), fields, _maxBytes));
         status = Dispatch(request.Get(), reply.Get());
      }
      PELMORA_LOG_INFO(_logger.Get(), "Request dispatch complete");
      return status != 0 || reply->WasFault() ? 1 : 0;
   }

   // 0 unless the handler failed.
   int Dispatch(SoapRequest* request, Reply* reply) {
      Ref<SoapRequestHandler> handler;
      GetSoapRequestHandler(handler);
      SoapRequestHandler* const _soapRequestHandler = handler.Get();
      PELMORA_VERIFY(_soapRequestHandler != __null);
      int status = 0;
      try {
         try {
            _soapRequestHandler->HandleRequest(request, reply);
         } catch (const InvalidRequestException& e) {
            PELMORA_LOG_INFO(_logger.Get(), "Client sent us an invalid SOAP request: %1", e.GetMessage());
            status = 1;
            if (!reply->IsComplete()) reply->WriteFault(kClientFault, e.GetMessage());
         } catch (const Exception& e) {
            PELMORA_LOG_ERROR(_logger.Get(), "Exception while dispatching SOAP request: %1", e.GetMessage());
            status = 1;
            if (!reply->IsComplete()) reply->WriteFault(kServerFault, e.GetMessage());
         } catch (...) {
            PELMORA_LOG_ERROR(_logger.Get(), "Unknown exception while dispatching SOAP request");
            status = 1;
            if (!reply->IsComplete()) reply->WriteFault(kServerFault, "Unknown exception");
         }
         if (!reply->IsComplete()) {
            status = 1;
            reply->WriteFault(kServerFault, "The SOAP request handler wrote no reply");
         }
      } catch (const Exception&) {
         // The reply could not be written; the reply logged why.
         status = 1;
      }
      return status;
   }

   void WriteAnswer(const Http::ResponseCode::Info& status, std::vector<std::pair<std::string, std::string>> headers,
                    const std::string& text) {
      headers.emplace_back("Content-Length", std::to_string(text.size()));
      std::string answer = FormatCgiAnswer(status, headers, "text/plain", text);
      try {
         WriteAll(_out, answer.data(), answer.size());
      } catch (const Exception& e) {
         PELMORA_LOG_WARNING(_logger.Get(), "Failed to write reply to connection; %1", e.GetMessage());
      }
   }

   std::string Env(const char* name) {
      const char* value = _environment(name);
      return value != nullptr ? value : "";
   }
   bool Lookup(const char* name, std::string& out) {
      const char* value = _environment(name);
      if (value == nullptr) return false;
      out = value;
      return true;
   }

   Ref<Service::Logger> _logger;
   const bool _cgi;
   const int _in, _out;
   const EnvironmentLookup _environment;
   std::string _instanceId;
   long long _maxBytes = kDefaultMaxRequestBytes;
   std::mutex _mutex;
   Ref<SoapRequestHandler> _handler;
};

}  // namespace

void CreateStdinSoapSvc(Service::Logger* logger, bool cgi, int inFd, int outFd, EnvironmentLookup environment,
                        Ref<StdinSoapSvc>& out) {
   out = new StdinSoapSvcImpl(logger, cgi, inFd, outFd, std::move(environment));
}

void CreateSoapSvcOnStdio(Service::Logger* logger, Ref<StdinSoapSvc>& out) {
   CreateStdinSoapSvc(logger, false, 0, 1, [](const char* name) -> const char* { return std::getenv(name); }, out);
}

void CreateSoapSvcOnStdio(Service::Logger* logger, Ref<SoapSvc>& out) {
   Ref<StdinSoapSvc> made;
   CreateSoapSvcOnStdio(logger, made);
   out = made;
}

void CreateCgiSoapSvc(Service::Logger* logger, Ref<StdinSoapSvc>& out) {
   CreateStdinSoapSvc(logger, true, 0, 1, [](const char* name) -> const char* { return std::getenv(name); }, out);
}

void CreateCgiSoapSvc(Service::Logger* logger, Ref<SoapSvc>& out) {
   Ref<StdinSoapSvc> made;
   CreateCgiSoapSvc(logger, made);
   out = made;
}

}  // namespace Pelmora::Soap
