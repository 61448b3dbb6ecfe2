#pragma once
// SOAP 1.1 envelopes: the namespaces, the exceptions for requests and replies that are
// not valid SOAP, and the parsing of an envelope from untrusted input. Parsing uses the
// process's shared parser pool with restricted parses (the XML document limits apply and
// entity definitions are refused). Thread-safe.

#include <string>

#include "pelmora/exception/throwable.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/service/logger.h"
#include "pelmora/xml/node.h"

namespace Pelmora::Soap {

inline constexpr const char* kEnvelopeNamespace = "http://schemas.xmlsoap.org/soap/envelope/";
inline constexpr const char* kEncodingNamespace = "http://schemas.xmlsoap.org/soap/encoding/";
inline constexpr const char* kSchemaNamespace = "http://www.w3.org/2001/XMLSchema";
inline constexpr const char* kSchemaInstanceNamespace = "http://www.w3.org/2001/XMLSchema-instance";

// A request that is not valid SOAP: malformed or refused XML, or a missing part.
class PELMORA_EXPORT InvalidRequestException : public Exception {
public:
   explicit InvalidRequestException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(InvalidRequestException)
};

// A reply (read by a client) that is not valid SOAP.
class PELMORA_EXPORT InvalidResponseException : public Exception {
public:
   explicit InvalidResponseException(const std::string& message) : Exception(message) {}
   PELMORA_EXCEPTION_CLONE(InvalidResponseException)
};

// Reads `reader` to its end and returns the envelope element. InvalidRequestException
// "Invalid SOAP request at line number <line>, <parser's text>" for XML that does not
// parse or is refused (entity definitions, document limits), "Missing SOAP Envelope
// element" when the root is not a SOAP 1.1 Envelope. A reader's own failure passes.
PELMORA_EXPORT void ParseSoapEnvelope(Service::Logger* logger, Reader* reader, Ref<Xml::ElementNode>& out);

// The envelope's "Header" child (null when absent) and the first element inside "Body".
// InvalidRequestException as ParseSoapEnvelope, and "SOAP envelope missing Body element"
// and "SOAP Body is empty".
PELMORA_EXPORT void ParseSoapBody(Service::Logger* logger, Reader* reader, Ref<Xml::ElementNode>& header,
                                  Ref<Xml::ElementNode>& body);

// Writes the reply envelope around `body` (null: an empty Body) as sent on every transport.
PELMORA_EXPORT void WriteSoapEnvelope(const Xml::Node* body, Writer* writer);

}  // namespace Pelmora::Soap
