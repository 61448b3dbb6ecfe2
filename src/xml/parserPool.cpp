// The parser pool: idle parsers kept for reuse, handed out in leases that bring them back.

#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/system/lockable.h"
#include "pelmora/xml/parser.h"

namespace Pelmora::Xml {
namespace {

class ParserLeaseImpl final : public virtual XMLParserPool::ParserLease, public ObjectImpl {
public:
   ParserLeaseImpl(XMLParserPool* pool, Ref<XMLParser> parser)
       : _pool(pool), _parser(std::move(parser)) {}
   ~ParserLeaseImpl() override { _pool->ReturnParser(_parser.Get()); }

   XMLParser* GetParser() const override { return _parser.Get(); }

private:
   Ref<XMLParserPool> _pool;
   Ref<XMLParser> _parser;
};

class XMLParserPoolImpl final : public virtual XMLParserPool, public System::LockableObjectImpl {
public:
   void GetParserLease(Ref<ParserLease>& out) override {
      Ref<XMLParser> parser;
      {
         System::Synchronized lock(this);
         if (!_idle.empty()) {
            parser = std::move(_idle.back());
            _idle.pop_back();
         }
      }
      if (!parser) {
         // Created outside the lock: a new parser costs more than a list operation.
         Ref<XMLHandler> handler;
         CreateXMLDocumentHandler(handler);
         CreateXMLParser(handler.Get(), parser);
      }
      out = new ParserLeaseImpl(this, std::move(parser));
   }

   // The most recently returned parser is handed out first, while its memory is warm.
   void ReturnParser(XMLParser* parser) override {
      PELMORA_VERIFY(parser != NULL);
      System::Synchronized lock(this);
      _idle.emplace_back(parser);
   }

private:
   std::vector<Ref<XMLParser>> _idle;
};

}  // namespace

void CreateXMLParserPool(Ref<XMLParserPool>& out) {
   out = new XMLParserPoolImpl();
}

XMLParserPool* GetXmlParserPool() {
   // Never destroyed: a lease released by a thread still running at exit returns to it.
   static XMLParserPool* const pool = [] {
      Ref<XMLParserPool> created;
      CreateXMLParserPool(created);
      return created.Release();
   }();
   return pool;
}

}  // namespace Pelmora::Xml
