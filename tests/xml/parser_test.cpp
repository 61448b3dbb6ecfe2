#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>
#include <stdexcept>
#include <string>
#include <vector>

#include "pelmora/exception.h"
#include "pelmora/io.h"
#include "pelmora/xml.h"
#include "src/core/report.h"
#include "tests/support/logCapture.h"

namespace Pelmora::Xml {
namespace {

// Collects what the XML layer logs; it must outlive every caller.
TestSupport::LogCapture& Sink() {
   static TestSupport::LogCapture* sink = new TestSupport::LogCapture();
   return *sink;
}

class ParserTest : public testing::Test {
protected:
   void SetUp() override {
      Sink().Take();
      Internal::SetReportSink(&Sink());
   }
   void TearDown() override { Internal::SetReportSink(nullptr); }

   static Ref<XMLParser> NewParser(const DocLimits& limits = DocLimits()) {
      Ref<XMLHandler> handler;
      CreateXMLDocumentHandler(limits, handler);
      Ref<XMLParser> parser;
      CreateXMLParser(handler.Get(), parser);
      return parser;
   }

   static Ref<Document> Parse(XMLParser* parser, const std::string& text, bool restricted) {
      Ref<Object> result;
      parser->Parse(text, restricted, result);
      return result.Cast<Document>();
   }

   static std::string Compact(const Node* node) {
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      node->WriteNode(writer.Get());
      return writer->GetString();
   }

