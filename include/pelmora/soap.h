#pragma once
// SOAP 1.1 services over HTTP, standard input/output and CGI: envelopes, faults, body
// handlers and replies.

#include "pelmora/soap/envelope.h"
#include "pelmora/soap/fault.h"
#include "pelmora/soap/soapSvc.h"
