#include <gtest/gtest.h>

#include <string>

#include "pelmora/exception.h"
#include "pelmora/formatter.h"
#include "pelmora/io.h"
#include "pelmora/xml.h"
#include "tests/xml/nodeBuilders.h"

namespace Pelmora::Xml {
namespace {

using Testing::Element;
using Testing::Text;
using Testing::Comment;

std::string Compact(const Node* node) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   node->WriteNode(writer.Get());
   return writer->GetString();
}

std::string Pretty(const Node* node) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   node->PrettyWriteNode(writer.Get());
   return writer->GetString();
}

TEST(WriteTextTest, EscapesMarkupAndWritesControlBytesInPercentForm) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   WriteText(writer.Get(), std::string("a<\"\x01\t>&'\n\r\x1b\x7f\xc3\xa9", 14));
   EXPECT_EQ("a&lt;&quot;%01\t&gt;&amp;&apos;\n\r%1b\x7f\xc3\xa9", writer->GetString());
   writer->Reset();
   WriteText(writer.Get(), std::string("\0z", 2));
   EXPECT_EQ("%00z", writer->GetString());

   Ref<ElementNode> element = Element("e");
   element->DefineAttribute("v", "a<\"\x01\tz");
   EXPECT_EQ("<e v=\"a&lt;&quot;%01\tz\"/>", Compact(element.Get()));
}

TEST(WriteNodeTest, AttributesComeInNameOrderAndAreNotReorderedByDefinition) {
   Ref<ElementNode> element = Element("p:e");
   element->DefineAttribute("z", "1");
   element->DefineAttribute("a", "2");
   EXPECT_EQ("<p:e a=\"2\" z=\"1\"/>", Compact(element.Get()));
   element->AppendChild(Text("t").Get());
   EXPECT_EQ("<p:e a=\"2\" z=\"1\">t</p:e>", Compact(element.Get()));
}

// <a><b/><c>x<d/></c><!--note--><e><![CDATA[<raw>]]></e></a>
Ref<ElementNode> MixedTree() {
   Ref<ElementNode> a = Element("a"), c = Element("c"), e = Element("e");
   a->AppendChild(Element("b").Get());
   c->AppendChild(Text("x").Get());
   c->AppendChild(Element("d").Get());
   a->AppendChild(c.Get());
   a->AppendChild(Comment("note").Get());
   Ref<CDataNode> cdata;
   CreateCDataNode(cdata);
   cdata->AppendChild(Text("<raw>").Get());
   cdata->AppendChild(Text("]]>").Get());  // not split: the writer trusts the content
   e->AppendChild(cdata.Get());
   a->AppendChild(e.Get());
   return a;
}

TEST(WriteNodeTest, CompactFormAddsNothingButTheCommentsLineFeed) {
   EXPECT_EQ("<a><b/><c>x<d/></c><!--note-->\n<e><![CDATA[<raw>]]>]]></e></a>",
             Compact(MixedTree().Get()));
}

TEST(WriteNodeTest, PrettyFormLaysOutBlocksWhenTheFirstChildIsAnElementOrComment) {
   EXPECT_EQ(
       "<a>\n"
       "  <b/>\n"
       // Text first: the children follow directly, each element still indented.
       "  <c>x    <d/></c>\n"
       // The comment's own line feed and the block's make an empty line.
       "  <!--note-->\n"
       "\n"
       "  <e><![CDATA[<raw>]]>]]></e>\n"
       "</a>",
       Pretty(MixedTree().Get()));

   Ref<ElementNode> a = Element("a");
   a->AppendChild(Element("b").Get());
   a->AppendChild(Element("c").Get());
   EXPECT_EQ("<a>\n  <b/>\n  <c/>\n</a>", Pretty(a.Get()));
   EXPECT_EQ("<x/>", Pretty(Element("x").Get()));

   // Writing a subtree starts at its own level and stops at its own end.
   Ref<ElementNode> b = Element("b"), c = Element("c");
   Ref<ElementNode> outer = Element("outer");
   b->AppendChild(c.Get());
   outer->AppendChild(b.Get());
   outer->AppendChild(Element("after").Get());
   EXPECT_EQ("<b>\n  <c/>\n</b>", Pretty(b.Get()));
   EXPECT_EQ("<b><c/></b>", Compact(b.Get()));
}

TEST(WriteNodeTest, ProcessingInstructionsAndCommentsWriteTheirTextUnescaped) {
   Ref<ProcessingInstructionNode> pi;
   CreateProcessingInstructionNode("target", "a<b", pi);
   EXPECT_EQ("<?target a<b?>", Compact(pi.Get()));
   EXPECT_EQ("<?target a<b?>", Pretty(pi.Get()));
   EXPECT_EQ("<!--x&y-->\n", Compact(Comment("x&y").Get()));
}

TEST(WriteNodeTest, ADocumentWritesItsDeclarationOnlyWithAVersion) {
   Ref<Document> document;
   CreateDocument(document);
   try {
      Compact(document.Get());
      ADD_FAILURE() << "a rootless document was written";
   } catch (const InvalidStateException& e) {
      EXPECT_EQ("No root - no doc.", e.GetMessage());
   }

   Ref<ProcessingInstructionNode> pi;
   CreateProcessingInstructionNode("style", "x", pi);
   document->AppendChild(Comment("top").Get());
   document->AppendChild(pi.Get());
   Ref<ElementNode> root = Element("r");
   root->AppendChild(Element("c").Get());
   document->AppendChild(root.Get());
   EXPECT_EQ("<!--top-->\n<?style x?><r><c/></r>", Compact(document.Get()));

   document->SetXMLVersion("1.0");
   EXPECT_EQ("<?xml version=\"1.0\"?>\n<!--top-->\n<?style x?><r>\n  <c/>\n</r>",
             Pretty(document.Get()));
   document->SetEncoding("UTF-8");
   EXPECT_EQ("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<!--top-->\n<?style x?><r><c/></r>",
             Compact(document.Get()));
   document->SetXMLVersion("");
   EXPECT_EQ("<!--top-->\n<?style x?><r><c/></r>", Compact(document.Get()));
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