   // The message of the XMLParseException the parse raises, or "parsed".
   static std::string Failure(XMLParser* parser, const std::string& text, bool restricted,
                              int* line = nullptr) {
      try {
         Parse(parser, text, restricted);
         return "parsed";
      } catch (const XMLParseException& e) {
         if (line) *line = e.GetLineNumber();
         return e.GetMessage();
      }
   }
};

TEST_F(ParserTest, BuildsTheDocumentWithEveryKindOfNode) {
   Ref<XMLParser> parser = NewParser();
   Ref<Document> document = Parse(parser.Get(),
                                  "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
                                  "<!--lead--><?app go?>\n"
                                  "<s:Envelope xmlns:s=\"urn:s\" b=\"2\" a=\"1&amp;\">\n"
                                  "  <s:Body>a&amp;b\nc<![CDATA[<x>&]]><!--in--></s:Body>\n"
                                  "</s:Envelope>",
                                  false);
   EXPECT_EQ("1.0", document->GetXMLVersion());
   EXPECT_EQ("UTF-8", document->GetEncoding());
   EXPECT_EQ(kCommentNode, document->GetFirstChild()->GetNodeType());
   EXPECT_EQ(kProcessingInstructionNode,
             document->GetFirstChild()->GetNextSibling()->GetNodeType());

   ElementNode* root = document->GetRoot();
   ASSERT_NE(nullptr, root);
   EXPECT_EQ("s", root->GetPrefix());
   EXPECT_EQ("Envelope", root->GetTag());
   EXPECT_EQ(3, root->GetLineNumber());
   EXPECT_EQ(0, root->GetColumnNumber());
   ElementNode* body = root->GetChildElementByQName(QName("urn:s", "Body"));
   ASSERT_NE(nullptr, body);
   EXPECT_EQ(4, body->GetLineNumber());
   EXPECT_EQ(2, body->GetColumnNumber());

   // Text split by a reference and a line end is one node; CDATA content lands in its node.
   auto* text = dynamic_cast<TextNode*>(body->GetFirstChild());
   ASSERT_NE(nullptr, text);
   EXPECT_EQ("a&b\nc", text->GetText());
   Node* cdata = text->GetNextSibling();
   EXPECT_EQ(kCDataNode, cdata->GetNodeType());
   EXPECT_EQ("<x>&", dynamic_cast<TextNode*>(cdata->GetFirstChild())->GetText());
   EXPECT_EQ(kCommentNode, cdata->GetNextSibling()->GetNodeType());

   EXPECT_EQ(
       "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<!--lead-->\n<?app go?>"
       "<s:Envelope a=\"1&amp;\" b=\"2\" xmlns:s=\"urn:s\">\n  "
       "<s:Body>a&amp;b\nc<![CDATA[<x>&]]><!--in-->\n</s:Body>\n</s:Envelope>",
       Compact(document.Get()));
   EXPECT_TRUE(Sink().Take().empty());
}

TEST_F(ParserTest, ASerialisedDocumentParsesBackToTheSameSerialisation) {
   Ref<XMLParser> parser = NewParser();
   std::string first = Compact(Parse(parser.Get(),
                                     "<?xml version='1.0'?><!-- c --><r xmlns='urn:d' "
                                     "q='&quot;&apos;'><a>x &lt; y &gt; z\t</a><b><![CDATA[]]></b>"
                                     "<c>\xc3\xa9</c><d/></r>",
                                     false)
                                   .Get());
   std::string second = Compact(Parse(parser.Get(), first, false).Get());
   EXPECT_EQ(first, second);
   EXPECT_EQ(Compact(Parse(parser.Get(), second, true).Get()), second);

   // Names that are legal XML but not namespace-well-formed survive too.
   EXPECT_EQ("<:><a:/></:>", Compact(Parse(parser.Get(), "<:><a:/></:>", false).Get()));

   // Inside an element, a comment's line feed comes back as text: each round adds one.
   std::string withComment = Compact(Parse(parser.Get(), "<r><!--c--></r>", false).Get());
   EXPECT_EQ("<r><!--c-->\n</r>", withComment);
   EXPECT_EQ("<r><!--c-->\n\n</r>", Compact(Parse(parser.Get(), withComment, false).Get()));
}

TEST_F(ParserTest, BadInputRaisesXMLParseExceptionWithExpatsTextAndTheLine) {
   Ref<XMLParser> parser = NewParser();
   int line = 0;
   EXPECT_EQ("no element found", Failure(parser.Get(), "", false, &line));
   EXPECT_EQ(1, line);
   EXPECT_EQ("mismatched tag", Failure(parser.Get(), "<a>\n<b>\n</a>", false, &line));
   EXPECT_EQ(3, line);
   // A repeated attribute is refused before the handler sees it.
   EXPECT_EQ("duplicate attribute", Failure(parser.Get(), "<a x='1' x='2'/>", false));
   EXPECT_EQ("junk after document element", Failure(parser.Get(), "<a/><b/>", false));
   // The same parser goes on serving after each failure.
   EXPECT_EQ("<a>ok</a>", Compact(Parse(parser.Get(), "<a>ok</a>", false).Get()));
   EXPECT_TRUE(Sink().Take().empty());
}

TEST_F(ParserTest, AnInsertionTheModelRefusesStopsTheParseAndIsLogged) {
   Ref<XMLParser> parser = NewParser();
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<a><?pi inside?></a>", false));
   std::vector<std::string> lines = Sink().Take();
   ASSERT_EQ(1u, lines.size());
   EXPECT_EQ(0u, lines[0].find("4 Unexpected exception parsing XML document: "));
   EXPECT_NE(std::string::npos,
             lines[0].find("(Invalid argument : Elements cannot have document or PI children.)"));
}

const char kEntityDocument[] = "<!DOCTYPE r [<!ENTITY who \"world\">]>\n<r>hello &who;</r>";

TEST_F(ParserTest, RestrictedParsesRefuseEntityDeclarationsAndNameTheEntity) {
   Ref<XMLParser> parser = NewParser();
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), kEntityDocument, true));
   EXPECT_EQ(std::vector<std::string>{"4 XML entity \"who\" was defined in the input.\n"
                                      "The parser is configured to reject XML entity "
                                      "definitions."},
             Sink().Take());

   Ref<Document> document = Parse(parser.Get(), kEntityDocument, false);
   EXPECT_EQ("<r>hello world</r>", Compact(document.Get()));

   EXPECT_EQ("parsing aborted",
             Failure(parser.Get(), "<!DOCTYPE r [<!ENTITY % p \"x\">]><r/>", true));
   EXPECT_EQ(1u, Sink().Take().size());
   EXPECT_EQ("parsing aborted", Failure(parser.Get(),
                                        "<!DOCTYPE r [<!ENTITY ext SYSTEM \"file:///etc/passwd\">]>"
                                        "<r/>",
                                        true));
   EXPECT_EQ(1u, Sink().Take().size());
   // A document type without entities is fine.
   EXPECT_EQ("parsed", Failure(parser.Get(), "<!DOCTYPE r [<!ELEMENT r ANY>]><r/>", true));
}

