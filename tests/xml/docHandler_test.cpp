// The document handler: texts made whole from expat's pieces, and the memory a large text
// leaves behind once its document is gone.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "pelmora/xml.h"
#include "tests/support/heap.h"
#include "tests/xml/nodeBuilders.h"

namespace Pelmora::Xml {
namespace {

using Testing::NewParser;
using TestSupport::HeapInUse;

// The root's children: "t:" and the text of a text node, "c" for a comment, "e" for an
// element, "[" and the texts of a CDATA section's children "]".
std::vector<std::string> Children(XMLParser* parser, const std::string& text) {
   Ref<Object> result;
   parser->Parse(text, false, result);
   std::vector<std::string> children;
   for (Node* child = result.Cast<Document>()->GetRoot()->GetFirstChild(); child;
        child = child->GetNextSibling()) {
      switch (child->GetNodeType()) {
         case kTextNode:
            children.push_back("t:" + dynamic_cast<TextNode*>(child)->GetText());
            break;
         case kCDataNode: {
            std::string section = "[";
            for (Node* inner = child->GetFirstChild(); inner; inner = inner->GetNextSibling())
               section += dynamic_cast<TextNode*>(inner)->GetText();
            children.push_back(section + "]");
            break;
         }
         default:
            children.push_back(child->GetNodeType() == kCommentNode ? "c" : "e");
      }
   }
   return children;
}

// Expat hands a text over in pieces, split at references and line ends; whatever the
// pieces, around the size a node holds without a heap buffer (15 bytes), each text is one
// node, and whatever comes next starts a new one.
TEST(DocHandlerTest, TextsAreWholeHoweverTheyArrive) {
   const std::string longer(40, 'p');
   const std::vector<std::string> expected = {
       "t:plain",
       "e",
       "t:a single piece longer than a short string",
       "c",
       "t:a&b",
       "[in&amp;]",
       "t:x\ny\nz<0123456789abcdef>",
       "e",
       "t:0123456789abcd&",
       "c",
       "t:0123456789abcde&",
       "e",
       "t:" + longer + "&q\n",
   };
   Ref<XMLParser> parser = NewParser();
   for (int round = 0; round < 2; ++round) {
      EXPECT_EQ(expected,
                Children(parser.Get(),
                         "<r>plain<e/>a single piece longer than a short string<!--c-->"
                         "a&amp;b<![CDATA[in&amp;]]>x\ny\nz&lt;0123456789abcdef&gt;<e/>"
                         "0123456789abcd&amp;<!--c-->0123456789abcde&amp;<e/>" +
                             longer + "&amp;q\n</r>"))
          << round;
   }
}

// A parse stopped while a text was being assembled leaves nothing of it to the next one.
TEST(DocHandlerTest, AnAbortedTextDoesNotLeakIntoTheNextDocument) {
   Ref<XMLParser> parser = NewParser({.maxChars = 25});
   Ref<Object> result;
   // "r", then 20 bytes, a reference that outgrows them, and ten bytes too many.
   EXPECT_THROW(parser->Parse("<r>" + std::string(20, 'a') + "&amp;bbbbbbbbbb</r>", true, result),
                XMLParseException);
   EXPECT_EQ(std::vector<std::string>{"t:x&y"}, Children(parser.Get(), "<r>x&amp;y</r>"));
   EXPECT_EQ(std::vector<std::string>{"t:" + std::string(20, 'x') + "&y"},
             Children(parser.Get(), "<r>" + std::string(20, 'x') + "&amp;y</r>"));
}

// A pooled parser lives as long as the process: once a document is gone, the memory of
// its text must be too, not kept by the handler for the next document.
TEST(DocHandlerTest, ALargeTextLeavesNoMemoryBehindOnceItsDocumentIsGone) {
   if (!TestSupport::kHeapIsMeasured) GTEST_SKIP() << "the heap in use is not measured here";
   Ref<XMLHandler> handler;
   CreateXMLDocumentHandler(handler);
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   size_t before = HeapInUse();
   {
      Ref<Object> result;
      parser->Parse("<r>" + std::string(size_t(64) << 20, 'x') + "</r>", false, result);
   }
   EXPECT_LT(HeapInUse(), before + (size_t(8) << 20));

   // Nor when the parse stops while the text is being put together from its pieces.
   Ref<XMLParser> limited = NewParser({.maxChars = 32 << 20});
   Ref<Object> result;
   EXPECT_THROW(limited->Parse("<r>" + std::string(size_t(64) << 20, 'x') + "</r>", true, result),
                XMLParseException);
   EXPECT_LT(HeapInUse(), before + (size_t(8) << 20));
}

}  // namespace
}  // namespace Pelmora::Xml
