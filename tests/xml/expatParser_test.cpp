#include <gmock/gmock.h>
#include <gtest/gtest.h>


#include <algorithm>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "pelmora/exception.h"
#include "src/internal/report.h"
#include "tests/support/logCapture.h"
#include "tests/support/heap.h"
#include "tests/xml/nodeBuilders.h"

namespace Pelmora::Xml {
namespace {

using testing::HasSubstr;
using testing::StartsWith;
using Testing::Write;
using Lines = std::vector<std::string>;

// Collects what the XML layer logs; it must outlive every caller.
TestSupport::LogCapture& Sink() {
   static auto* sink = new TestSupport::LogCapture();
   return *sink;
}

class ParserTest : public testing::Test {
protected:
   void SetUp() override { Sink().Take(), Internal::SetReportSink(&Sink()); }
   void TearDown() override { Internal::SetReportSink(nullptr); }
};

using Testing::NewParser;
using TestSupport::HeapInUse;

Ref<Document> Parse(XMLParser* parser, const std::string& text, bool restricted = false) {
   Ref<Object> result;
   parser->Parse(text, restricted, result);
   return result.Cast<Document>();
}

std::string Reparse(XMLParser* parser, const std::string& text, bool restricted = false) {
   return Write(Parse(parser, text, restricted).Get());
}

// The message of the XMLParseException the parse raises, or "parsed".
std::string Failure(XMLParser* parser, const std::string& text, bool restricted,
                    int* line = nullptr) {
   try {
      Parse(parser, text, restricted);
      return "parsed";
   } catch (const XMLParseException& e) {
      if (line) *line = e.GetLineNumber();
      return e.GetMessage();
   }
}

TEST_F(ParserTest, BuildsTheDocumentWithEveryKindOfNode) {
   Ref<Document> document = Parse(NewParser().Get(),
                                  "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
                                  "<!--lead--><?app go?>\n"
                                  "<s:Envelope xmlns:s=\"urn:s\" b=\"2\" a=\"1&amp;\">\n"
                                  "  <s:Body>a&amp;b\nc<![CDATA[<x>&]]><!--in--></s:Body>\n"
                                  "</s:Envelope>");
   EXPECT_EQ("UTF-8", document->GetEncoding());
   ElementNode* body = document->GetRoot()->GetChildElementByQName(QName("urn:s", "Body"));
   ASSERT_NE(nullptr, body);
   EXPECT_EQ(4, body->GetLineNumber());
   EXPECT_EQ(2, body->GetColumnNumber());
   // Text split by a reference and a line end is one node.
   EXPECT_EQ("a&b\nc", dynamic_cast<TextNode*>(body->GetFirstChild())->GetText());
   EXPECT_EQ(
       "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<!--lead-->\n<?app go?>"
       "<s:Envelope a=\"1&amp;\" b=\"2\" xmlns:s=\"urn:s\">\n  "
       "<s:Body>a&amp;b\nc<![CDATA[<x>&]]><!--in-->\n</s:Body>\n</s:Envelope>",
       Write(document.Get()));
   EXPECT_TRUE(Sink().Take().empty());
}

// Lookups search the parsed attributes by the byte order of their names, as built ones.
TEST_F(ParserTest, ParsedAttributesAreOrderedByTheBytesOfTheirNames) {
   Ref<Document> document =
       Parse(NewParser().Get(),
             "<e \xc3\xa9='5' ab='3' Z='1' a='2' x:n='4' b=''><f b='2' a='1'/></e>");
   ElementNode* e = document->GetRoot();
   EXPECT_EQ("<e Z=\"1\" a=\"2\" ab=\"3\" b=\"\" x:n=\"4\" \xc3\xa9=\"5\"><f a=\"1\" b=\"2\"/></e>",
             Write(e));
   std::string values;
   for (const char* name : {"Z", "a", "ab", "b", "x:n", "\xc3\xa9"}) {
      std::string value;
      EXPECT_TRUE(e->GetAttribute(name, value)) << name;
      values += value + ",";
   }
   EXPECT_EQ("1,2,3,,4,5,", values);
   EXPECT_FALSE(e->GetAttribute("n", values));
}

TEST_F(ParserTest, ASerialisedDocumentParsesBackToTheSameSerialisation) {
   Ref<XMLParser> parser = NewParser();
   std::string first = Reparse(parser.Get(),
                               "<?xml version='1.0'?><!-- c --><r xmlns='urn:d' "
                               "q='&quot;&apos;'><a>x &lt; y &gt; z\t</a><b><![CDATA[]]></b>"
                               "<c>\xc3\xa9</c><d/></r>");
   std::string second = Reparse(parser.Get(), first);
   EXPECT_EQ(first, second);
   EXPECT_EQ(second, Reparse(parser.Get(), second, true));
   // Names that are legal XML but not namespace-well-formed survive too.
   EXPECT_EQ("<:><a:/></:>", Reparse(parser.Get(), "<:><a:/></:>"));
   // Inside an element, a comment's line feed comes back as text: each round adds one.
   EXPECT_EQ("<r><!--c-->\n\n</r>",
             Reparse(parser.Get(), Reparse(parser.Get(), "<r><!--c--></r>")));
}

TEST_F(ParserTest, BadInputRaisesXMLParseExceptionAndTheParserServesOn) {
   Ref<XMLParser> parser = NewParser();
   int line = 0;
   EXPECT_EQ("no element found", Failure(parser.Get(), "", false, &line));
   EXPECT_EQ(1, line);
   EXPECT_EQ("mismatched tag", Failure(parser.Get(), "<a>\n<b>\n</a>", false, &line));
   EXPECT_EQ(3, line);
   EXPECT_EQ("duplicate attribute", Failure(parser.Get(), "<a x='1' x='2'/>", false));
   EXPECT_EQ("junk after document element", Failure(parser.Get(), "<a/><b/>", false));
   EXPECT_TRUE(Sink().Take().empty());

   // An insertion the model refuses stops the parse and is logged.
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<a><?pi inside?></a>", false));
   EXPECT_THAT(
       Sink().Take(),
       testing::ElementsAre(
           AllOf(StartsWith("4 Unexpected exception parsing XML document: "),
                 HasSubstr("(Invalid argument : Elements cannot have document or PI children.)"))));
   EXPECT_EQ("<a>ok</a>", Reparse(parser.Get(), "<a>ok</a>"));
}

// A text is handed to expat in slices: a document across several of them reads as the
// same document through a reader, and an error past the first slice keeps its line.
TEST_F(ParserTest, LongTextsParseAsTheirReaderDoesAndErrorsKeepTheirLines) {
   Ref<XMLParser> parser = NewParser();
   std::string text = "<r>";
   for (int i = 0; i < 20000; ++i) text += "<e n='" + std::to_string(i) + "'>t&amp;</e>\n";
   text += "</r>";
   ASSERT_GT(text.size(), 200000u);
   Ref<StringReader> reader;
   CreateStringReader(text.data(), static_cast<int>(text.size()), reader);
   Ref<Object> fromReader;
   parser->Parse(reader.Get(), fromReader);
   EXPECT_EQ(Write(fromReader.Cast<Document>().Get()), Reparse(parser.Get(), text));

   int line = 0;
   std::string broken = text.substr(0, text.size() - 4) + "</x>";
   EXPECT_EQ("mismatched tag", Failure(parser.Get(), broken, false, &line));
   EXPECT_EQ(20001, line);
   std::string cut = text.substr(0, text.find('\n', 150000) + 1);
   EXPECT_EQ("no element found", Failure(parser.Get(), cut, false));
}

// Callers catch the library's failures as Exception; a parse error must be one of them.
TEST_F(ParserTest, ParseFailuresAreCaughtAsException) {
   Ref<XMLParser> parser = NewParser();
   std::string caught;
   try {
      Parse(parser.Get(), "<a>", false);
   } catch (const Exception& e) {
      caught = e.GetMessage();
      std::unique_ptr<Exception> kept(e.Clone());
      EXPECT_THROW(kept->Throw(), XMLParseException);
   }
   EXPECT_EQ("no element found", caught);
   EXPECT_THROW(ParsingAbortedException().Throw(), Exception);
}

TEST_F(ParserTest, RestrictedParsesRefuseEntityDeclarationsAndBillionLaughs) {
   const std::string internal = "<!DOCTYPE r [<!ENTITY who \"world\">]>\n<r>hello &who;</r>";
   Ref<XMLParser> parser = NewParser();
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), internal, true));
   EXPECT_EQ(Lines{"4 XML entity \"who\" was defined in the input.\n"
                   "The parser is configured to reject XML entity definitions."},
             Sink().Take());
   EXPECT_EQ("<r>hello world</r>", Reparse(parser.Get(), internal));
   for (const char* text : {"<!DOCTYPE r [<!ENTITY % p \"x\">]><r/>",
                            "<!DOCTYPE r [<!ENTITY ext SYSTEM \"file:///etc/passwd\">]><r/>"}) {
      EXPECT_EQ("parsing aborted", Failure(parser.Get(), text, true)) << text;
      EXPECT_EQ(1u, Sink().Take().size());
   }
   EXPECT_EQ("parsed", Failure(parser.Get(), "<!DOCTYPE r [<!ELEMENT r ANY>]><r/>", true));

   // A billion laughs is refused at its first declaration.
   std::string text = "<!DOCTYPE lolz [\n<!ENTITY lol \"lol\">\n";
   for (int i = 1; i < 10; ++i) {
      text += "<!ENTITY lol" + std::to_string(i) + " \"";
      for (int j = 0; j < 10; ++j)
         text += "&lol" + (i == 1 ? std::string() : std::to_string(i - 1)) + ";";
      text += "\">\n";
   }
   text += "]>\n<lolz>&lol9;</lolz>";
   int line = 0;
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), text, true, &line));
   EXPECT_EQ(2, line);
   EXPECT_THAT(Sink().Take(), testing::ElementsAre(HasSubstr("\"lol\"")));
}

