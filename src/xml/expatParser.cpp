// The glue to expat: one expat parser per XMLParser, reset before every document, fed in
// fixed blocks; its callbacks forwarded to the handler under a guard, since no exception
// may cross expat's C frames. Entity declarations are refused in restricted parses.

#include <expat.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <climits>
#include <cstddef>
#include <random>
#include <type_traits>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/readers.h"
#include "pelmora/xml/parser.h"
#include "src/xml/documentEvents.h"
#include "src/xml/xmlLog.h"

namespace Pelmora::Xml {
namespace {

unsigned long NewHashSalt() {
   std::random_device source;
   unsigned long salt = source();
   if constexpr (sizeof(salt) > sizeof(unsigned)) salt = (salt << 32) ^ source();
   return salt;
}

// Expat's memory, counted per parser: a parser that grew for one huge token (a start tag
// of many attributes) keeps that memory through a reset, so it is made anew instead.
struct ExpatMemory {
   std::atomic<size_t> bytes{0};
};

// The parser whose expat calls this thread is making; expat's allocation functions take
// no context of their own.
thread_local ExpatMemory* t_expatMemory = nullptr;

// Makes `memory` the one this thread's expat allocations are counted in, for a scope.
class CountExpatMemory {
public:
   explicit CountExpatMemory(ExpatMemory* memory) : _saved(t_expatMemory) {
      t_expatMemory = memory;
   }
   ~CountExpatMemory() { t_expatMemory = _saved; }
   CountExpatMemory(const CountExpatMemory&) = delete;
   CountExpatMemory& operator=(const CountExpatMemory&) = delete;

private:
   ExpatMemory* const _saved;
};

// Before each block: who counted it and its size; as large as malloc's alignment.
struct alignas(alignof(std::max_align_t)) BlockHeader {
   ExpatMemory* owner;
   size_t size;
};

void* ExpatMalloc(size_t size) {
   auto* header = static_cast<BlockHeader*>(malloc(sizeof(BlockHeader) + size));
   if (!header) return nullptr;
   header->owner = t_expatMemory;
   header->size = size;
   if (header->owner) header->owner->bytes.fetch_add(size, std::memory_order_relaxed);
   return header + 1;
}

void ExpatFree(void* block) {
   if (!block) return;
   BlockHeader* header = static_cast<BlockHeader*>(block) - 1;
   if (header->owner) header->owner->bytes.fetch_sub(header->size, std::memory_order_relaxed);
   free(header);
}

void* ExpatRealloc(void* block, size_t size) {
   if (!block) return ExpatMalloc(size);
   BlockHeader* header = static_cast<BlockHeader*>(block) - 1;
   ExpatMemory* owner = header->owner;
   size_t old = header->size;
   auto* moved = static_cast<BlockHeader*>(realloc(header, sizeof(BlockHeader) + size));
   if (!moved) return nullptr;
   moved->size = size;
   if (owner) {
      owner->bytes.fetch_add(size, std::memory_order_relaxed);
      owner->bytes.fetch_sub(old, std::memory_order_relaxed);
   }
   return moved + 1;
}

const XML_Memory_Handling_Suite kExpatMemorySuite = {ExpatMalloc, ExpatRealloc, ExpatFree};

// Expat's memory a parser may keep between documents; above it the parser is made anew.
constexpr size_t kKeptExpatBytes = 1 << 20;

// Bytes read from the reader and handed to expat at a time.
constexpr int kBlockSize = 10240;
// Bytes of a text parse handed to expat at a time, so that one call stays bounded.
constexpr size_t kTextSliceSize = 64 * 1024;

class XMLParserImpl final : public virtual XMLParser, public ObjectImpl {
public:
   explicit XMLParserImpl(XMLHandler* handler) {
      SetXMLHandler(handler);
      _parser = NewExpatParser();
      if (!_parser) System::ThrowSystemMemoryException();
      InstallCallbacks();
   }

   ~XMLParserImpl() override {
      CountExpatMemory count(&_memory);
      XML_ParserFree(_parser);
   }

   void SetXMLHandler(XMLHandler* handler) override {
      PELMORA_VERIFY(handler != NULL);
      _handler = handler;
      _events = dynamic_cast<DocumentEvents*>(handler);
      // Also when a handler is exchanged during a parse: the events go to the new one.
      if (_parser) InstallCallbacks();
   }

   XMLHandler* GetXMLHandler() override { return _handler.Get(); }

   void Parse(Reader* reader, bool restricted, Ref<Object>& result) override;

   void Parse(const std::string& text, bool restricted, Ref<Object>& result) override;

   void Parse(Reader* reader, Ref<Object>& result) override { Parse(reader, false, result); }

   void Parse(const std::string& text, Ref<Object>& result) override { Parse(text, false, result); }

private:
   XML_Parser NewExpatParser() {
      CountExpatMemory count(&_memory);
      // No namespace separator: names arrive as written and the DOM splits them.
      return XML_ParserCreate_MM(nullptr, &kExpatMemorySuite, nullptr);
   }

