// SOAP over HTTP: the request handler that answers POST with SOAP calls and GET with WSDL
// documents and the service state, and the service that registers it.

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <mutex>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/service/app.h"
#include "pelmora/service/logMacros.h"
#include "src/soap/soapImpl.h"
#include "src/soap/soapLog.h"

namespace Pelmora::Soap {

namespace {

constexpr char kSessionCookie[] = "norvex_soap_session";

std::string MakeUuid() {
   unsigned char bytes[16];
   size_t got = 0;
   while (got < sizeof bytes) {
      ssize_t n = ::getrandom(bytes + got, sizeof bytes - got, 0);
      if (n < 0) {
         if (errno == EINTR) continue;
         throw SystemException(errno);
      }
      got += static_cast<size_t>(n);
   }
   bytes[6] = static_cast<unsigned char>((bytes[6] & 0x0F) | 0x40);  // version 4
   bytes[8] = static_cast<unsigned char>((bytes[8] & 0x3F) | 0x80);  // RFC 4122 variant
   char text[37];
   std::snprintf(text, sizeof text, "%02x%02x%02x%02x-%02x%02x-%02x%02x-%02x%02x-%02x%02x%02x%02x%02x%02x", bytes[0],
                 bytes[1], bytes[2], bytes[3], bytes[4], bytes[5], bytes[6], bytes[7], bytes[8], bytes[9], bytes[10],
                 bytes[11], bytes[12], bytes[13], bytes[14], bytes[15]);
   return text;
}

std::string Unquote(const std::string& value) {
   if (value.size() >= 2 && value.front() == '"' && value.back() == '"') return value.substr(1, value.size() - 2);
   return value;
}

// The path without its query or fragment.
std::string CutQuery(const std::string& path) { return path.substr(0, path.find_first_of("?#")); }

void Answer(Http::Response* response, const Http::ResponseCode::Info& status, const std::string& type,
            const std::string& body) {
   response->SetStatusCode(status);
   response->GetHeader().SetContentType(type, type == "text/xml" ? "utf-8" : "");
   response->SetContentLength(static_cast<long long>(body.size()));
   response->Write(body.data(), static_cast<int>(body.size()));
   response->Complete();
}

// The settings the handler serves under, read when the service starts.
struct Settings {
   bool enableChunkedResponses = false;
   long long maxRequestBytes = kDefaultMaxRequestBytes;
   long long maxSessionCount = 10000;
   long long sessionTimeoutSeconds = 1800;
   std::string path = "/soap";
   std::string serviceStatePath = "/serviceState";
   std::string wsdlRoot;
};

class RequestHandlerImpl final : public Http::RequestHandlerMixin, public ObjectImpl {
public:
   explicit RequestHandlerImpl(Service::Logger* logger) : _logger(logger), _instanceId(MakeUuid()) {}

   const std::string& GetInstanceId() const { return _instanceId; }

   void SetSoapRequestHandler(SoapRequestHandler* handler) {
      std::lock_guard<std::mutex> lock(_mutex);
      _handler = handler;
   }
   Ref<SoapRequestHandler> GetSoapRequestHandler() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _handler;
   }
   void SetWsdlRoot(const std::string& root) {
      std::lock_guard<std::mutex> lock(_mutex);
      _settings.wsdlRoot = root;
   }
   void SetSettings(const Settings& settings) {
      std::lock_guard<std::mutex> lock(_mutex);
      _settings = settings;
   }
   Settings GetSettings() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _settings;
   }
   void SetSessionService(Http::SessionService* sessions) {
      std::lock_guard<std::mutex> lock(_mutex);
      _sessions = sessions;
   }
   Ref<Http::SessionService> GetSessionService() {
      std::lock_guard<std::mutex> lock(_mutex);
      return _sessions;
   }