std::string Nested(int depth, const std::string& inside = "") {
   std::string open, close;
   for (int i = 0; i < depth; ++i) open += "<e>", close += "</e>";
   return open + inside + close;
}

TEST_F(ParserTest, LimitsAcceptExactlyTheLimitAndApplyOnlyToRestrictedParses) {
   const struct {
      DocLimits limits;
      std::string fits, exceeds, message;
   } cases[] = {
       // The document node counts towards the depth.
       {{.maxDepth = 50}, Nested(49), Nested(50), "8 XML document too deep: 51 (max: 50)"},
       // Element, text, comment, CDATA (with its text), element: six nodes.
       {{.maxNodes = 6},
        "<r>t<!--c--><![CDATA[d]]><e/></r>",
        "<r>t<!--c--><![CDATA[d]]><e/><f/></r>",
        "8 XML document has too many nodes: 7 (max: 6)"},
       // Names, attribute names and values, character data: "root" "k" "vv" "hello".
       {{.maxChars = 12},
        "<root k='vv'>hello</root>",
        "<root k='vv'>hello!</root>",
        "8 XML document too long: 13 (max: 12)"},
       // A text or comment counts as one level below its element.
       {{.maxDepth = 50}, Nested(48, "t"), Nested(49, "t"), "8 XML document too deep: 51 (max: 50)"},
       {{.maxDepth = 50}, Nested(48, "<!--c-->"), Nested(49, "<!--c-->"),
        "8 XML document too deep: 51 (max: 50)"},
   };
   for (const auto& c : cases) {
      Ref<XMLParser> parser = NewParser(c.limits);
      EXPECT_EQ("parsed", Failure(parser.Get(), c.fits, true)) << c.message;
      EXPECT_EQ("parsing aborted", Failure(parser.Get(), c.exceeds, true)) << c.message;
      EXPECT_EQ(Lines{c.message}, Sink().Take());
      EXPECT_EQ("parsed", Failure(parser.Get(), c.exceeds, false)) << c.message;
   }
   // Merged character data adds bytes, not nodes; an attribute value alone can exceed.
   EXPECT_EQ("parsed", Failure(NewParser(cases[1].limits).Get(),
                               "<r>a&amp;b&lt;c\nd<x/><y/><z/><w/></r>", true));
   EXPECT_EQ("parsing aborted",
             Failure(NewParser(cases[2].limits).Get(), "<root k='vvvvvvvvvv'/>", true));
   EXPECT_EQ(1u, Sink().Take().size());

   // The pool's parsers carry the default limits; the depth limit is the one cheap to reach.
   Ref<XMLParserPool::ParserLease> lease;
   GetXmlParserPool()->GetParserLease(lease);
   EXPECT_EQ("parsed", Failure(lease->GetParser(), Nested(8191), true));
   EXPECT_EQ("parsing aborted", Failure(lease->GetParser(), Nested(8192), true));
   EXPECT_EQ(Lines{"8 XML document too deep: 8193 (max: 8192)"}, Sink().Take());
}

