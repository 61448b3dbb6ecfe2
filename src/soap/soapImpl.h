#pragma once
// The SOAP layer's implementation classes shared by its transports: the incoming call and
// the replies for HTTP, standard output and CGI.

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "pelmora/http/request.h"
#include "pelmora/http/response.h"
#include "pelmora/soap/soapSvc.h"

namespace Pelmora::Soap {

// The request body's default cap, in bytes, where the transport sets none.
constexpr long long kDefaultMaxRequestBytes = 10LL * 1024 * 1024;

// The call, reading its body from an HTTP request or from a Reader (stdio, CGI). Reads
// past `maxBytes` (negative: no cap) fail with InvalidRequestException.
class SoapRequestImpl final : public virtual SoapRequest, public ObjectImpl {
public:
   struct Fields {
      bool hasSoapAction = false, hasUserAgent = false, hasClient = false;
      std::string soapAction, userAgent, client;
      Ref<Http::Session> session;
   };

   SoapRequestImpl(Service::Logger* logger, Http::Request* request, Fields fields, long long maxBytes);
   SoapRequestImpl(Service::Logger* logger, Reader* source, Fields fields, long long maxBytes);

   int Read(char* buffer, int length) override;
   void Close() override;
   void AsyncRead(char* buffer, int length, const ReadCallback& callback) override;
   bool GetSoapAction(std::string& out) const override;
   bool GetUserAgent(std::string& out) const override;
   bool GetNorvexClient(std::string& out) const override;
   bool GetSession(Ref<Http::Session>& out) const override;
   long long GetBytesRead() const { return _bytesRead; }

private:
   // The one pending asynchronous read.
   struct PendingRead {
      ReadCallback callback;
      bool IsNull() const { return !callback; }
   };

   // Counts `n` placed bytes against the cap; -1 for the end of the body.
   int Account(int n);

   Ref<Service::Logger> _logger;
   Ref<Http::Request> _request;
   Ref<Reader> _source;
   Fields _fields;
   long long _maxBytes;
   long long _bytesRead = 0;
   bool _ended = false;
   PendingRead _asyncReadFunctor;
};

// Writes the reply text into a response: status 200 for a reply, 500 for a fault.
class HttpReplyImpl final : public virtual Reply, public ObjectImpl {
public:
   HttpReplyImpl(Http::Response* response, Service::Logger* logger);
   void WriteReply(const Xml::Node* body) override;
   void WriteFault(FaultCode code, const std::string& message, const std::string& actor = std::string(),
                   Xml::Node* detail = nullptr) override;
   void Reset() override;
   bool IsComplete() const override { return _complete; }

private:
   void Send(const Xml::Node* body, const Http::ResponseCode::Info& status);

   Ref<Http::Response> _response;
   Ref<Service::Logger> _logger;
   bool _complete = false;
};

// Writes whole answers to a file descriptor (standard output), retrying short writes.
// SystemException when the descriptor fails.
void WriteAll(int fd, const char* data, size_t length);

// Writes the envelope to a file descriptor, nothing else.
class StdioReply final : public virtual Reply, public ObjectImpl {
public:
   explicit StdioReply(Service::Logger* logger, int fd = 1);
   void WriteReply(const Xml::Node* body) override;
   void WriteFault(FaultCode code, const std::string& message, const std::string& actor = std::string(),
                   Xml::Node* detail = nullptr) override;
   void Reset() override {}
   bool IsComplete() const override { return _complete; }
   bool WasFault() const { return _fault; }

private:
   void Send(const Xml::Node* body);

   Ref<Service::Logger> _logger;
   int _fd;
   bool _complete = false;
   bool _fault = false;
};

// A CGI answer: "Status:" line, header lines, an empty line and the body.
std::string FormatCgiAnswer(const Http::ResponseCode::Info& status,
                            const std::vector<std::pair<std::string, std::string>>& headers,
                            const std::string& contentType, const std::string& body);

class CgiReply final : public virtual Reply, public ObjectImpl {
public:
   explicit CgiReply(Service::Logger* logger, int fd = 1);
   void WriteReply(const Xml::Node* body) override;
   void WriteFault(FaultCode code, const std::string& message, const std::string& actor = std::string(),
                   Xml::Node* detail = nullptr) override;
   void Reset() override;
   bool IsComplete() const override { return _complete; }
   bool WasFault() const { return _status == &Http::ResponseCode::InternalServerError; }
   // Writes the status line, the headers, the content type, an empty line and the body.
   void CompleteResponse();

private:
   void Prepare(const Xml::Node* body, const Http::ResponseCode::Info& status);

   Ref<Service::Logger> _logger;
   int _fd;
   const Http::ResponseCode::Info* _status = &Http::ResponseCode::Ok;
   std::string _body;
   bool _complete = false;
};

// The fault element for WriteFault, `detail`'s children moved into its detail.
void BuildFault(FaultCode code, const std::string& message, const std::string& actor, Xml::Node* detail,
                Ref<Xml::ElementNode>& out);

}  // namespace Pelmora::Soap

namespace Pelmora::Soap {

// Looks up an environment variable; null when it is not set.
using EnvironmentLookup = std::function<const char*(const char*)>;

// A service reading its one request from `inFd` and answering on `outFd`: standard
// input/output mode, or a CGI program (`cgi`) whose request comes as the environment
// `environment` describes.
void CreateStdinSoapSvc(Service::Logger* logger, bool cgi, int inFd, int outFd, EnvironmentLookup environment,
                        Ref<StdinSoapSvc>& out);

}  // namespace Pelmora::Soap