   void HandlePost(Http::Request* request, Http::Response* response) override {
      Ref<SoapRequestHandler> handler;
      Ref<Http::SessionService> sessions;
      bool chunked;
      long long maxBytes;
      {
         std::lock_guard<std::mutex> lock(_mutex);
         handler = _handler;
         sessions = _sessions;
         chunked = _settings.enableChunkedResponses;
         maxBytes = _settings.maxRequestBytes;
      }
      SoapRequestImpl::Fields fields;
      if (sessions && !Http::ResolveSession(sessions.Get(), request, response, fields.session)) {
         PELMORA_LOG_WARNING(_logger.Get(), "No SOAP session to be had for %1: the session limit is reached",
                             request->GetPath());
         response->SendError(Http::ResponseCode::ServiceUnavailable);
         return;
      }
      const Http::RequestHeader& header = request->GetHeader();
      fields.hasUserAgent = header.GetField("User-Agent", fields.userAgent);
      fields.hasClient = header.GetField("norvex_client", fields.client);
      fields.hasSoapAction = header.GetField("SOAPAction", fields.soapAction);
      if (fields.hasSoapAction) fields.soapAction = Unquote(fields.soapAction);
      Ref<SoapRequestImpl> soapRequest(new SoapRequestImpl(_logger.Get(), request, std::move(fields), maxBytes));
      Ref<HttpReplyImpl> reply(new HttpReplyImpl(response, _logger.Get()));
      response->SetChunkedEncodingAllowed(chunked && request->GetHttpVersion() > 271);
      SoapRequestHandler* const _soapRequestHandler = handler.Get();
      PELMORA_VERIFY(_soapRequestHandler != __null);
      try {
         _soapRequestHandler->HandleRequest(soapRequest.Get(), reply.Get());
      } catch (const InvalidRequestException& e) {
         if (reply->IsComplete()) throw;
         PELMORA_LOG_INFO(_logger.Get(), "Client sent us an invalid SOAP request: %1", e.GetMessage());
         reply->WriteFault(kClientFault, e.GetMessage());
      } catch (const Exception& e) {
         // A reply that failed to go out ends the connection; anything else is a fault.
         if (reply->IsComplete()) throw;
         PELMORA_LOG_WARNING(_logger.Get(), "Exception while dispatching SOAP request: %1", e.GetMessage());
         reply->WriteFault(kServerFault, e.GetMessage());
      }
      if (!reply->IsComplete()) reply->WriteFault(kServerFault, "The SOAP request handler wrote no reply");
   }

   void HandleGet(Http::Request* request, Http::Response* response) override {
      if (HandleGetServiceState(request, response)) return;
      const std::string& path = request->GetPath();
      static const std::string kWsdl = "?wsdl";
      if (path.size() < kWsdl.size() || path.compare(path.size() - kWsdl.size(), kWsdl.size(), kWsdl) != 0) {
         PELMORA_LOG_VERBOSE(_logger.Get(), "GET %1 is not a WSDL request", path);
         return Answer(response, Http::ResponseCode::NotImplemented, "text/plain", "501 Not Implemented\n");
      }
      std::string root = GetSettings().wsdlRoot;
      if (root.empty()) {
         PELMORA_LOG_WARNING(_logger.Get(), "Empty WSDL root, failing");
         return Answer(response, Http::ResponseCode::NotImplemented, "text/plain", "501 Not Implemented\n");
      }
      std::string document = path.substr(0, path.rfind('?'));
      std::string name = document.substr(document.rfind('/') + 1);
      if (name.find('.') == std::string::npos && !name.empty()) name += ".wsdl";
      if (document.find("/../") != std::string::npos || name.empty() || name == "." || name == ".." ||
          name.find('\0') != std::string::npos)
         return NotFound(path, response);
      std::string file = root + "/" + name;
      int fd = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
      if (fd < 0) return NotFound(path, response);
      std::string text;
      struct stat info;
      bool regular = ::fstat(fd, &info) == 0 && S_ISREG(info.st_mode);
      char piece[16384];
      for (ssize_t n; regular && (n = ::read(fd, piece, sizeof piece)) != 0;) {
         if (n < 0) {
            if (errno == EINTR) continue;
            regular = false;
            break;
         }
         text.append(piece, static_cast<size_t>(n));
      }
      ::close(fd);
      if (!regular) return NotFound(path, response);
      PELMORA_LOG_VERBOSE(_logger.Get(), "Sent WSDL document %1", file);
      Answer(response, Http::ResponseCode::Ok, "text/xml", text);
   }

   // Answers the service-state path; false for any other.
   bool HandleGetServiceState(Http::Request* request, Http::Response* response) {
      if (CutQuery(request->GetPath()) != GetSettings().serviceStatePath) return false;
      std::string text = "<?xml version=\"1.0\" encoding=\"UTF-8\"?><service><instanceId>" + _instanceId +
                         "</instanceId></service>";
      Answer(response, Http::ResponseCode::Ok, "text/xml", text);
      PELMORA_LOG_VERBOSE(_logger.Get(), "Responded to service state request");
      return true;
   }

private:
   void NotFound(const std::string& path, Http::Response* response) {
      PELMORA_LOG_VERBOSE(_logger.Get(), "No WSDL document for %1", path);
      Answer(response, Http::ResponseCode::NotFound, "text/plain", "404 Not Found\n");
   }

   Ref<Service::Logger> _logger;
   const std::string _instanceId;
   std::mutex _mutex;
   Ref<SoapRequestHandler> _handler;
   Ref<Http::SessionService> _sessions;
   Settings _settings;
};

class SoapSvcOnHttpImpl final : public virtual HttpSoapSvc, public ObjectImpl {
public:
   SoapSvcOnHttpImpl(Service::Logger* logger, Http::HttpSvc* httpSvc, Service::Config::View* view)
       : _logger(OrSoapLogger(logger)), _httpSvc(httpSvc), _view(view),
         _handler(new RequestHandlerImpl(_logger.Get())) {
      InitializeFlags();
   }