   // After a document: a parser that grew past what it may keep is made anew (the old one
   // stays when a new one cannot be had).
   void ShedExpatMemory() noexcept {
      if (_memory.bytes.load(std::memory_order_relaxed) <= kKeptExpatBytes) return;
      XML_Parser fresh = NewExpatParser();
      if (!fresh) return;
      {
         CountExpatMemory count(&_memory);
         XML_ParserFree(_parser);
      }
      _parser = fresh;
      InstallCallbacks();
   }

   // Runs the handler's CleanUpDocument when the parse ends, whichever way.
   class CleanUpGuard {
   public:
      explicit CleanUpGuard(XMLHandler* handler) : _handler(handler) {}
      ~CleanUpGuard() {
         try {
            _handler->CleanUpDocument();
         } catch (...) {
            // Already leaving with the parse's own outcome; that one is what counts.
         }
      }
      CleanUpGuard(const CleanUpGuard&) = delete;
      CleanUpGuard& operator=(const CleanUpGuard&) = delete;

   private:
      XMLHandler* _handler;
   };

   void InstallCallbacks();
   [[noreturn]] void ThrowParseError();
   // One document: `input` hands expat the whole input through Feed.
   template <class Input>
   void ParseDocument(bool restricted, Ref<Object>& result, Input input);
   // Hands expat one piece; `last` ends the document.
   void Feed(const char* data, int length, bool last) {
      if (XML_Parse(_parser, data, length, last) != XML_STATUS_OK) ThrowParseError();
   }

   // Calls the handler; any failure stops expat, so that the pending XML_Parse fails.
   // Events expat still delivers after the stop are dropped.
   template <class Event>
   void Forward(Event&& event) noexcept {
      if (_stopped) return;
      try {
         if constexpr (std::is_invocable_v<Event, XMLHandler*>) {
            event(_handler.Get());
         } else {
            event(_events);
         }
      } catch (const ParsingAbortedException&) {
         Stop();  // the handler has logged why
      } catch (const Throwable& e) {
         LogXml(kXmlLogError, "Unexpected exception parsing XML document: %1", e);
         Stop();
      } catch (...) {
         LogXml(kXmlLogError, "Unknown exception parsing XML document");
         Stop();
      }
   }

   void Stop() {
      _stopped = true;
      XML_StopParser(_parser, XML_FALSE);
   }

   static XMLParserImpl* Self(void* userData) { return static_cast<XMLParserImpl*>(userData); }

   static void XMLCALL StartElement(void* userData, const XML_Char* name, const XML_Char** atts) {
      XMLParserImpl* self = Self(userData);
      int line = static_cast<int>(XML_GetCurrentLineNumber(self->_parser));
      int column = static_cast<int>(XML_GetCurrentColumnNumber(self->_parser));
      self->Forward([&](XMLHandler* h) { h->OnStartElement(name, line, column, atts); });
   }
   static void XMLCALL EndElement(void* userData, const XML_Char* name) {
      Self(userData)->Forward([&](XMLHandler* h) { h->OnEndElement(name); });
   }
   static void XMLCALL Characters(void* userData, const XML_Char* data, int length) {
      Self(userData)->Forward([&](XMLHandler* h) { h->OnCharacters(data, length); });
   }
   static void XMLCALL ProcessingInstruction(void* userData, const XML_Char* target,
                                             const XML_Char* data) {
      Self(userData)->Forward([&](XMLHandler* h) { h->OnProcessingInstruction(target, data); });
   }
   static void XMLCALL Comment(void* userData, const XML_Char* text) {
      Self(userData)->Forward([&](XMLHandler* h) { h->OnComment(text); });
   }
   static void XMLCALL StartCData(void* userData) {
      Self(userData)->Forward([](XMLHandler* h) { h->OnStartCData(); });
   }
   static void XMLCALL EndCData(void* userData) {
      Self(userData)->Forward([](XMLHandler* h) { h->OnEndCData(); });
   }
   // The same events for the standard handler.
   static void XMLCALL StartElementEvent(void* userData, const XML_Char* name,
                                         const XML_Char** atts) {
      XMLParserImpl* self = Self(userData);
      int line = static_cast<int>(XML_GetCurrentLineNumber(self->_parser));
      int column = static_cast<int>(XML_GetCurrentColumnNumber(self->_parser));
      self->Forward([&](DocumentEvents* e) { e->StartElement(name, line, column, atts); });
   }
   static void XMLCALL EndElementEvent(void* userData, const XML_Char*) {
      Self(userData)->Forward([](DocumentEvents* e) { e->EndElement(); });
   }
   static void XMLCALL CharactersEvent(void* userData, const XML_Char* data, int length) {
      Self(userData)->Forward([&](DocumentEvents* e) { e->Characters(data, length); });
   }
   static void XMLCALL CommentEvent(void* userData, const XML_Char* text) {
      Self(userData)->Forward([&](DocumentEvents* e) { e->Comment(text); });
   }
   static void XMLCALL StartCDataEvent(void* userData) {
      Self(userData)->Forward([](DocumentEvents* e) { e->StartCData(); });
   }
   static void XMLCALL EndCDataEvent(void* userData) {
      Self(userData)->Forward([](DocumentEvents* e) { e->EndCData(); });
   }
   static void XMLCALL XmlDeclaration(void* userData, const XML_Char* version,
                                      const XML_Char* encoding, int standalone) {
      Self(userData)->Forward([&](XMLHandler* h) {
         h->OnXMLDeclaration(version ? version : "", encoding ? encoding : "", standalone);
      });
   }
   static void XMLCALL EntityDeclaration(void* userData, const XML_Char* entityName, int,
                                         const XML_Char*, int, const XML_Char*, const XML_Char*,
                                         const XML_Char*, const XML_Char*) {
      XMLParserImpl* self = Self(userData);
      // Untrusted input may not define entities: expansion is the classic amplifier.
      if (!self->_restricted || self->_stopped) return;
      LogXml(kXmlLogError,
             "XML entity \"%1\" was defined in the input.\n"
             "The parser is configured to reject XML entity definitions.",
             entityName);
      self->Stop();
   }