TEST_F(ParserTest, ParsedNodesOutliveTheirDocumentAndMixWithBuiltOnes) {
   Ref<XMLParser> parser = NewParser();
   Ref<ElementNode> kept;
   {
      Ref<Document> document = Parse(parser.Get(), "<r><keep a='1'>text</keep><drop/></r>");
      kept = document->GetRoot()->GetChildElementByTag("keep");
      document->GetRoot()->AppendChild(Testing::Element("built").Get());
      // The parser's next document must not disturb the nodes of this one.
      Parse(parser.Get(), "<other>" + std::string(50000, 'x') + "</other>");
   }
   EXPECT_EQ(nullptr, kept->GetParent());
   Ref<ElementNode> holder = Testing::Element("holder");
   holder->AppendChild(kept.Get());
   kept.Reset();
   EXPECT_EQ("<holder><keep a=\"1\">text</keep></holder>", Write(holder.Get()));

   // Text spanning many read blocks is one node.
   std::string body(100000, 'x');
   for (size_t i = 0; i < body.size(); i += 977) body[i] = '\n';
   Ref<Document> document = Parse(parser.Get(), "<r>" + body + "</r>");
   Node* text = document->GetRoot()->GetFirstChild();
   EXPECT_EQ(nullptr, text->GetNextSibling());
   EXPECT_EQ(body, dynamic_cast<TextNode*>(text)->GetText());
}