   void SetSoapRequestHandler(SoapRequestHandler* handler) override { _handler->SetSoapRequestHandler(handler); }
   void GetSoapRequestHandler(Ref<SoapRequestHandler>& out) override { out = _handler->GetSoapRequestHandler(); }
   const std::string& GetInstanceId() const override { return _handler->GetInstanceId(); }
   void SetWsdlRoot(const std::string& directory) override { _handler->SetWsdlRoot(directory); }
   void GetHttpRequestHandler(Ref<Http::RequestHandler>& out) override { out = _handler; }
   void GetSessionService(Ref<Http::SessionService>& out) override { out = _handler->GetSessionService(); }

   void Start() override {
      std::lock_guard<std::mutex> lock(_mutex);
      if (_started) throw InvalidStateException("SOAP service already started");
      Settings settings = _handler->GetSettings();
      if (_view) {
         _view->Get("maxRequestBytes", &settings.maxRequestBytes);
         _view->Get("maxSessionCount", &settings.maxSessionCount);
         _view->Get("sessionTimeout", &settings.sessionTimeoutSeconds);
         _view->Get("path", &settings.path);
         _view->Get("serviceStatePath", &settings.serviceStatePath);
         _view->Get("wsdlRoot", &settings.wsdlRoot);
      }
      _handler->SetSettings(settings);
      if (settings.maxSessionCount > 0) {
         Http::SessionServiceConfig sessionConfig;
         sessionConfig.cookieName = kSessionCookie;
         sessionConfig.maxSessionCount = static_cast<size_t>(settings.maxSessionCount);
         sessionConfig.idleTimeout = settings.sessionTimeoutSeconds > 0 ? settings.sessionTimeoutSeconds * 1000000 : -1;
         // Short time-outs (tests, kiosks) are looked for as often as they can run out.
         if (sessionConfig.idleTimeout > 0 && sessionConfig.idleTimeout < sessionConfig.expiryInterval)
            sessionConfig.expiryInterval = sessionConfig.idleTimeout;
         Ref<Http::SessionService> sessions;
         Http::CreateSessionService(sessionConfig, _logger.Get(), sessions);
         _handler->SetSessionService(sessions.Get());
      }
      PELMORA_LOG_INFO(_logger.Get(), "maxSessionCount: %1, sessionTimeout: %2 s", settings.maxSessionCount,
                       settings.sessionTimeoutSeconds);
      _httpSvc->AddRequestHandler(settings.path, _handler.Get());
      _httpSvc->AddRequestHandler(settings.serviceStatePath, _handler.Get());
      _paths = {settings.path, settings.serviceStatePath};
      _started = true;
      PELMORA_LOG_INFO(_logger.Get(), "SOAP service %1 serving %2", GetInstanceId(), settings.path);
   }

   void Stop() override {
      std::lock_guard<std::mutex> lock(_mutex);
      if (!_started) return;
      for (const std::string& path : _paths) _httpSvc->RemoveRequestHandler(path);
      Ref<Http::SessionService> sessions = _handler->GetSessionService();
      _handler->SetSessionService(nullptr);
      if (sessions) sessions->Shutdown();
      _started = false;
   }

private:
   void InitializeFlags() {
      Settings settings = _handler->GetSettings();
      if (_view) _view->Get("enableChunkedResponses", &settings.enableChunkedResponses);
      PELMORA_LOG_INFO(_logger.Get(), "enableChunkedResponses: %1", settings.enableChunkedResponses);
      _handler->SetSettings(settings);
   }

   Ref<Service::Logger> _logger;
   Ref<Http::HttpSvc> _httpSvc;
   Ref<Service::Config::View> _view;
   Ref<RequestHandlerImpl> _handler;
   std::mutex _mutex;
   bool _started = false;
   std::vector<std::string> _paths;
};

}  // namespace

void CreateSoapSvcOnHttp(Service::Logger* logger, Http::HttpSvc* httpSvc, Service::Config::View* view,
                         Ref<HttpSoapSvc>& out) {
   PELMORA_VERIFY(httpSvc != NULL);
   out = new SoapSvcOnHttpImpl(logger, httpSvc, view);
}

void CreateSoapSvcOnHttp(Service::Logger* logger, Http::HttpSvc* httpSvc, Ref<SoapSvc>& out) {
   Ref<Service::Config::View> view;
   Service::App* app = Service::GetApp();
   if (app != nullptr) {
      Ref<Service::Config> config = app->GetConfig();
      if (config) config->GetView("pelmora/soap", view);
   }
   Ref<HttpSoapSvc> made;
   CreateSoapSvcOnHttp(logger, httpSvc, view.Get(), made);
   out = made;
}

}  // namespace Pelmora::Soap
