#pragma once
// The XML parser turns text from a string or a Reader into a document, with expat as the
// tokeniser. A parser forwards expat's events to an exchangeable XMLHandler; the standard
// handler builds a Document and, for restricted (untrusted) input, enforces size, node and
// depth limits. A restricted parse also refuses entity declarations. A parser and its
// handler serve one parse at a time and are not locked; the pool is thread-safe.

#include <string>

#include "pelmora/object/export.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Xml {

// Malformed input, a stopped parse or a refused entity: expat's text and the line.
class PELMORA_EXPORT XMLParseException : public Exception {
public:
   XMLParseException(const std::string& message, int line) : Exception(message), _line(line) {}
   int GetLineNumber() const { return _line; }
   PELMORA_EXCEPTION_CLONE(XMLParseException)

private:
   int _line;
};

// Thrown by a handler to stop the parse once it has logged why; callers of Parse see an
// XMLParseException.
class PELMORA_EXPORT ParsingAbortedException : public Exception {
public:
   ParsingAbortedException() : Exception(std::string()) {}
   PELMORA_EXCEPTION_CLONE(ParsingAbortedException)
};

// Receives a parse's events. Names arrive as written (prefix, ":", local name): expat does
// no namespace processing. An exception thrown from an event stops the parse.
class PELMORA_EXPORT XMLHandler : public virtual Object {
public:
   virtual void OnProcessingInstruction(const std::string& target, const std::string& data) = 0;
   // `attributes` as expat gives them: name, value, name, value, ..., then null.
   virtual void OnStartElement(const std::string& name, int line, int column,
                               const char** attributes) = 0;
   virtual void OnEndElement(const std::string& name) = 0;
   virtual void OnStartCData() = 0;
   virtual void OnEndCData() = 0;
   virtual void OnComment(const std::string& text) = 0;
   // Character data may come in several pieces (expat splits at line ends and references).
   virtual void OnCharacters(const char* data, int length) = 0;
   // Absent version or encoding as empty strings; `standalone` -1 when absent, else 0 or 1.
   virtual void OnXMLDeclaration(const std::string& version, const std::string& encoding,
                                 int standalone) = 0;
   // Begins a document; `result` is what Parse hands to its caller. The one-argument form
   // begins an unrestricted document.
   virtual void StartNewDocument(Ref<Object>& result) = 0;
   virtual void StartNewDocument(bool restricted, Ref<Object>& result) = 0;
   // Runs when a parse ends, whichever way: drops what the handler still holds of it.
   virtual void CleanUpDocument() = 0;
};

class PELMORA_EXPORT XMLParser : public virtual Object {
public:
   // The parser holds a reference to `handler`; null is a panic.
   virtual void SetXMLHandler(XMLHandler* handler) = 0;
   virtual XMLHandler* GetXMLHandler() = 0;
   // Reads to the end of `reader` and hands over the handler's result (the Document, with
   // the standard handler). XMLParseException for bad or refused input; exceptions of the
   // reader pass through unchanged. The parser is ready for the next document either way.
   virtual void Parse(Reader* reader, bool restricted, Ref<Object>& result) = 0;
   virtual void Parse(const std::string& text, bool restricted, Ref<Object>& result) = 0;
   // Unrestricted.
   virtual void Parse(Reader* reader, Ref<Object>& result) = 0;
   virtual void Parse(const std::string& text, Ref<Object>& result) = 0;
};

// Reusable parsers for servers that parse on many threads. A lease holds one parser and a
// reference to its pool; when the last reference to the lease goes, on whatever thread,
// the parser returns to the pool. Idle parsers are kept until the pool dies. Thread-safe.
class PELMORA_EXPORT XMLParserPool : public virtual Object {
public:
   class ParserLease : public virtual Object {
   public:
      virtual XMLParser* GetParser() const = 0;
   };

   // An idle parser, or a new one with a new standard document handler.
   virtual void GetParserLease(Ref<ParserLease>& out) = 0;
   virtual void ReturnParser(XMLParser* parser) = 0;
};

// The limits the standard handler enforces on restricted documents; a count fails only
// when strictly greater than its limit. A handler takes them when it is created. Handlers
// made without explicit limits (the pool's included) take the process's default limits,
// which the configuration keys named below set (Service::LoadXmlDocLimits); each missing
// key gives the default shown.
struct PELMORA_EXPORT DocLimits {
   // "pelmora/xml/doc/maxChars": bytes of names, attribute names and values, character
   // data, comments and processing instructions in one document.
   long long maxChars = 2147483648LL;
   // "pelmora/xml/doc/maxNodes": elements, text nodes, comments, processing instructions
   // and CDATA sections in one document.
   long long maxNodes = 2097152;
   // "pelmora/xml/doc/maxDepth": nodes open at one time, the document itself counting.
   long long maxDepth = 8192;
};

// `handler` must not be null (panic).
PELMORA_EXPORT void CreateXMLParser(XMLHandler* handler, Ref<XMLParser>& out);
// The standard handler, building a Document under the configured limits.
PELMORA_EXPORT void CreateXMLDocumentHandler(Ref<XMLHandler>& out);
// Under explicit limits; a negative one is a panic.
PELMORA_EXPORT void CreateXMLDocumentHandler(const DocLimits& limits, Ref<XMLHandler>& out);
PELMORA_EXPORT void CreateXMLParserPool(Ref<XMLParserPool>& out);
// The limits of handlers made without explicit ones from now on; a negative one is a panic.
PELMORA_EXPORT void SetDefaultDocLimits(const DocLimits& limits);
PELMORA_EXPORT DocLimits GetDefaultDocLimits();

// The process-wide pool; alive until exit.
PELMORA_EXPORT XMLParserPool* GetXmlParserPool();

}  // namespace Pelmora::Xml