TEST_F(ParserTest, ARestrictedBillionLaughsIsRefusedAtTheFirstDeclaration) {
   std::string text = "<!DOCTYPE lolz [\n<!ENTITY lol \"lol\">\n";
   for (int i = 1; i < 10; ++i) {
      text += "<!ENTITY lol" + std::to_string(i) + " \"";
      for (int j = 0; j < 10; ++j)
         text += "&lol" + (i == 1 ? std::string() : std::to_string(i - 1)) + ";";
      text += "\">\n";
   }
   text += "]>\n<lolz>&lol9;</lolz>";
   Ref<XMLParser> parser = NewParser();
   int line = 0;
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), text, true, &line));
   EXPECT_EQ(2, line);
   std::vector<std::string> lines = Sink().Take();
   ASSERT_EQ(1u, lines.size());
   EXPECT_NE(std::string::npos, lines[0].find("\"lol\""));
}

// `depth` nested elements <e>, the innermost empty.
std::string Nested(int depth) {
   std::string text;
   for (int i = 0; i < depth; ++i) text += "<e>";
   for (int i = 0; i < depth; ++i) text += "</e>";
   return text;
}

TEST_F(ParserTest, TheDepthLimitCountsTheDocumentAndAppliesOnlyToRestrictedParses) {
   DocLimits limits;
   limits.maxDepth = 50;
   Ref<XMLParser> parser = NewParser(limits);
   EXPECT_EQ("parsed", Failure(parser.Get(), Nested(49), true));
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), Nested(50), true));
   EXPECT_EQ(std::vector<std::string>{"8 XML document too deep: 51 (max: 50)"}, Sink().Take());
   EXPECT_EQ("parsed", Failure(parser.Get(), Nested(5000), false));
   EXPECT_TRUE(Sink().Take().empty());
}

TEST_F(ParserTest, TheNodeLimitAcceptsExactlyTheLimit) {
   DocLimits limits;
   limits.maxNodes = 6;
   Ref<XMLParser> parser = NewParser(limits);
   // Element, text, comment, CDATA (with its text), element: six nodes.
   const std::string six = "<r>t<!--c--><![CDATA[d]]><e/></r>";
   EXPECT_EQ("parsed", Failure(parser.Get(), six, true));
   EXPECT_EQ("parsing aborted",
             Failure(parser.Get(), "<r>t<!--c--><![CDATA[d]]><e/><f/></r>", true));
   EXPECT_EQ(std::vector<std::string>{"8 XML document has too many nodes: 7 (max: 6)"},
             Sink().Take());
   // Merged character data adds bytes, not nodes.
   EXPECT_EQ("parsed", Failure(parser.Get(), "<r>a&amp;b&lt;c\nd<x/><y/><z/><w/></r>", true));
   EXPECT_EQ("parsed", Failure(parser.Get(), "<r><a/><b/><c/><d/><e/><f/><g/></r>", false));
}

