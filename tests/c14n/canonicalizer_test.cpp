// The canonicaliser: its identifiers, the namespace and attribute rendering of both kinds
// checked byte for byte against libxml2 over a corpus, and the cases where our bytes
// deliberately differ from the W3C algorithms or libxml2 does, each with the bytes we must
// write.

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/io.h"
#include "pelmora/xml.h"
#include "tests/c14n/libxml2Oracle.h"
#include "tests/xml/nodeBuilders.h"

using namespace Pelmora;
using namespace Pelmora::Xml;
using namespace Pelmora::Xml::Security;
using namespace Pelmora::Xml::Testing;

namespace {

std::string Canonical(Node* node, const std::string& algorithm, const std::vector<std::string>& prefixes = {}) {
   Ref<Canonicalizer> canonicalizer;
   CreateCanonicalizer(algorithm, prefixes, canonicalizer);
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   canonicalizer->Canonicalize(node, *writer);
   return writer->GetString();
}

std::string OursOrFail(const std::string& xml, const std::string& path, bool exclusive,
                       const std::vector<std::string>& prefixes = {}) {
   std::optional<std::string> ours = OursCanonical(xml, path, exclusive, prefixes);
   EXPECT_TRUE(ours.has_value()) << xml;
   return ours.value_or("");
}

// ---- identifiers ----

TEST(CanonicalizerTest, AcceptsExactlyTheTwoIdentifiersAndPrefixesOnlyForExclusive) {
   Ref<Canonicalizer> c;
   CreateCanonicalizer("http://www.w3.org/TR/2001/REC-xml-c14n-20010315", c);
   EXPECT_TRUE(c);
   CreateCanonicalizer("http://www.w3.org/2001/10/xml-exc-c14n#", c);
   EXPECT_TRUE(c);
   for (std::string refused : {"http://www.w3.org/TR/2001/REC-xml-c14n-20010315#WithComments",
                               "http://www.w3.org/2001/10/xml-exc-c14n#WithComments",
                               "http://www.w3.org/2006/12/xml-c14n11", "http://www.w3.org/2001/10/xml-exc-c14n",
                               " http://www.w3.org/2001/10/xml-exc-c14n#", ""}) {
      try {
         CreateCanonicalizer(refused, c);
         ADD_FAILURE() << "accepted " << refused;
      } catch (const UnsupportedCanonicalizationException& e) {
         EXPECT_EQ(std::string("The following canonicalization method is unsupported: ") + refused, e.GetMessage());
      }
   }
   // Inclusive prefixes belong to the exclusive kind only.
   EXPECT_THROW(CreateCanonicalizer(kInclusiveC14N, {"p"}, c), InvalidArgumentException);
   CreateCanonicalizer(kExclusiveC14N, {"p"}, c);
   EXPECT_TRUE(c);
}

// ---- differential corpus ----

struct CorpusDocument {
   const char* name;
   std::string xml;
   std::vector<std::string> paths;
};

const std::vector<CorpusDocument>& Corpus() {
   static const std::vector<CorpusDocument> corpus = {
       {"plain", "<a b=\"1\" a=\"2\"><c/>text<d e=\"x\"></d></a>", {"", "a/d"}},
       {"ws-security envelope",
        "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
        "<soap:Envelope xmlns:soap=\"http://schemas.xmlsoap.org/soap/envelope/\" "
        "xmlns:wsse=\"http://docs.oasis-open.org/wss/2004/01/oasis-200401-wss-wssecurity-secext-1.0.xsd\" "
        "xmlns:wsu=\"http://docs.oasis-open.org/wss/2004/01/oasis-200401-wss-wssecurity-utility-1.0.xsd\" "
        "xmlns:xsi=\"http://www.w3.org/2001/XMLSchema-instance\" xmlns:xsd=\"http://www.w3.org/2001/XMLSchema\">\n"
        " <soap:Header>\n"
        "  <wsse:Security soap:mustUnderstand=\"1\">\n"
        "   <wsu:Timestamp wsu:Id=\"TS-1\"><wsu:Created>2026-11-24T10:00:00Z</wsu:Created>"
        "<wsu:Expires>2026-11-24T10:05:00Z</wsu:Expires></wsu:Timestamp>\n"
        "   <wsse:BinarySecurityToken EncodingType=\"http://docs.oasis-open.org/wss/2004/01/"
        "oasis-200401-wss-soap-message-security-1.0#Base64Binary\" wsu:Id=\"X509-1\">MIIB+AbC=</wsse:BinarySecurityToken>\n"
        "   <ds:Signature xmlns:ds=\"http://www.w3.org/2000/09/xmldsig#\" Id=\"SIG-1\">\n"
        "    <ds:SignedInfo>\n"
        "     <ds:CanonicalizationMethod Algorithm=\"http://www.w3.org/2001/10/xml-exc-c14n#\">"
        "<ec:InclusiveNamespaces xmlns:ec=\"http://www.w3.org/2001/10/xml-exc-c14n#\" PrefixList=\"soap\"/>"
        "</ds:CanonicalizationMethod>\n"
        "     <ds:SignatureMethod Algorithm=\"http://www.w3.org/2000/09/xmldsig#rsa-sha1\"/>\n"
        "     <ds:Reference URI=\"#Body-1\"><ds:Transforms><ds:Transform "
        "Algorithm=\"http://www.w3.org/2001/10/xml-exc-c14n#\"/></ds:Transforms>"
        "<ds:DigestMethod Algorithm=\"http://www.w3.org/2000/09/xmldsig#sha1\"/>"
        "<ds:DigestValue>q1w2e3r4t5y6u7i8o9p0=</ds:DigestValue></ds:Reference>\n"
        "    </ds:SignedInfo>\n"
        "    <ds:SignatureValue>AbCdEf==</ds:SignatureValue>\n"
        "   </ds:Signature>\n"
        "  </wsse:Security>\n"
        " </soap:Header>\n"
        " <soap:Body wsu:Id=\"Body-1\" xmlns:m=\"urn:example:mgmt\">\n"
        "  <m:Update xmlns=\"urn:example:default\"><target host=\"h1\" m:port=\"8443\"/>"
        "<m:value xsi:type=\"xsd:int\">42</m:value><flag xsi:nil=\"true\"/></m:Update>\n"
        " </soap:Body>\n"
        "</soap:Envelope>\n",
        {"", "Envelope/Header/Security/Signature/SignedInfo", "Envelope/Body", "Envelope/Body/Update",
         "Envelope/Header/Security/Timestamp", "Envelope/Header"}},
       {"default namespace undeclared",
        "<a xmlns=\"urn:a\"><b xmlns=\"\"><c xmlns=\"urn:c\"><d xmlns=\"\"><e/></d></c><f xmlns=\"\"/></b>"
        "<g><h xmlns=\"urn:a\"/></g></a>",
        {"", "a/b", "a/b/c", "a/b/c/d", "a/g"}},
       {"default namespace undeclared without one above",
        "<a><b xmlns=\"\"><c/></b><p:d xmlns:p=\"urn:p\" xmlns=\"\"/></a>", {"", "a/b", "a/d"}},
       {"xml attributes",
        "<a xml:lang=\"en\" xml:space=\"preserve\" xml:base=\"http://h/\"><b xml:lang=\"fr\" z=\"1\"><c x=\"1\"/></b>"
        "<d xml:space=\"default\"/></a>",
        {"", "a/b", "a/b/c", "a/d"}},
       {"attribute value normalisation",
        "<a x=\"  two\n\tlines  \" y=\"&#9;t&#10;n&#13;r\" z=\"a &amp; b &quot;q&quot; &lt;\" w='single \"dq\"'/>",
        {""}},
       {"character references",
        "<a>&#65;&#x42;&#169;&#x10000; &amp; x &lt; y &gt; z &#13; end\xc3\xa9\xe2\x82\xac</a>", {""}},
       {"internal entity",
        "<!DOCTYPE a [<!ENTITY e \"hello world\"><!ATTLIST a d CDATA \"dflt\">]><a>x &e; y</a>", {""}},
       {"redundant and changed prefixes",
        "<p:a xmlns:p=\"urn:p\" xmlns:q=\"urn:q\"><p:b xmlns:p=\"urn:p\"><q:c q:x=\"1\" xmlns:q=\"urn:q2\">"
        "<q:d xmlns:q=\"urn:q\"/></q:c></p:b></p:a>",
        {"", "a/b", "a/b/c"}},
       {"attribute order by namespace",
        "<a xmlns:z=\"urn:a\" xmlns:b=\"urn:z\" xmlns=\"urn:dflt\" b:attr=\"1\" z:attr=\"2\" attr=\"3\" a=\"4\" "
        "z:b=\"5\" xml:lang=\"de\"/>",
        {""}},
       {"mixed content and line ends",
        "<a>line1&#13;\nline2<b>  </b>\r\n  tail\t<c>x</c></a>", {"", "a/c"}},
       {"unused and used declarations",
        "<r xmlns:u=\"urn:unused\" xmlns:n=\"urn:n\" xmlns=\"urn:r\"><n:x a=\"1\"><y/></n:x><z u:k=\"v\"/></r>",
        {"", "r/x", "r/x/y", "r/z"}},
       {"subtree cut out of its document",
        "<root xmlns=\"urn:root\" xmlns:a=\"urn:a\" xml:lang=\"en\"><mid xmlns:b=\"urn:b\"><a:leaf b:x=\"1\">"
        "text</a:leaf><plain/></mid></root>",
        {"root/mid", "root/mid/leaf", "root/mid/plain"}},
       {"empty elements and whitespace", "<a>\n  <b/>\n  <c></c>\n  <d> </d>\n</a>", {"", "a/b"}},
       {"deep nesting with prefixes",
        "<a:x xmlns:a=\"urn:1\"><a:x xmlns:a=\"urn:2\"><a:x xmlns:a=\"urn:1\"><a:x/></a:x></a:x></a:x>",
        {"", "x/x", "x/x/x"}},
   };
   return corpus;
}

// Exclusive cases with InclusiveNamespaces prefix lists.
struct PrefixCase {
   const char* document;
   const char* path;
   std::vector<std::string> prefixes;
};

const std::vector<PrefixCase>& PrefixCases() {
   static const std::vector<PrefixCase> cases = {
       {"ws-security envelope", "Envelope/Header/Security/Signature/SignedInfo", {"soap"}},
       {"ws-security envelope", "Envelope/Body", {"xsi", "xsd"}},
       {"ws-security envelope", "Envelope/Body/Update", {"#default", "m"}},
       {"unused and used declarations", "r/x", {"u"}},
       {"unused and used declarations", "r/x/y", {"#default"}},
       {"unused and used declarations", "", {"u", "n", "nothere"}},
       {"default namespace undeclared", "a/b", {"#default"}},
       {"subtree cut out of its document", "root/mid/leaf", {"#default", "b"}},
   };
   return cases;
}

const std::string& DocumentNamed(const std::string& name) {
   for (const CorpusDocument& d : Corpus()) {
      if (name == d.name) return d.xml;
   }
   throw std::runtime_error("no corpus document " + name);
}

TEST(CanonicalizerDifferentialTest, CorpusMatchesLibxml2) {
   int compared = 0;
   for (const CorpusDocument& d : Corpus()) {
      for (const std::string& path : d.paths) {
         for (bool exclusive : {false, true}) {
            SCOPED_TRACE(std::string(d.name) + " at \"" + path + "\"" + (exclusive ? " exclusive" : " inclusive"));
            std::optional<std::string> oracle = OracleCanonical(d.xml, path, exclusive, {});
            ASSERT_TRUE(oracle.has_value());
            EXPECT_EQ(*oracle, OursOrFail(d.xml, path, exclusive));
            ++compared;
         }
      }
   }
   for (const PrefixCase& c : PrefixCases()) {
      SCOPED_TRACE(std::string(c.document) + " at \"" + c.path + "\" with prefixes");
      const std::string& xml = DocumentNamed(c.document);
      std::optional<std::string> oracle = OracleCanonical(xml, c.path, true, c.prefixes);
      ASSERT_TRUE(oracle.has_value());
      EXPECT_EQ(*oracle, OursOrFail(xml, c.path, true, c.prefixes));
      ++compared;
   }
   RecordProperty("compared", compared);
   std::printf("differential corpus: %d comparisons\n", compared);
}

// Where our bytes differ from the W3C algorithms on purpose, and where libxml2 differs
// from them: the expected bytes are ours, and libxml2 is checked to differ so that each
// case really exercises the difference.
struct Departure {
   const char* why;
   std::string xml;
   std::string expected;
   // When the exclusive form differs from the inclusive one.
   std::string exclusiveExpected = {};
};

TEST(CanonicalizerDifferentialTest, DeliberateDeparturesFromTheStandards) {
   const std::vector<Departure> departures = {
       {"'>' in an attribute value is escaped, which the standards do not do",
        "<a x=\"1>0\" y=\"&gt;\"/>", "<a x=\"1&gt;0\" y=\"&gt;\"></a>"},
       {"the byte after an escaped byte is written as it is: two '<' give '&lt;<'",
        "<a>a&lt;&lt;b</a>", "<a>a&lt;<b</a>"},
       {"a carriage return and line feed in an attribute give '&#xD;' and a raw line feed",
        "<a x=\"&#13;&#10;\"/>", "<a x=\"&#xD;\n\"></a>"},
       {"'&&' in text: only the first is escaped", "<a>&amp;&amp;&amp;</a>", "<a>&amp;&&amp;</a>"},
       {"a quote right after '<' in an attribute stays raw", "<a x='&lt;\"'/>", "<a x=\"&lt;\"\"></a>"},
       {"CDATA sections are dropped with their content",
        "<a>x<![CDATA[<y> & z]]>w</a>", "<a>xw</a>"},
       // libxml2 writes namespace URIs as they stand; the standards process namespace nodes
       // like attributes, so "&" must be written "&amp;".
       {"libxml2 is wrong: a namespace URI is escaped like an attribute value",
        "<a xmlns=\"urn:a?q=1&amp;r=2\" xmlns:p=\"urn:p?x=&amp;\"><p:b/></a>",
        "<a xmlns=\"urn:a?q=1&amp;r=2\" xmlns:p=\"urn:p?x=&amp;\"><p:b></p:b></a>",
        "<a xmlns=\"urn:a?q=1&amp;r=2\"><p:b xmlns:p=\"urn:p?x=&amp;\"></p:b></a>"},
       {"processing instructions beside the root element write nothing",
        "<?before x?><a>t<b/></a><?after y?>", "<a>t<b></b></a>"},
   };
   for (const Departure& d : departures) {
      SCOPED_TRACE(d.why);
      for (bool exclusive : {false, true}) {
         const std::string& expected =
             exclusive && !d.exclusiveExpected.empty() ? d.exclusiveExpected : d.expected;
         EXPECT_EQ(expected, OursOrFail(d.xml, "", exclusive));
         std::optional<std::string> oracle = OracleCanonical(d.xml, "", exclusive, {}, false);
         ASSERT_TRUE(oracle.has_value());
         EXPECT_NE(expected, *oracle);
      }
   }
}

// ---- trees built by code ----

TEST(CanonicalizerTest, CommentsWriteNothingAndEmptyElementsGetEndTags) {
   Ref<ElementNode> a = Element("a");
   Ref<ElementNode> b = Element("b");
   a->AppendChild(Comment("note").Get());
   a->AppendChild(b.Get());
   a->AppendChild(Text("t").Get());
   EXPECT_EQ("<a><b></b>t</a>", Canonical(a.Get(), kInclusiveC14N));
   EXPECT_EQ("<b></b>", Canonical(b.Get(), kExclusiveC14N));
   // A text apex is escaped; any other leaf writes nothing.
   EXPECT_EQ("a&lt;b&#xD;", Canonical(Text("a<b\r").Get(), kInclusiveC14N));
   EXPECT_EQ("", Canonical(Comment("c").Get(), kInclusiveC14N));
}

TEST(CanonicalizerTest, ApexRendersNamespacesDeclaredAboveIt) {
   Ref<ElementNode> root = Element("s:Envelope");
   root->DefineAttribute("xmlns:s", "urn:s");
   root->DefineAttribute("xmlns:u", "urn:u");
   root->DefineAttribute("xmlns", "urn:d");
   root->DefineAttribute("xml:lang", "en");
   Ref<ElementNode> body = Element("s:Body");
   body->DefineAttribute("u:Id", "b1");
   root->AppendChild(body.Get());
   Ref<ElementNode> child = Element("op");
   body->AppendChild(child.Get());
   EXPECT_EQ("<s:Body xmlns=\"urn:d\" xmlns:s=\"urn:s\" xmlns:u=\"urn:u\" xml:lang=\"en\" u:Id=\"b1\">"
             "<op></op></s:Body>",
             Canonical(body.Get(), kInclusiveC14N));
   EXPECT_EQ("<s:Body xmlns:s=\"urn:s\" xmlns:u=\"urn:u\" u:Id=\"b1\"><op xmlns=\"urn:d\"></op></s:Body>",
             Canonical(body.Get(), kExclusiveC14N));
   EXPECT_EQ("<s:Body xmlns=\"urn:d\" xmlns:s=\"urn:s\" xmlns:u=\"urn:u\" u:Id=\"b1\"><op></op></s:Body>",
             Canonical(body.Get(), kExclusiveC14N, {"#default"}));
}

TEST(CanonicalizerTest, FilteredWalkLeavesTheExcludedSubtreeOut) {
   Ref<ElementNode> a = Element("a");
   Ref<ElementNode> signature = Element("Signature");
   signature->AppendChild(Element("SignedInfo").Get());
   a->AppendChild(Text("x").Get());
   a->AppendChild(signature.Get());
   a->AppendChild(Text("y").Get());
   Ref<Canonicalizer> c;
   CreateCanonicalizer(kExclusiveC14N, c);
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   Ref<NodeFilter> filter(new ExcludeNodeFilter(signature.Get()));
   c->Canonicalize(NodeFilterIterator(a.Get(), filter.Get()), *writer);
   EXPECT_EQ("<a>xy</a>", writer->GetString());
}

TEST(CanonicalizerTest, DeepTreesAndLongOutputsAreWrittenWhole) {
   // Deeper than a recursive walk would survive on a small thread stack, and longer than
   // the output buffer.
   const int depth = 100000;
   // Built from the bottom up: each parent is still free when its child is appended.
   Ref<ElementNode> root = Element("e");
   for (int i = 1; i < depth; ++i) {
      Ref<ElementNode> parent = Element("e");
      parent->AppendChild(root.Get());
      root = parent;
   }
   std::string out = Canonical(root.Get(), kExclusiveC14N);
   ASSERT_EQ(size_t(depth) * 7, out.size());
   EXPECT_EQ("<e><e>", out.substr(0, 6));
   EXPECT_EQ("</e></e>", out.substr(out.size() - 8));
   // Unlink level by level: releasing the chain at once would recurse as deep.
   while (Node* child = root->GetFirstChild()) {
      Ref<Node> keep(child);
      root->RemoveChild(child);
      root = dynamic_cast<ElementNode*>(child);
   }
}

TEST(CanonicalizerTest, OneCanonicalizerServesManyThreadsOnOneTree) {
   Ref<Document> parsed = ParseOurs(DocumentNamed("ws-security envelope"));
   ASSERT_TRUE(parsed);
   Document* document = parsed.Get();
   Ref<Canonicalizer> c;
   CreateCanonicalizer(kExclusiveC14N, c);
   const std::string expected = Canonical(document, kExclusiveC14N);
   std::atomic<int> mismatches{0};
   std::vector<std::thread> threads;
   for (int t = 0; t < 4; ++t) {
      threads.emplace_back([&] {
         for (int i = 0; i < 200; ++i) {
            Ref<StringWriter> writer;
            CreateStringWriter(writer);
            c->Canonicalize(document, *writer);
            if (writer->GetString() != expected) ++mismatches;
         }
      });
   }
   for (std::thread& t : threads) t.join();
   EXPECT_EQ(0, mismatches.load());
}

}  // namespace
