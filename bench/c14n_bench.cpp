// Canonicalisation against libxml2's xmlC14NDocDumpMemory, both on input parsed once
// before measuring: a ~20 MB document (attributes, namespaces, references, comments,
// CDATA) and a ~1.5 KB WS-Security shaped envelope, each inclusive and exclusive.

#include <libxml/c14n.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <string>

#include "pelmora/pelmora.h"
#include "support/ratioMain.h"

using namespace Pelmora;

namespace {

std::string MakeBigDocument() {
   std::string text =
       "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
       "<!-- generated inventory -->\n"
       "<inv:inventory xmlns:inv=\"urn:example:inventory\" xmlns:x=\"urn:example:extra\" "
       "xmlns=\"urn:example:default\" version=\"3\">\n";
   text.reserve(21 * 1024 * 1024);
   for (int i = 0; text.size() < 20 * 1024 * 1024; ++i) {
      std::string n = std::to_string(i);
      text += "  <inv:item id=\"" + n + "\" x:kind=\"tools &amp; parts\" state=\"active\">\n"
              "    <inv:name>Item &lt;" + n + "&gt; of the &quot;main&quot; store</inv:name>\n"
              "    <!-- record " + n + " -->\n"
              "    <inv:note><![CDATA[raw <data> & more for " + n + "]]></inv:note>\n"
              "    <price currency=\"EUR\" xmlns:p=\"urn:example:price\" p:net=\"yes\">" + n + ".95</price>\n"
              "    <inv:flags a=\"1\" b=\"2\" c=\"3\"/>\n"
              "  </inv:item>\n";
   }
   text += "</inv:inventory>\n";
   return text;
}

// About 1.5 KB.
std::string MakeEnvelope() {
   std::string text =
       "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
       "<soap:Envelope xmlns:soap=\"http://schemas.xmlsoap.org/soap/envelope/\" "
       "xmlns:wsse=\"http://docs.oasis-open.org/wss/2004/01/oasis-200401-wss-wssecurity-secext-1.0.xsd\" "
       "xmlns:wsu=\"http://docs.oasis-open.org/wss/2004/01/oasis-200401-wss-wssecurity-utility-1.0.xsd\" "
       "xmlns:xsi=\"http://www.w3.org/2001/XMLSchema-instance\">\n"
       " <soap:Header><wsse:Security soap:mustUnderstand=\"1\">"
       "<wsu:Timestamp wsu:Id=\"TS-1\"><wsu:Created>2026-11-24T10:00:00Z</wsu:Created>"
       "<wsu:Expires>2026-11-24T10:05:00Z</wsu:Expires></wsu:Timestamp>"
       "<ds:Signature xmlns:ds=\"http://www.w3.org/2000/09/xmldsig#\"><ds:SignedInfo>"
       "<ds:CanonicalizationMethod Algorithm=\"http://www.w3.org/2001/10/xml-exc-c14n#\"/>"
       "<ds:SignatureMethod Algorithm=\"http://www.w3.org/2000/09/xmldsig#rsa-sha1\"/>"
       "<ds:Reference URI=\"#Body-1\"><ds:DigestMethod Algorithm=\"http://www.w3.org/2000/09/xmldsig#sha1\"/>"
       "<ds:DigestValue>q1w2e3r4t5y6u7i8o9p0=</ds:DigestValue></ds:Reference></ds:SignedInfo>"
       "<ds:SignatureValue>AbCdEfGhIjKlMnOp==</ds:SignatureValue></ds:Signature></wsse:Security></soap:Header>\n"
       " <soap:Body wsu:Id=\"Body-1\"><m:UpdateConfiguration xmlns:m=\"urn:example:mgmt\">\n";
   for (int i = 0; i < 8; ++i) {
      std::string k = std::to_string(i);
      text += "  <m:setting name=\"service/limit" + k + "\" xsi:type=\"xsd:int\">10" + k + "</m:setting>\n";
   }
   text += "  <m:comment>Raised limits &amp; timeouts</m:comment>\n"
           " </m:UpdateConfiguration></soap:Body>\n</soap:Envelope>\n";
   return text;
}

const std::string& BigDocument() {
   static const std::string text = MakeBigDocument();
   return text;
}

const std::string& Envelope() {
   static const std::string text = MakeEnvelope();
   return text;
}

Ref<Object> ParseOurs(const std::string& text) {
   Ref<Xml::XMLHandler> handler;
   Xml::CreateXMLDocumentHandler(handler);
   Ref<Xml::XMLParser> parser;
   Xml::CreateXMLParser(handler.Get(), parser);
   Ref<Object> result;
   parser->Parse(text, result);
   return result;
}

void Ours(benchmark::State& state, const std::string& text, const char* algorithm) {
   Ref<Object> document = ParseOurs(text);
   Ref<Xml::Security::Canonicalizer> canonicalizer;
   Xml::Security::CreateCanonicalizer(algorithm, canonicalizer);
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   size_t bytes = 0;
   for (auto _ : state) {
      writer->Reset();
      canonicalizer->Canonicalize(dynamic_cast<Xml::Node*>(document.Get()), *writer);
      bytes = writer->GetString().size();
      benchmark::DoNotOptimize(writer->GetString().data());
   }
   state.counters["out_bytes"] = double(bytes);
}

void Libxml2(benchmark::State& state, const std::string& text, int mode) {
   xmlDocPtr doc = xmlReadMemory(text.data(), int(text.size()), "bench.xml", nullptr, XML_PARSE_HUGE);
   size_t bytes = 0;
   for (auto _ : state) {
      xmlChar* out = nullptr;
      int length = xmlC14NDocDumpMemory(doc, nullptr, mode, nullptr, 0, &out);
      bytes = size_t(length);
      benchmark::DoNotOptimize(out);
      xmlFree(out);
   }
   state.counters["out_bytes"] = double(bytes);
   xmlFreeDoc(doc);
}

void BM_OursInclusiveBig(benchmark::State& s) { Ours(s, BigDocument(), Xml::Security::kInclusiveC14N); }
void BM_Libxml2InclusiveBig(benchmark::State& s) { Libxml2(s, BigDocument(), XML_C14N_1_0); }
void BM_OursExclusiveBig(benchmark::State& s) { Ours(s, BigDocument(), Xml::Security::kExclusiveC14N); }
void BM_Libxml2ExclusiveBig(benchmark::State& s) { Libxml2(s, BigDocument(), XML_C14N_EXCLUSIVE_1_0); }
void BM_OursInclusiveEnvelope(benchmark::State& s) { Ours(s, Envelope(), Xml::Security::kInclusiveC14N); }
void BM_Libxml2InclusiveEnvelope(benchmark::State& s) { Libxml2(s, Envelope(), XML_C14N_1_0); }
void BM_OursExclusiveEnvelope(benchmark::State& s) { Ours(s, Envelope(), Xml::Security::kExclusiveC14N); }
void BM_Libxml2ExclusiveEnvelope(benchmark::State& s) { Libxml2(s, Envelope(), XML_C14N_EXCLUSIVE_1_0); }

BENCHMARK(BM_OursInclusiveBig)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_Libxml2InclusiveBig)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_OursExclusiveBig)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_Libxml2ExclusiveBig)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_OursInclusiveEnvelope)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_Libxml2InclusiveEnvelope)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_OursExclusiveEnvelope)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_Libxml2ExclusiveEnvelope)->Unit(benchmark::kMicrosecond);

}  // namespace

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(argc, argv,
                                      {{"BM_OursInclusiveBig", "BM_Libxml2InclusiveBig"},
                                       {"BM_OursExclusiveBig", "BM_Libxml2ExclusiveBig"},
                                       {"BM_OursInclusiveEnvelope", "BM_Libxml2InclusiveEnvelope"},
                                       {"BM_OursExclusiveEnvelope", "BM_Libxml2ExclusiveEnvelope"}});
}