TEST_F(ParserTest, TheByteLimitCountsNamesAttributesAndCharacterData) {
   DocLimits limits;
   limits.maxChars = 12;
   Ref<XMLParser> parser = NewParser(limits);
   // "root" 4, "k" + "vv" 3, "hello" 5: twelve bytes.
   EXPECT_EQ("parsed", Failure(parser.Get(), "<root k='vv'>hello</root>", true));
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<root k='vv'>hello!</root>", true));
   EXPECT_EQ(std::vector<std::string>{"8 XML document too long: 13 (max: 12)"}, Sink().Take());
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<root k='vvvvvvvvvv'/>", true));
   EXPECT_EQ(1u, Sink().Take().size());
   EXPECT_EQ("parsed", Failure(parser.Get(), "<root k='vv'>hello, world</root>", false));
}

TEST_F(ParserTest, ParsedNodesOutliveTheirDocumentAndMixWithBuiltOnes) {
   Ref<XMLParser> parser = NewParser();
   Ref<ElementNode> kept;
   {
      Ref<Document> document = Parse(parser.Get(), "<r><keep a='1'>text</keep><drop/></r>", false);
      kept = document->GetRoot()->GetChildElementByTag("keep");
      Ref<ElementNode> built;
      CreateElementNode("built", built);
      document->GetRoot()->AppendChild(built.Get());
      // The parser's next document must not disturb the nodes of this one.
      Parse(parser.Get(), "<other>" + std::string(50000, 'x') + "</other>", false);
   }
   EXPECT_EQ(nullptr, kept->GetParent());
   EXPECT_EQ("<keep a=\"1\">text</keep>", Compact(kept.Get()));
   Ref<ElementNode> holder;
   CreateElementNode("holder", holder);
   holder->AppendChild(kept.Get());
   kept.Reset();
   EXPECT_EQ("<holder><keep a=\"1\">text</keep></holder>", Compact(holder.Get()));
}

TEST_F(ParserTest, TextSpanningManyReadBlocksIsOneNode) {
   std::string body(100000, 'x');
   for (size_t i = 0; i < body.size(); i += 977) body[i] = '\n';
   Ref<XMLParser> parser = NewParser();
   Ref<Document> document = Parse(parser.Get(), "<r>" + body + "</r>", false);
   Node* text = document->GetRoot()->GetFirstChild();
   EXPECT_EQ(nullptr, text->GetNextSibling());
   EXPECT_EQ(body, dynamic_cast<TextNode*>(text)->GetText());
}

