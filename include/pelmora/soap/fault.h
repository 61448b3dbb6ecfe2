#pragma once
// SOAP 1.1 faults: building a Fault element for a reply and reading one back. The code's
// text is deliberately its name ("ClientFaultCode"), not a qualified SOAP code; reading
// also accepts the qualified codes other servers send. Plain functions; thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/soap/envelope.h"
#include "pelmora/xml/node.h"

namespace Pelmora::Soap {

enum FaultCode : int {
   kClientFault = 0,
   kServerFault = 1,
   kMustUnderstandFault = 2,
   kVersionMismatchFault = 3,
};

// "ClientFaultCode", "ServerFaultCode", "MustUnderstandFaultCode",
// "VersionMismatchFaultCode"; InvalidArgumentException for a value outside the four.
PELMORA_EXPORT const char* GetFaultCodeName(FaultCode code);

// "soapenv:Fault" holding "faultcode", "faultstring", "faultactor" (only when `actor` is
// not empty) and an empty "detail", in that order.
PELMORA_EXPORT void CreateFaultNode(FaultCode code, const std::string& message, const std::string& actor,
                                    Ref<Xml::ElementNode>& out);
PELMORA_EXPORT void CreateFaultNode(FaultCode code, const std::string& message, Ref<Xml::ElementNode>& out);
// An empty "detail" element for the caller's detail content.
PELMORA_EXPORT void CreateDetailNode(Ref<Xml::ElementNode>& out);
// The "detail" child of a fault made by CreateFaultNode (or parsed), null when absent.
PELMORA_EXPORT Xml::ElementNode* GetDetailNode(Xml::ElementNode* fault);

// Reads a Fault element (anything else is a panic) into its code, message and actor
// (empty when absent). InvalidResponseException "Invalid SOAP fault: ..." when the code
// or the message is missing or the code is unknown.
PELMORA_EXPORT void ParseFaultNode(Xml::ElementNode* fault, FaultCode& code, std::string& message,
                                   std::string& actor);
PELMORA_EXPORT void ParseFaultNode(Xml::ElementNode* fault, FaultCode& code, std::string& message);

}  // namespace Pelmora::Soap