   Ref<XMLHandler> _handler;
   // The handler's direct events when it is the standard handler, else null.
   DocumentEvents* _events = nullptr;
   ExpatMemory _memory;
   XML_Parser _parser = nullptr;
   bool _restricted = false;
   bool _stopped = false;
   // Drawn once per parser: left to itself, expat reads the system's entropy source again
   // for every document, a system call per request.
   unsigned long _hashSalt = NewHashSalt();
};

void XMLParserImpl::InstallCallbacks() {
   XML_SetUserData(_parser, this);
   if (_events) {
      XML_SetElementHandler(_parser, StartElementEvent, EndElementEvent);
      XML_SetCdataSectionHandler(_parser, StartCDataEvent, EndCDataEvent);
      XML_SetCommentHandler(_parser, CommentEvent);
      XML_SetCharacterDataHandler(_parser, CharactersEvent);
   } else {
      XML_SetElementHandler(_parser, StartElement, EndElement);
      XML_SetCdataSectionHandler(_parser, StartCData, EndCData);
      XML_SetCommentHandler(_parser, Comment);
      XML_SetCharacterDataHandler(_parser, Characters);
   }
   XML_SetProcessingInstructionHandler(_parser, ProcessingInstruction);
   XML_SetXmlDeclHandler(_parser, XmlDeclaration);
   XML_SetEntityDeclHandler(_parser, EntityDeclaration);
}

void XMLParserImpl::ThrowParseError() {
   const XML_LChar* text = XML_ErrorString(XML_GetErrorCode(_parser));
   throw XMLParseException(text ? text : "Unknown XML_Parse failure",
                           static_cast<int>(XML_GetCurrentLineNumber(_parser)));
}

template <class Input>
void XMLParserImpl::ParseDocument(bool restricted, Ref<Object>& result, Input input) {
   CountExpatMemory count(&_memory);
   // The reset clears the callbacks and the hash salt too.
   XML_ParserReset(_parser, nullptr);
   XML_SetHashSalt(_parser, _hashSalt);
   InstallCallbacks();
   _restricted = restricted;
   _stopped = false;

   struct Shed {
      XMLParserImpl* self;
      ~Shed() { self->ShedExpatMemory(); }
   } shed{this};
   // A handler replaced during the parse must outlive it.
   Ref<XMLHandler> handler = _handler;
   CleanUpGuard cleanUp(handler.Get());
   Ref<Object> document;
   handler->StartNewDocument(restricted, document);
   input();
   result = document;
}

void XMLParserImpl::Parse(Reader* reader, bool restricted, Ref<Object>& result) {
   PELMORA_VERIFY(reader != NULL);
   ParseDocument(restricted, result, [&] {
      char buffer[kBlockSize];
      for (;;) {
         int length = reader->Read(buffer, kBlockSize);
         bool last = length < 0;
         Feed(buffer, last ? 0 : length, last);
         if (last) break;
      }
   });
}

void XMLParserImpl::Parse(const std::string& text, bool restricted, Ref<Object>& result) {
   if (text.size() > static_cast<size_t>(INT_MAX)) throw InvalidArgumentException("text");
   // Straight from the text: no reader to make and no copy into a block buffer.
   ParseDocument(restricted, result, [&] {
      size_t offset = 0;
      do {
         size_t length = std::min(text.size() - offset, kTextSliceSize);
         Feed(text.data() + offset, static_cast<int>(length), offset + length == text.size());
         offset += length;
      } while (offset < text.size());
   });
}

}  // namespace

void CreateXMLParser(XMLHandler* handler, Ref<XMLParser>& out) {
   out = new XMLParserImpl(handler);
}

}  // namespace Pelmora::Xml