// Records the events it receives; can be told to fail on an element.
class RecordingHandler : public XMLHandler, public ObjectImpl {
public:
   void OnProcessingInstruction(const std::string& target, const std::string& data) override {
      events += "pi(" + target + "," + data + ")";
   }
   void OnStartElement(const std::string& name, int line, int column,
                       const char** attributes) override {
      events += "<" + name + "@" + std::to_string(line) + ":" + std::to_string(column);
      for (const char** a = attributes; *a; a += 2) events += std::string(" ") + a[0] + "=" + a[1];
      events += ">";
      if (name == "throwLibrary") throw NotFoundException("thing");
      if (name == "throwOther") throw std::runtime_error("other");
      if (name == "abort") throw ParsingAbortedException();
   }
   void OnEndElement(const std::string& name) override { events += "</" + name + ">"; }
   void OnStartCData() override { events += "[["; }
   void OnEndCData() override { events += "]]"; }
   void OnComment(const std::string& text) override { events += "!" + text; }
   void OnCharacters(const char* data, int length) override {
      events += "'" + std::string(data, length) + "'";
   }
   void OnXMLDeclaration(const std::string& version, const std::string& encoding,
                         int standalone) override {
      events += "decl(" + version + "," + encoding + "," + std::to_string(standalone) + ")";
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

TEST_F(ParserTest, EventsReachTheHandlerInOrderAndCleanUpRunsOnEveryPath) {
   Ref<RecordingHandler> handler = new RecordingHandler();
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   EXPECT_EQ(handler.Get(), parser->GetXMLHandler());

   Ref<Object> result;
   parser->Parse("<?xml version='1.0' standalone='yes'?><a x='1'>t<![CDATA[c]]><!--k--></a>",
                 result);
   EXPECT_EQ(handler->marker, result);
   EXPECT_EQ("startdecl(1.0,,1)<a@1:38 x=1>'t'[['c']]!k</a>", handler->events);
   EXPECT_EQ(1, handler->cleanUps);

   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<a><throwLibrary/></a>", true));
   EXPECT_EQ(2, handler->cleanUps);
   std::vector<std::string> lines = Sink().Take();
   ASSERT_EQ(1u, lines.size());
   EXPECT_EQ(0u, lines[0].find("4 Unexpected exception parsing XML document: "));
   EXPECT_NE(std::string::npos, lines[0].find("thing"));
   // Events after the stop are not delivered: the empty tag's end is dropped.
   EXPECT_EQ("start(r)<a@1:0><throwLibrary@1:3>", handler->events);

   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<throwOther/>", false));
   EXPECT_EQ(std::vector<std::string>{"4 Unknown exception parsing XML document"}, Sink().Take());
   EXPECT_EQ("parsing aborted", Failure(parser.Get(), "<abort/>", false));
   EXPECT_TRUE(Sink().Take().empty());
   EXPECT_EQ(4, handler->cleanUps);
}

// Hands out its text in small pieces, then fails.
class FailingReader : public Reader, public ObjectImpl {
public:
   int Read(char* buffer, int length) override {
      if (_sent) throw IOException("connection reset");
      _sent = true;
      const char text[] = "<a><b>";
      int count = std::min<int>(length, sizeof(text) - 1);
      std::copy(text, text + count, buffer);
      return count;
   }
   void Close() override {}

private:
   bool _sent = false;
};

TEST_F(ParserTest, ReaderExceptionsPassThroughUnchanged) {
   Ref<RecordingHandler> handler = new RecordingHandler();
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   Ref<FailingReader> reader = new FailingReader();
   Ref<Object> result;
   try {
      parser->Parse(reader.Get(), true, result);
      ADD_FAILURE() << "parsed";
   } catch (const IOException& e) {
      EXPECT_EQ("IO error: connection reset", e.GetMessage());
   }
   EXPECT_EQ(nullptr, result.Get());
   EXPECT_EQ(1, handler->cleanUps);

   // The handler can be exchanged between parses.
   Ref<XMLHandler> standard;
   CreateXMLDocumentHandler(standard);
   parser->SetXMLHandler(standard.Get());
   EXPECT_EQ("<a/>", Compact(Parse(parser.Get(), "<a/>", false).Get()));
}

TEST(ParserDeathTest, MisuseAndNegativeLimitsPanic) {
   Ref<XMLParser> parser;
   EXPECT_DEATH(CreateXMLParser(nullptr, parser), "Assert Failed: \"handler != __null\"");
   DocLimits limits;
   limits.maxNodes = -1;
   Ref<XMLHandler> handler;
   EXPECT_DEATH(CreateXMLDocumentHandler(limits, handler), "Assert Failed: \"out >= 0\"");
}

TEST_F(ParserTest, HandlersWithoutExplicitLimitsTakeTheDocumentedDefaults) {
   const DocLimits defaults;
   EXPECT_EQ(2147483648LL, defaults.maxChars);
   EXPECT_EQ(2097152, defaults.maxNodes);
   EXPECT_EQ(8192, defaults.maxDepth);

   // The pool's parsers carry such handlers; the depth limit is the one cheap to reach.
   Ref<XMLParserPool::ParserLease> lease;
   GetXmlParserPool()->GetParserLease(lease);
   XMLParser* parser = lease->GetParser();
   EXPECT_EQ("parsed", Failure(parser, Nested(8191), true));
   EXPECT_EQ("parsing aborted", Failure(parser, Nested(8192), true));
   EXPECT_EQ(std::vector<std::string>{"8 XML document too deep: 8193 (max: 8192)"}, Sink().Take());
}

}  // namespace
}  // namespace Pelmora::Xml
