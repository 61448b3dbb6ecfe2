#pragma once
// HTTP/1.x messages: status codes, headers and cookies, the server's request reader and
// response writer, chunked decoding, URL and URI functions and HTML escaping.

#include "pelmora/http/chunkStreamDecoder.h"
#include "pelmora/http/cookie.h"
#include "pelmora/http/header.h"
#include "pelmora/http/request.h"
#include "pelmora/http/response.h"
#include "pelmora/http/responseCode.h"
#include "pelmora/http/url.h"

// The server: service, request handlers and the document handler.
#include "pelmora/http/documentHandler.h"
#include "pelmora/http/httpSvc.h"
#include "pelmora/http/prometheusHandler.h"
#include "pelmora/http/session.h"