// The elements of a parsed document share their names: renaming one must leave the
// others of its name alone, and a name must live as long as any element that has it.
TEST_F(ParserTest, ParsedElementsAreRenamedOneAtATime) {
   Ref<XMLParser> parser = NewParser();
   Ref<ElementNode> renamed, shared;
   {
      Ref<Document> document = Parse(parser.Get(), "<p:r xmlns:p='u'><p:e/><p:e/><e/><:c/></p:r>");
      ElementNode* root = document->GetRoot();
      auto* first = dynamic_cast<ElementNode*>(root->GetFirstChild());
      auto* second = dynamic_cast<ElementNode*>(first->GetNextSibling());
      auto* plain = dynamic_cast<ElementNode*>(second->GetNextSibling());
      auto* colon = dynamic_cast<ElementNode*>(plain->GetNextSibling());
      EXPECT_EQ("p", root->GetPrefix());
      EXPECT_EQ("r", root->GetTag());
      EXPECT_EQ("", plain->GetPrefix());
      EXPECT_EQ("e", plain->GetTag());
      EXPECT_EQ("", colon->GetPrefix());
      EXPECT_EQ(":c", colon->GetTag());
      first->SetTag("f");
      second->SetPrefix("q");
      EXPECT_EQ("<p:r xmlns:p=\"u\"><p:f/><q:e/><e/><:c/></p:r>", Write(root));
      renamed = second;
      shared = plain;
      root->RemoveChild(second);
   }
   // Its document and that document's names are gone; the next document's are its own.
   Ref<Document> next = Parse(parser.Get(), "<p:e><q:e/></p:e>");
   EXPECT_EQ("q:e", renamed->GetName());
   EXPECT_EQ("e", shared->GetName());
   EXPECT_EQ("<p:e><q:e/></p:e>", Write(next->GetRoot()));
   next->GetRoot()->AppendChild(renamed.Get());
   EXPECT_EQ("<p:e><q:e/><q:e/></p:e>", Write(next->GetRoot()));
}

// Records the events it receives; fails on some element names.
class RecordingHandler : public XMLHandler, public ObjectImpl {
public:
   void OnProcessingInstruction(const std::string& t, const std::string& d) override {
      events += "?" + t + " " + d;
   }
   void OnStartElement(const std::string& name, int line, int column, const char** attrs) override {
      events += "<" + name + "@" + std::to_string(line) + ":" + std::to_string(column);
      for (const char** a = attrs; *a; a += 2) events += std::string(" ") + a[0] + "=" + a[1];
      events += ">";
      if (name == "throwLibrary") throw NotFoundException("thing");
      if (name == "throwOther") throw std::runtime_error("other");
      if (name == "abort") throw ParsingAbortedException();
   }
   void OnEndElement(const std::string& name) override { events += "</" + name + ">"; }
   void OnStartCData() override { events += "[["; }
   void OnEndCData() override { events += "]]"; }
   void OnComment(const std::string& text) override { events += "!" + text; }
   void OnCharacters(const char* data, int n) override {
      events += "'" + std::string(data, n) + "'";
   }
   void OnXMLDeclaration(const std::string& v, const std::string& e, int standalone) override {
      events += "decl(" + v + "," + e + "," + std::to_string(standalone) + ")";
   }
   void StartNewDocument(Ref<Object>& result) override { StartNewDocument(false, result); }
   void StartNewDocument(bool restricted, Ref<Object>& result) override {
      events = restricted ? "start(r)" : "start";
      result = marker;  // any object will do; the parser hands it over
   }
   void CleanUpDocument() override { ++cleanUps; }

   std::string events;
   int cleanUps = 0;
   Ref<Object> marker{new ObjectImpl()};
};

