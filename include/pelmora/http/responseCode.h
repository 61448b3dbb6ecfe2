#pragma once
// The HTTP status codes this library sends and recognises: one read-only Info per code,
// a map from code to Info built during static initialisation, and a formatter that prints
// an Info as "code reason". Everything here is constant after start-up; thread-safe.

#include <cstdint>
#include <map>

#include "pelmora/formatter/printFormatter.h"
#include "pelmora/object/export.h"

namespace Pelmora::Http::ResponseCode {

// A status code and its reason phrase as sent on the status line. Constant-initialised,
// so other static initialisers may use the named rows.
struct PELMORA_EXPORT Info {
   int32_t code;
   const char* reasonPhrase;

   int32_t GetCode() const { return code; }
   const char* GetReasonPhrase() const { return reasonPhrase; }
};

extern PELMORA_EXPORT const Info Continue;
extern PELMORA_EXPORT const Info SwitchingProtocols;
extern PELMORA_EXPORT const Info Ok;
extern PELMORA_EXPORT const Info Created;
extern PELMORA_EXPORT const Info Accepted;
extern PELMORA_EXPORT const Info NonAuthoritativeInformation;
extern PELMORA_EXPORT const Info NoContent;
extern PELMORA_EXPORT const Info ResetContent;
extern PELMORA_EXPORT const Info PartialContent;
extern PELMORA_EXPORT const Info MultipleChoices;
extern PELMORA_EXPORT const Info MovedPermanently;
extern PELMORA_EXPORT const Info Found;
extern PELMORA_EXPORT const Info SeeOther;
extern PELMORA_EXPORT const Info NotModified;
extern PELMORA_EXPORT const Info UseProxy;
extern PELMORA_EXPORT const Info TemporaryRedirect;
extern PELMORA_EXPORT const Info BadRequest;
extern PELMORA_EXPORT const Info Unauthorized;
extern PELMORA_EXPORT const Info PaymentRequired;
extern PELMORA_EXPORT const Info Forbidden;
extern PELMORA_EXPORT const Info NotFound;
extern PELMORA_EXPORT const Info MethodNotAllowed;
extern PELMORA_EXPORT const Info NotAcceptable;
extern PELMORA_EXPORT const Info ProxyAuthorizationRequired;
extern PELMORA_EXPORT const Info RequestTimeout;
extern PELMORA_EXPORT const Info Conflict;
extern PELMORA_EXPORT const Info Gone;
extern PELMORA_EXPORT const Info LengthRequired;
extern PELMORA_EXPORT const Info PreconditionFailed;
extern PELMORA_EXPORT const Info RequestEntityTooLarge;
extern PELMORA_EXPORT const Info RequestURITooLong;
extern PELMORA_EXPORT const Info UnsupportedMediaType;
extern PELMORA_EXPORT const Info RequestedRangeNotSatisfiable;
extern PELMORA_EXPORT const Info ExpectationFailed;
extern PELMORA_EXPORT const Info InternalServerError;
extern PELMORA_EXPORT const Info NotImplemented;
extern PELMORA_EXPORT const Info BadGateway;
extern PELMORA_EXPORT const Info ServiceUnavailable;
extern PELMORA_EXPORT const Info GatewayTimeout;
extern PELMORA_EXPORT const Info HttpVersionNotSupported;

using StatusCodeMap = std::map<int32_t, const Info*>;
// Every row above by its code; read-only once static initialisation is over.
extern PELMORA_EXPORT const StatusCodeMap sCodeMap;

// Prints an Info as its code, a space and its reason phrase ("404 Not Found").
class PELMORA_EXPORT Formatter : public PrintFormatter {
public:
   Formatter(const Info& info, const char* option = nullptr);
   static void FormatInfo(Writer* writer, const FormatValue& value, const char* option);
};

}  // namespace Pelmora::Http::ResponseCode

namespace Pelmora::Http {

// The Info for `code`; NotFoundException for a code outside the table.
PELMORA_EXPORT const ResponseCode::Info& GetResponseCodeInfo(int code);

}  // namespace Pelmora::Http
