#pragma once
// What the connection asks of the session service's responses.

#include <string>

#include "pelmora/http/response.h"

namespace Pelmora::Http {

// Whether the connection should wait for the next request under the authenticated
// time-outs: the handler asked for them, or the response carries a session marked
// authenticated.
bool IsAuthenticatedResponse(Response* response);

// Whether `text` has the shape of a session id: 32 lower-case hex digits.
bool IsSessionIdShape(const std::string& text);

}  // namespace Pelmora::Http
