#include <gtest/gtest.h>

#include <initializer_list>
#include <string>
#include <utility>

#include "pelmora/exception.h"
#include "pelmora/formatter.h"
#include "tests/xml/nodeBuilders.h"

namespace Pelmora::Xml {
namespace {

using Testing::Comment;
using Testing::Element;
using Testing::Text;
using Testing::Write;

TEST(WriteNodeTest, TextEscapesMarkupAndWritesControlBytesInPercentForm) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   WriteText(writer.Get(), std::string("a<\"\x01\t>&'\n\r\x1b\x7f\xc3\xa9\0z", 16));
   EXPECT_EQ("a&lt;&quot;%01\t&gt;&amp;&apos;\n\r%1b\x7f\xc3\xa9%00z", writer->GetString());
   Ref<ElementNode> element = Element("e");
   element->DefineAttribute("v", "a<\"\x01\tz");
   EXPECT_EQ("<e v=\"a&lt;&quot;%01\tz\"/>", Write(element.Get()));
   // Comments and processing instructions are written unescaped.
   Ref<ProcessingInstructionNode> pi;
   CreateProcessingInstructionNode("target", "a<b", pi);
   EXPECT_EQ("<?target a<b?>", Write(pi.Get(), true));
   EXPECT_EQ("<!--x&y-->\n", Write(Comment("x&y").Get()));
}

TEST(WriteNodeTest, PrettyFormLaysOutBlocksWhenTheFirstChildIsAnElementOrComment) {
   Ref<Document> document = Testing::Parse(
       "<outer><a><b/><c>x<d/></c><!--note--><e><![CDATA[<raw>]]></e></a><after/></outer>");
   ElementNode* a = document->GetRoot()->GetChildElementByTag("a");
   a->GetLastChild()->GetFirstChild()->AppendChild(Text("]]").Get());

   // Compact form adds nothing but the comment's line feed.
   EXPECT_EQ("<a><b/><c>x<d/></c><!--note-->\n<e><![CDATA[<raw>]]]]></e></a>", Write(a));
   // A subtree starts at its own level and stops at its own end.
   EXPECT_EQ(
       "<a>\n"
       "  <b/>\n"
       "  <c>x    <d/></c>\n"  // text first: children follow directly, elements still indented
       "  <!--note-->\n"
       "\n"  // the comment's own line feed and the block's
       "  <e><![CDATA[<raw>]]]]></e>\n"
       "</a>",
       Write(a, true));
   EXPECT_EQ("<x/>", Write(Element("x").Get(), true));
}

// The message of the InvalidArgumentException that `f` raises, or "none".
template <class F>
std::string Refusal(F f) {
   try {
      f();
   } catch (const InvalidArgumentException& e) {
      return e.GetMessage();
   }
   return "none";
}

// Names that would not read back as one name are refused when set; the element keeps
// its old name.
TEST(WriteNodeTest, NamesThatCannotBeWrittenAreRefused) {
   const std::pair<const char*, const char*> bad[] = {
       {"", "\"\" is empty"},
       {"1a", "\"1a\" starts with a digit"},
       {"-a", "\"-a\" starts with \"-\" or \".\""},
       {"a b", "\"a b\" holds a blank"},
       {"a\tb", "\"a\tb\" holds a blank"},
       {"a\"", "\"a\"\" holds a quote"},
       {"a'", "\"a'\" holds a quote"},
       {"a=", "\"a=\" holds \"=\""},
       {"a>", "\"a>\" holds a character that names may not hold"},
       {"a/", "\"a/\" holds a character that names may not hold"}};
   Ref<ElementNode> element = Element("e");
   for (auto [name, problem] : bad) {
      std::string prefix = "Invalid argument : ";
      EXPECT_EQ(prefix + "element name " + problem,
                Refusal([&] { Ref<ElementNode> node; CreateElementNode(name, node); }));
      EXPECT_EQ(prefix + "element name " + problem, Refusal([&] { element->SetTag(name); }));
      EXPECT_EQ(prefix + "attribute name " + problem,
                Refusal([&] { element->DefineAttribute(name, "v"); }));
   }
   // The injection the check exists for: one name posing as two attributes.
   EXPECT_NE("none", Refusal([&] { element->DefineAttribute("a=\"x\" b", "y"); }));
   EXPECT_EQ("Invalid argument : element name \"1p:t\" starts with a digit",
             Refusal([&] { Ref<ElementNode> node; CreateElementNode("1p", "t", node); }));
   EXPECT_EQ("Invalid argument : element name \" \" holds a blank",
             Refusal([&] { Ref<ElementNode> node; CreateElementNode("", " ", node); }));
   EXPECT_EQ("Invalid argument : element name \"a b:e\" holds a blank",
             Refusal([&] { element->SetPrefix("a b"); }));
   EXPECT_EQ("<e/>", Write(element.Get()));

   // What XML allows stays allowed, UTF-8 included.
   for (const char* name : {"_a", ":a", "a.b-c9", "x:y", "\xc3\xa9t\xc3\xa9", "a:"}) {
      EXPECT_EQ("none", Refusal([&] { element->DefineAttribute(name, "v"); })) << name;
      EXPECT_EQ("none", Refusal([&] { Write(Element(name).Get()); })) << name;
   }
   element->SetPrefix("p");
   element->SetTag("t");
   EXPECT_EQ("<p:t :a=\"v\" _a=\"v\" a.b-c9=\"v\" a:=\"v\" x:y=\"v\" \xc3\xa9t\xc3\xa9=\"v\"/>",
             Write(element.Get()));
}

// Content that would end a comment, CDATA section or processing instruction early is
// refused when written, before anything of that node reaches the writer.
TEST(WriteNodeTest, ContentThatWouldEndItsNodeEarlyIsRefused) {
   auto cdata = [](std::initializer_list<const char*> texts) {
      Ref<CDataNode> node;
      CreateCDataNode(node);
      for (const char* text : texts) node->AppendChild(Text(text).Get());
      return node;
   };
   auto pi = [](const char* target, const char* data) {
      Ref<ProcessingInstructionNode> node;
      CreateProcessingInstructionNode(target, data, node);
      return node;
   };
   std::string prefix = "Invalid argument : ";
   const std::pair<Ref<Node>, std::string> refused[] = {
       {Comment("a--b"), "comment holds \"--\""},
       {Comment("--"), "comment holds \"--\""},
       {Comment("a-"), "comment ends in \"-\""},
       {cdata({"a]]>b"}), "CDATA section holds \"]]>\""},
       {cdata({"a]", "]", ">b"}), "CDATA section holds \"]]>\""},
       {cdata({"a]]", ">"}), "CDATA section holds \"]]>\""},
       {pi("", "d"), "processing-instruction target \"\" is empty"},
       {pi("xml", "d"), "processing-instruction target \"xml\" is reserved"},
       {pi("XmL", "d"), "processing-instruction target \"XmL\" is reserved"},
       {pi("a b", "d"), "processing-instruction target \"a b\" holds a blank"},
       {pi("t", "a?>b"), "processing-instruction data holds \"?>\""}};
   for (const auto& [node, problem] : refused) {
      Ref<StringWriter> writer;
      CreateStringWriter(writer);
      EXPECT_EQ(prefix + problem, Refusal([&] { node->PrettyWriteNode(writer.Get()); }));
      EXPECT_EQ("", writer->GetString()) << problem;
   }
   // Inside a tree the refusal stops the whole write.
   Ref<ElementNode> root = Element("r");
   root->AppendChild(Comment("bad-").Get());
   EXPECT_EQ(prefix + "comment ends in \"-\"", Refusal([&] { Write(root.Get()); }));

   // Near misses stay writable.
   EXPECT_EQ("<!-- a - b -->\n", Write(Comment(" a - b ").Get()));
   EXPECT_EQ("<!---a-->\n", Write(Comment("-a").Get()));
   EXPECT_EQ("<![CDATA[]] ]>]>]]>", Write(cdata({"]] ]", ">", "]>"}).Get()));
   EXPECT_EQ("<?xml-stylesheet a?b>?>", Write(pi("xml-stylesheet", "a?b>").Get()));
   EXPECT_EQ("<?xmlx ?>", Write(pi("xmlx", "").Get()));
}

TEST(WriteNodeTest, ADocumentWritesItsDeclarationOnlyWithAVersion) {
   Ref<Document> document;
   CreateDocument(document);
   try {
      Write(document.Get());
      ADD_FAILURE() << "a rootless document was written";
   } catch (const InvalidStateException& e) {
      EXPECT_EQ("No root - no doc.", e.GetMessage());
   }
   Ref<ElementNode> root = Element("r");
   root->AppendChild(Element("c").Get());
   document->AppendChild(Comment("top").Get());
   document->AppendChild(root.Get());
   EXPECT_EQ("<!--top-->\n<r><c/></r>", Write(document.Get()));
   document->SetXMLVersion("1.0");
   EXPECT_EQ("<?xml version=\"1.0\"?>\n<!--top-->\n<r>\n  <c/>\n</r>", Write(document.Get(), true));
   document->SetEncoding("UTF-8");
   document->SetXMLVersion("");
   EXPECT_EQ("<!--top-->\n<r><c/></r>", Write(document.Get()));
}

TEST(WriteNodeTest, ANodeIsAMessageArgument) {
   Ref<ElementNode> element = Element("e");
   element->DefineAttribute("k", "<v>");
   const Node* raw = element.Get();
   EXPECT_EQ("got <e k=\"&lt;v&gt;\"/>", MessageFormatter::ASPrint("got %1", element));
   EXPECT_EQ("<e k=\"&lt;v&gt;\"/>", MessageFormatter::ASPrint("%1", raw));
   EXPECT_EQ("<e k=\"&lt;v&gt;\"/>", MessageFormatter::ASPrint("%1", *raw));
   EXPECT_EQ("(null)", MessageFormatter::ASPrint("%1", static_cast<const Node*>(nullptr)));
   // Other references still format as objects.
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   EXPECT_EQ(writer->ToString(), MessageFormatter::ASPrint("%1", writer));
}

}  // namespace
}  // namespace Pelmora::Xml
