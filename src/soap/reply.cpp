// Replies: the envelope text written into an HTTP response, to standard output, or as a
// CGI answer.

#include <unistd.h>

#include <cerrno>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logMacros.h"
#include "src/soap/soapImpl.h"
#include "src/soap/soapLog.h"

namespace Pelmora::Soap {

namespace {

constexpr char kXmlContentType[] = "text/xml";
constexpr char kCharset[] = "utf-8";

// Collects serialised text; cheaper than a general string writer for one reply.
class TextTarget final : public virtual Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override { text.append(data, static_cast<size_t>(length)); }
   void Close() override {}
   std::string text;
};

std::string EnvelopeText(const Xml::Node* body) {
   Ref<TextTarget> target(new TextTarget());
   target->text.reserve(2048);
   WriteSoapEnvelope(body, target.Get());
   return std::move(target->text);
}

void CheckNotComplete(bool complete) {
   if (complete) throw InvalidStateException("SOAP reply already written");
}

}  // namespace

void BuildFault(FaultCode code, const std::string& message, const std::string& actor, Xml::Node* detail,
                Ref<Xml::ElementNode>& out) {
   CreateFaultNode(code, message, actor, out);
   if (detail == nullptr) return;
   Xml::ElementNode* target = GetDetailNode(out.Get());
   while (Xml::Node* child = detail->GetFirstChild()) {
      Ref<Xml::Node> moved(child);
      detail->RemoveChild(child);
      target->AppendChild(moved.Get());
   }
}

// ---- HTTP ----

HttpReplyImpl::HttpReplyImpl(Http::Response* response, Service::Logger* logger)
    : _response(response), _logger(OrSoapLogger(logger)) {
   Reset();
}

void HttpReplyImpl::Reset() {
   _response->SetStatusCode(Http::ResponseCode::Ok);
   _response->GetHeader().SetContentType(kXmlContentType, kCharset);
}

void HttpReplyImpl::Send(const Xml::Node* body, const Http::ResponseCode::Info& status) {
   CheckNotComplete(_complete);
   std::string text = EnvelopeText(body);
   _complete = true;
   PELMORA_LOG_TRIVIA(_logger.Get(), "Soap reply body:\n%1", text);
   try {
      _response->SetStatusCode(status);
      _response->Write(text.data(), static_cast<int>(text.size()));
      _response->Complete();
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(_logger.Get(), "Failed to write reply to connection; %1", e.GetMessage());
      throw;
   }
}

void HttpReplyImpl::WriteReply(const Xml::Node* body) { Send(body, Http::ResponseCode::Ok); }

void HttpReplyImpl::WriteFault(FaultCode code, const std::string& message, const std::string& actor,
                               Xml::Node* detail) {
   CheckNotComplete(_complete);
   Ref<Xml::ElementNode> fault;
   BuildFault(code, message, actor, detail, fault);
   Send(fault.Get(), Http::ResponseCode::InternalServerError);
}

// ---- standard output ----

void WriteAll(int fd, const char* data, size_t length) {
   while (length > 0) {
      ssize_t n = ::write(fd, data, length);
      if (n < 0) {
         if (errno == EINTR) continue;
         throw SystemException(errno);
      }
      data += n;
      length -= static_cast<size_t>(n);
   }
}

StdioReply::StdioReply(Service::Logger* logger, int fd) : _logger(OrSoapLogger(logger)), _fd(fd) {}

void StdioReply::Send(const Xml::Node* body) {
   CheckNotComplete(_complete);
   std::string text = EnvelopeText(body);
   _complete = true;
   PELMORA_LOG_TRIVIA(_logger.Get(), "Soap reply body:\n%1", text);
   PELMORA_LOG_VERBOSE(_logger.Get(), "Write %1 bytes", static_cast<long long>(text.size()));
   try {
      WriteAll(_fd, text.data(), text.size());
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(_logger.Get(), "Failed to write reply to connection; %1", e.GetMessage());
      throw;
   }
   PELMORA_LOG_VERBOSE(_logger.Get(), "Wrote %1", static_cast<long long>(text.size()));
}

void StdioReply::WriteReply(const Xml::Node* body) { Send(body); }

void StdioReply::WriteFault(FaultCode code, const std::string& message, const std::string& actor,
                            Xml::Node* detail) {
   CheckNotComplete(_complete);
   Ref<Xml::ElementNode> fault;
   BuildFault(code, message, actor, detail, fault);
   _fault = true;
   Send(fault.Get());
}

// ---- CGI ----

std::string FormatCgiAnswer(const Http::ResponseCode::Info& status,
                            const std::vector<std::pair<std::string, std::string>>& headers,
                            const std::string& contentType, const std::string& body) {
   std::string text = "Status: " + std::to_string(status.code) + " " + status.reasonPhrase + "\r\n";
   for (const auto& [name, value] : headers) text += name + ": " + value + "\r\n";
   text += "Content-Type: " + contentType + "\r\n\r\n";
   text += body;
   return text;
}

CgiReply::CgiReply(Service::Logger* logger, int fd) : _logger(OrSoapLogger(logger)), _fd(fd) {}

void CgiReply::Reset() {
   _status = &Http::ResponseCode::Ok;
   _body.clear();
}

void CgiReply::Prepare(const Xml::Node* body, const Http::ResponseCode::Info& status) {
   CheckNotComplete(_complete);
   _body = EnvelopeText(body);
   _status = &status;
   PELMORA_LOG_TRIVIA(_logger.Get(), "Soap reply body:\n%1", _body);
   CompleteResponse();
}

void CgiReply::CompleteResponse() {
   CheckNotComplete(_complete);
   _complete = true;
   std::string text = FormatCgiAnswer(*_status, {{"Content-Length", std::to_string(_body.size())}},
                                      std::string(kXmlContentType) + "; charset=" + kCharset, _body);
   try {
      WriteAll(_fd, text.data(), text.size());
   } catch (const Exception& e) {
      PELMORA_LOG_WARNING(_logger.Get(), "Failed to write reply to connection; %1", e.GetMessage());
      throw;
   }
}

void CgiReply::WriteReply(const Xml::Node* body) { Prepare(body, Http::ResponseCode::Ok); }

void CgiReply::WriteFault(FaultCode code, const std::string& message, const std::string& actor,
                          Xml::Node* detail) {
   CheckNotComplete(_complete);
   Ref<Xml::ElementNode> fault;
   BuildFault(code, message, actor, detail, fault);
   Prepare(fault.Get(), Http::ResponseCode::InternalServerError);
}

}  // namespace Pelmora::Soap
