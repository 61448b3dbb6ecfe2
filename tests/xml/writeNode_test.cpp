#include <gtest/gtest.h>

#include <string>

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
   // A CDATA node's content is not split: the writer trusts it.
   a->GetLastChild()->GetFirstChild()->AppendChild(Text("]]>").Get());

   // Compact form adds nothing but the comment's line feed.
   EXPECT_EQ("<a><b/><c>x<d/></c><!--note-->\n<e><![CDATA[<raw>]]>]]></e></a>", Write(a));
   // A subtree starts at its own level and stops at its own end.
   EXPECT_EQ(
       "<a>\n"
       "  <b/>\n"
       "  <c>x    <d/></c>\n"  // text first: children follow directly, elements still indented
       "  <!--note-->\n"
       "\n"  // the comment's own line feed and the block's
       "  <e><![CDATA[<raw>]]>]]></e>\n"
       "</a>",
       Write(a, true));
   EXPECT_EQ("<x/>", Write(Element("x").Get(), true));
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
