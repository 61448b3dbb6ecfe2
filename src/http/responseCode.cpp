#include "pelmora/http/responseCode.h"

#include <string>

#include "pelmora/exception/exceptions.h"

namespace Pelmora::Http::ResponseCode {

// The phrases go on the wire exactly as written here; clients of the product family
// match some of them, odd spellings included.
const Info Continue{100, "Continue"};
const Info SwitchingProtocols{101, "Switching Protocols"};
const Info Ok{200, "OK"};
const Info Created{201, "Created"};
const Info Accepted{202, "Accepted"};
const Info NonAuthoritativeInformation{203, "Non-Authoritative Information"};
const Info NoContent{204, "No Content"};
const Info ResetContent{205, "Reset Content"};
const Info PartialContent{206, "Partial Content"};
const Info MultipleChoices{300, "Multiple Choices"};
const Info MovedPermanently{301, "Moved Permanently"};
const Info Found{302, "Found"};
const Info SeeOther{303, "See Other"};
const Info NotModified{304, "Not Modified"};
const Info UseProxy{305, "Use Proxy"};
const Info TemporaryRedirect{307, "Temporary Redirect"};
const Info BadRequest{400, "Bad Request"};
const Info Unauthorized{401, "Unauthorized"};
const Info PaymentRequired{402, "Payment Required"};
const Info Forbidden{403, "Forbidden"};
const Info NotFound{404, "Not Found"};
const Info MethodNotAllowed{405, "Method Not Allowed"};
const Info NotAcceptable{406, "Not Acceptable"};
const Info ProxyAuthorizationRequired{407, "Proxy Authorization Required"};
const Info RequestTimeout{408, "Request Timeout"};
const Info Conflict{409, "Conflict"};
const Info Gone{410, "Gone"};
const Info LengthRequired{411, "Length Required"};
const Info PreconditionFailed{412, "Precondition Failed"};
const Info RequestEntityTooLarge{413, "Request Entity Too Large"};
const Info RequestURITooLong{414, "Request URI Too Long"};
const Info UnsupportedMediaType{415, "Unsuppored Media Type"};
const Info RequestedRangeNotSatisfiable{416, "Requested Range Not Satisfiable"};
const Info ExpectationFailed{417, "Expectation Failed"};
const Info InternalServerError{500, "Internal Server Error"};
const Info NotImplemented{501, "Not Implemented"};
const Info BadGateway{502, "Bad Gateway"};
const Info ServiceUnavailable{503, "Service Unavailable"};
const Info GatewayTimeout{504, "Gateway Timeout"};
const Info HttpVersionNotSupported{505, "HTTP Version Not Supported"};

namespace {

StatusCodeMap BuildCodeMap() {
   StatusCodeMap map;
   for (const Info* info :
        {&Continue, &SwitchingProtocols, &Ok, &Created, &Accepted, &NonAuthoritativeInformation,
         &NoContent, &ResetContent, &PartialContent, &MultipleChoices, &MovedPermanently, &Found,
         &SeeOther, &NotModified, &UseProxy, &TemporaryRedirect, &BadRequest, &Unauthorized,
         &PaymentRequired, &Forbidden, &NotFound, &MethodNotAllowed, &NotAcceptable,
         &ProxyAuthorizationRequired, &RequestTimeout, &Conflict, &Gone, &LengthRequired,
         &PreconditionFailed, &RequestEntityTooLarge, &RequestURITooLong, &UnsupportedMediaType,
         &RequestedRangeNotSatisfiable, &ExpectationFailed, &InternalServerError, &NotImplemented,
         &BadGateway, &ServiceUnavailable, &GatewayTimeout, &HttpVersionNotSupported}) {
      map.emplace(info->code, info);
   }
   return map;
}

}  // namespace

const StatusCodeMap sCodeMap = BuildCodeMap();

Formatter::Formatter(const Info& info, const char* option)
   : PrintFormatter(FormatValue{.pointer = &info}, option, FormatInfo) {}

void Formatter::FormatInfo(Writer* writer, const FormatValue& value, const char*) {
   const Info* info = static_cast<const Info*>(value.pointer);
   std::string text = std::to_string(info->code);
   text += ' ';
   text += info->reasonPhrase;
   writer->Write(text.data(), static_cast<int>(text.size()));
}

}  // namespace Pelmora::Http::ResponseCode

namespace Pelmora::Http {

const ResponseCode::Info& GetResponseCodeInfo(int code) {
   auto found = ResponseCode::sCodeMap.find(code);
   if (found == ResponseCode::sCodeMap.end()) {
      throw NotFoundException("GetResponseCodeInfo: code = " + std::to_string(code));
   }
   return *found->second;
}

}  // namespace Pelmora::Http