// Hands out the start of a document, then fails.
class FailingReader : public Reader, public ObjectImpl {
public:
   int Read(char* buffer, int length) override {
      if (_sent) throw IOException("connection reset");
      _sent = true;
      return static_cast<int>(std::string("<a><b>").copy(buffer, std::min(length, 6)));
   }
   void Close() override {}

private:
   bool _sent = false;
};

TEST_F(ParserTest, EventsReachTheHandlerInOrderAndCleanUpRunsOnEveryPath) {
   Ref<RecordingHandler> handler = new RecordingHandler();
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   Ref<Object> result;
   parser->Parse("<?xml version='1.0' standalone='yes'?><a x='1'>t<![CDATA[c]]><!--k--><?p d?></a>",
                 result);
   EXPECT_EQ(handler->marker, result);
   EXPECT_EQ("startdecl(1.0,,1)<a@1:38 x=1>'t'[['c']]!k?p d</a>", handler->events);
   EXPECT_EQ(1, handler->cleanUps);

   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<a><throwLibrary/></a>", true));
   EXPECT_THAT(Sink().Take(), testing::ElementsAre(
                                  AllOf(StartsWith("4 Unexpected exception parsing XML document: "),
                                        HasSubstr("thing"))));
   // Events after the stop are not delivered: the empty tag's end is dropped.
   EXPECT_EQ("start(r)<a@1:0><throwLibrary@1:3>", handler->events);
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<throwOther/>", false));
   EXPECT_EQ(Lines{"4 Unknown exception parsing XML document"}, Sink().Take());
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<abort/>", false));
   EXPECT_TRUE(Sink().Take().empty());
   EXPECT_EQ(4, handler->cleanUps);

   // A reader's exception passes through unchanged.
   Ref<FailingReader> reader = new FailingReader();
   result.Reset();
   try {
      parser->Parse(reader.Get(), true, result);
      ADD_FAILURE() << "parsed";
   } catch (const IOException& e) {
      EXPECT_EQ("IO error: connection reset", e.GetMessage());
   }
   EXPECT_EQ(nullptr, result.Get());
   EXPECT_EQ(5, handler->cleanUps);

   // The handler can be exchanged between parses.
   Ref<XMLHandler> standard;
   CreateXMLDocumentHandler(standard);
   parser->SetXMLHandler(standard.Get());
   EXPECT_EQ("<a/>", Reparse(parser.Get(), "<a/>"));
   // And back: the standard handler's direct events stop with it.
   parser->SetXMLHandler(handler.Get());
   parser->Parse("<b>t<!--k--></b>", result);
   EXPECT_EQ("start<b@1:0>'t'!k</b>", handler->events);
}

TEST(ParserDeathTest, MisuseAndNegativeLimitsPanic) {
   Ref<XMLParser> parser;
   EXPECT_DEATH(CreateXMLParser(nullptr, parser), "Assert Failed: \"handler != __null\"");
   Ref<XMLHandler> handler;
   EXPECT_DEATH(CreateXMLDocumentHandler({.maxNodes = -1}, handler), "Assert Failed: \"out >= 0\"");
}

}  // namespace
}  // namespace Pelmora::Xml

namespace Pelmora::Xml {
namespace {

// A pooled parser lives as long as the process: what one huge start tag made the parser
// grow (its input buffer, its attribute arrays) must go with the document, not stay for
// every later one.
TEST(ParserMemoryTest, AHugeStartTagLeavesNoMemoryBehindOnceItsDocumentIsGone) {
   if (!TestSupport::kHeapIsMeasured) GTEST_SKIP() << "the heap in use is not measured here";
   std::string tag = "<r";
   for (int i = 0; i < 200000; ++i) tag += " a" + std::to_string(i) + "='v'";
   const std::string text = tag + "/>";
   Ref<XMLParser> parser = NewParser();
   Parse(parser.Get(), "<warm-up a='1'>x</warm-up>");
   size_t before = HeapInUse();
   for (int round = 0; round < 2; ++round) {
      {
         Ref<Document> document = Parse(parser.Get(), text);
         std::string value;
         ASSERT_TRUE(document->GetChildElementByTag("r")->GetAttribute("a199999", value));
         EXPECT_EQ(value, "v");
      }
      EXPECT_LT(HeapInUse(), before + (size_t(1) << 20)) << "round " << round;
   }
   // And the parser serves on as before.
   EXPECT_EQ(Reparse(parser.Get(), "<a b='1'><c/></a>"), "<a b=\"1\"><c/></a>");
}

}  // namespace
}  // namespace Pelmora::Xml
