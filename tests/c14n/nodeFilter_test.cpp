// The node filters and the filtered iterator over trees built by code.

#include <gtest/gtest.h>

#include "pelmora/xml.h"
#include "tests/xml/nodeBuilders.h"

using namespace Pelmora;
using namespace Pelmora::Xml;
using namespace Pelmora::Xml::Security;
using namespace Pelmora::Xml::Testing;

namespace {

TEST(NodeFilterTest, SkipWsAndCommentsRejectsBlankTextAndComments) {
   SkipWsAndCommentsFilter filter;
   for (const char* blank : {"   \n", "\t\r\n ", ""}) EXPECT_FALSE(filter.Accept(Text(blank).Get())) << blank;
   for (const char* text : {" x ", "\xc2\xa0"}) EXPECT_TRUE(filter.Accept(Text(text).Get())) << text;
   EXPECT_FALSE(filter.Accept(Comment("c").Get()));
   EXPECT_TRUE(filter.Accept(Element("e").Get()));
}

TEST(NodeFilterTest, ExcludeRejectsOnlyItsNode) {
   Ref<ElementNode> a = Element("a");
   Ref<ElementNode> b = Element("a");
   ExcludeNodeFilter filter(a.Get());
   EXPECT_FALSE(filter.Accept(a.Get()));
   EXPECT_TRUE(filter.Accept(b.Get()));
   EXPECT_TRUE(AcceptAllNodesFilter().Accept(a.Get()));
}

TEST(NodeFilterTest, IteratorVisitsOnlyAcceptedNodesAndStaysPutAtTheEnd) {
   Ref<ElementNode> root = Element("r");
   Ref<ElementNode> x = Element("x");
   Ref<ElementNode> y = Element("y");
   root->AppendChild(Text("  ").Get());
   root->AppendChild(x.Get());
   root->AppendChild(Comment("c").Get());
   root->AppendChild(Text("\n").Get());
   root->AppendChild(y.Get());
   root->AppendChild(Text(" ").Get());
   Ref<NodeFilter> filter(new SkipWsAndCommentsFilter);
   NodeFilterIterator it(root.Get(), filter.Get());
   ASSERT_TRUE(it.MoveToChild());
   EXPECT_EQ(x.Get(), it.GetChild());
   NodeFilterIterator copy = it;
   ASSERT_TRUE(it.MoveToSibling());
   EXPECT_EQ(y.Get(), it.GetChild());
   EXPECT_FALSE(it.MoveToSibling());
   EXPECT_EQ(y.Get(), it.GetChild());
   EXPECT_FALSE(it.MoveToChild());
   // The copy moved on its own.
   EXPECT_EQ(x.Get(), copy.GetChild());
   EXPECT_EQ(filter.Get(), copy.GetFilter());
}

}  // namespace
