#include <gtest/gtest.h>

#include <map>
#include <string>

#include "pelmora/exception.h"
#include "pelmora/io.h"
#include "pelmora/xml.h"
#include "tests/xml/nodeBuilders.h"

namespace Pelmora::Xml {
namespace {

using Testing::Element;
using Testing::Text;

// The children's tags (or "#" + type for other kinds), in order, walked both ways.
std::string Children(Node* parent) {
   std::string forward;
   for (Node* child = parent->GetFirstChild(); child; child = child->GetNextSibling()) {
      EXPECT_EQ(parent, child->GetParent());
      auto* element = dynamic_cast<ElementNode*>(child);
      forward += element ? element->GetTag() : "#" + std::to_string(child->GetNodeType());
      forward += ' ';
   }
   std::string backward;
   for (Node* child = parent->GetLastChild(); child; child = child->GetPrevSibling()) {
      auto* element = dynamic_cast<ElementNode*>(child);
      backward.insert(
          0, (element ? element->GetTag() : "#" + std::to_string(child->GetNodeType())) + " ");
   }
   EXPECT_EQ(forward, backward);
   return forward;
}

TEST(NodeTest, InsertionLinksChildrenInPlaceAndHoldsOneReferenceEach) {
   Ref<ElementNode> parent = Element("p");
   Ref<ElementNode> a = Element("a"), b = Element("b"), c = Element("c"), d = Element("d");
   parent->AppendChild(b.Get());
   parent->InsertBeforeChild(a.Get(), b.Get());
   parent->AppendChild(d.Get());
   parent->InsertAfterChild(c.Get(), b.Get());
   EXPECT_EQ("a b c d ", Children(parent.Get()));
   EXPECT_EQ(2, c->GetRefCount());

   parent->RemoveChild(b.Get());
   EXPECT_EQ("a c d ", Children(parent.Get()));
   EXPECT_EQ(1, b->GetRefCount());
   EXPECT_EQ(nullptr, b->GetParent());
   EXPECT_EQ(nullptr, b->GetNextSibling());
   parent->RemoveChild(a.Get());
   parent->RemoveChild(d.Get());
   EXPECT_EQ("c ", Children(parent.Get()));
   parent->AppendChild(b.Get());  // a removed node is free again
   EXPECT_EQ("c b ", Children(parent.Get()));
}

TEST(NodeTest, DestroyingAParentReleasesChildrenButNotNodesHeldElsewhere) {
   Ref<ElementNode> kept = Element("kept");
   kept->AppendChild(Text("inner").Get());
   {
      Ref<ElementNode> parent = Element("p");
      parent->AppendChild(Element("gone").Get());
      parent->AppendChild(kept.Get());
      EXPECT_EQ(2, kept->GetRefCount());
   }
   EXPECT_EQ(1, kept->GetRefCount());
   EXPECT_EQ(nullptr, kept->GetParent());
   EXPECT_EQ(nullptr, kept->GetPrevSibling());
   EXPECT_EQ("#1 ", Children(kept.Get()));
}

TEST(NodeTest, AVeryDeepTreeIsWrittenAndReleasedWithoutRecursion) {
   constexpr int kDepth = 200000;
   Ref<ElementNode> top = Element("e");
   top->AppendChild(Text("x").Get());
   for (int i = 1; i < kDepth; ++i) {
      Ref<ElementNode> parent = Element("e");
      parent->AppendChild(top.Get());
      top = parent;
   }
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   top->WriteNode(writer.Get());
   EXPECT_EQ(static_cast<size_t>(kDepth) * 7 + 1, writer->GetString().size());
   EXPECT_EQ(0u, writer->GetString().find("<e><e><e>"));
   top.Reset();  // would overflow the stack if each level took a frame
}

void ExpectRefused(Node* parent, Node* child, const std::string& message) {
   try {
      parent->AppendChild(child);
      ADD_FAILURE() << "accepted: " << message;
   } catch (const InvalidArgumentException& e) {
      EXPECT_EQ("Invalid argument : " + message, e.GetMessage());
   }
   EXPECT_EQ(nullptr, child->GetParent());
}

TEST(NodeTest, EachKindRefusesTheChildrenItCannotHold) {
   Ref<Document> document, other;
   CreateDocument(document);
   CreateDocument(other);
   Ref<CDataNode> cdata;
   CreateCDataNode(cdata);
   Ref<CommentNode> comment;
   CreateCommentNode("c", comment);
   Ref<ProcessingInstructionNode> pi;
   CreateProcessingInstructionNode("t", "d", pi);
   Ref<TextNode> text = Text("t");
   Ref<ElementNode> element = Element("e");

   document->AppendChild(Element("root").Get());
   ExpectRefused(document.Get(), element.Get(), "Document's Root Element Node already set");
   ExpectRefused(document.Get(), cdata.Get(), "DocumentNode cannot have CData node children");
   ExpectRefused(document.Get(), text.Get(), "DocumentNode cannot have text node children");
   ExpectRefused(document.Get(), other.Get(), "DocumentNode cannot have document node as child");
   ExpectRefused(element.Get(), other.Get(), "Elements cannot have document or PI children.");
   ExpectRefused(element.Get(), pi.Get(), "Elements cannot have document or PI children.");
   ExpectRefused(cdata.Get(), Element("x").Get(), "Cannot add non-text child to CData node.");
   ExpectRefused(text.Get(), Text("x").Get(), "Cannot add child to text node.");
   ExpectRefused(comment.Get(), Text("x").Get(), "Cannot add child to Comment node.");
   ExpectRefused(pi.Get(), Text("x").Get(), "Cannot add child to PI node.");

   // What each kind does accept.
   document->InsertBeforeChild(comment.Get(), document->GetRoot());
   document->AppendChild(pi.Get());
   cdata->AppendChild(text.Get());
   element->AppendChild(cdata.Get());
   Ref<CommentNode> inner;
   CreateCommentNode("i", inner);
   element->AppendChild(inner.Get());
   element->AppendChild(Text("t").Get());
   element->AppendChild(Element("child").Get());
   EXPECT_EQ("#3 root #5 ", Children(document.Get()));
   EXPECT_EQ("#2 #3 #1 child ", Children(element.Get()));
}

TEST(NodeTest, TheDocumentTracksItsRootElement) {
   Ref<Document> document;
   CreateDocument(document);
   EXPECT_EQ(nullptr, document->GetRoot());
   EXPECT_EQ("", document->GetXMLVersion());
   EXPECT_EQ("", document->GetEncoding());

   Ref<CommentNode> before, after;
   CreateCommentNode("before", before);
   CreateCommentNode("after", after);
   document->AppendChild(before.Get());
   Ref<ElementNode> first = Element("first");
   document->AppendChild(first.Get());
   document->AppendChild(after.Get());
   EXPECT_EQ(first.Get(), document->GetRoot());

   // SetRoot replaces the root where it stood.
   Ref<ElementNode> second = Element("second");
   document->SetRoot(second.Get());
   EXPECT_EQ(second.Get(), document->GetRoot());
   EXPECT_EQ("#3 second #3 ", Children(document.Get()));
   EXPECT_EQ(nullptr, first->GetParent());
   document->SetRoot(second.Get());  // the same root again changes nothing
   EXPECT_EQ("#3 second #3 ", Children(document.Get()));

   document->RemoveChild(second.Get());
   EXPECT_EQ(nullptr, document->GetRoot());
   document->AppendChild(first.Get());
   EXPECT_EQ(first.Get(), document->GetRoot());
   document->SetRoot(nullptr);
   EXPECT_EQ(nullptr, document->GetRoot());
   EXPECT_EQ("#3 #3 ", Children(document.Get()));
}

TEST(NodeDeathTest, StructuralMisusePanicsWithTheFailedCondition) {
   Ref<ElementNode> parent = Element("p"), child = Element("c"), stranger = Element("s");
   parent->AppendChild(child.Get());
   EXPECT_DEATH(parent->AppendChild(nullptr), "Assert Failed: \"node != __null\"");
   EXPECT_DEATH(parent->InsertBeforeChild(Element("n").Get(), nullptr), "\"pos != __null\"");
   EXPECT_DEATH(parent->InsertAfterChild(Element("n").Get(), stranger.Get()),
                "\"pos->GetParent\\(\\) == this\"");
   EXPECT_DEATH(stranger->AppendChild(child.Get()), "\"GetParent\\(\\) == __null\"");
   EXPECT_DEATH(parent->RemoveChild(stranger.Get()), "\"node->GetParent\\(\\) == this\"");
   // A node inserted below itself would never be released.
   EXPECT_DEATH(child->AppendChild(parent.Get()), "Assert Failed");
}

TEST(ElementNodeTest, AQualifiedNameSplitsAtTheFirstColon) {
   Ref<ElementNode> element;
   CreateElementNode("soap:Body:x", 3, 9, element);
   EXPECT_EQ("soap", element->GetPrefix());
   EXPECT_EQ("Body:x", element->GetTag());
   EXPECT_EQ("soap:Body:x", element->GetName());
   EXPECT_EQ(3, element->GetLineNumber());
   EXPECT_EQ(9, element->GetColumnNumber());
   EXPECT_EQ(kElementNode, element->GetNodeType());

   CreateElementNode("plain", element);
   EXPECT_EQ("", element->GetPrefix());
   EXPECT_EQ("plain", element->GetName());
   EXPECT_EQ(0, element->GetLineNumber());

   CreateElementNode(":odd", element);  // no prefix to split off: written back as read
   EXPECT_EQ("", element->GetPrefix());
   EXPECT_EQ(":odd", element->GetName());

   CreateElementNode("p", "t", element);
   EXPECT_EQ("p:t", element->GetName());
   element->SetPrefix("");
   element->SetTag("u");
   EXPECT_EQ("u", element->GetName());
}

TEST(ElementNodeTest, AttributesAreKeptInByteOrderOfTheirNames) {
   Ref<ElementNode> element = Element("e");
   std::string value = "untouched";
   EXPECT_FALSE(element->GetAttribute("z", value));
   EXPECT_EQ("untouched", value);

   element->DefineAttribute("z", "1");
   element->DefineAttribute("a", std::string("2"));
   element->DefineAttribute("\xc3\xa9", "3");
   element->DefineAttribute("Z", "4");
   element->DefineAttribute("xsi:nil", "5");
   element->DefineAttribute("a", "replaced");
   std::map<std::string, std::string> attributes{{"stale", "x"}};
   element->GetAttributes(attributes);
   std::string order;
   for (const auto& [name, _] : attributes) order += name + " ";
   EXPECT_EQ("Z a xsi:nil z \xc3\xa9 ", order);
   EXPECT_TRUE(element->GetAttribute("a", value));
   EXPECT_EQ("replaced", value);
   EXPECT_FALSE(element->GetAttribute("nil", value));  // a qualified name is one key

   element->RemoveAttribute("a");
   element->RemoveAttribute("absent");
   EXPECT_FALSE(element->GetAttribute("a", value));
   Element("bare")->GetAttributes(attributes);
   EXPECT_TRUE(attributes.empty());
}

// <r xmlns="urn:default" xmlns:p="urn:outer"><m xmlns:p="urn:inner"><p:x/><y/><q:z/></m></r>
struct NamespaceTree {
   NamespaceTree() {
      root->DefineAttribute("xmlns", "urn:default");
      root->DefineAttribute("xmlns:p", "urn:outer");
      middle->DefineAttribute("xmlns:p", "urn:inner");
      root->AppendChild(middle.Get());
      middle->AppendChild(prefixed.Get());
      middle->AppendChild(unprefixed.Get());
      middle->AppendChild(unbound.Get());
   }
   Ref<ElementNode> root = Element("r"), middle = Element("m");
   Ref<ElementNode> prefixed = Element("p:x"), unprefixed = Element("y"), unbound = Element("q:z");
};

TEST(ElementNodeTest, PrefixesResolveThroughAncestorsNearestFirst) {
   NamespaceTree tree;
   std::string uri;
   EXPECT_TRUE(tree.prefixed->ResolvePrefix("p", uri));
   EXPECT_EQ("urn:inner", uri);
   EXPECT_TRUE(tree.root->ResolvePrefix("p", uri));
   EXPECT_EQ("urn:outer", uri);
   EXPECT_TRUE(tree.unprefixed->ResolvePrefix("", uri));
   EXPECT_EQ("urn:default", uri);
   uri = "untouched";
   EXPECT_FALSE(tree.unbound->ResolvePrefix("q", uri));
   EXPECT_EQ("untouched", uri);

   QName name;
   tree.prefixed->GetQName(name);
   EXPECT_EQ(QName("urn:inner", "x"), name);
   tree.unbound->GetQName(name);
   EXPECT_EQ(QName("", "z"), name);
   EXPECT_TRUE(GetNamespace(tree.unprefixed.Get(), uri));
   EXPECT_EQ("urn:default", uri);
   EXPECT_FALSE(GetNamespace(tree.unbound.Get(), uri));
   EXPECT_EQ("", uri);

   // Lookups by qualified name compare the namespace in scope; by tag ignore the prefix.
   EXPECT_EQ(tree.prefixed.Get(), tree.middle->GetChildElementByQName(QName("urn:inner", "x")));
   EXPECT_EQ(nullptr, tree.middle->GetChildElementByQName(QName("urn:outer", "x")));
   EXPECT_EQ(tree.unprefixed.Get(), tree.middle->GetChildElementByQName(QName("urn:default", "y")));
   EXPECT_EQ(tree.unbound.Get(), tree.prefixed->GetSiblingElementByQName(QName("", "z")));
   EXPECT_EQ(nullptr, tree.unbound->GetSiblingElementByQName(QName("", "z")));
   EXPECT_EQ(tree.prefixed.Get(), tree.middle->GetChildElementByTag("x"));
   EXPECT_EQ(tree.unbound.Get(), tree.prefixed->GetSiblingElementByTag("z"));
   EXPECT_EQ(nullptr, tree.middle->GetChildElementByTag("p:x"));
   EXPECT_EQ(nullptr, tree.unbound->GetSiblingElementByTag("x"));

   tree.unprefixed->DefineAttribute("p:attr", "inner value");
   tree.unprefixed->DefineAttribute("attr", "plain value");
   std::string value;
   EXPECT_TRUE(tree.unprefixed->GetAttributeByQName(QName("urn:inner", "attr"), value));
   EXPECT_EQ("inner value", value);
   EXPECT_TRUE(tree.unprefixed->GetAttributeByQName(QName("", "attr"), value));
   EXPECT_EQ("plain value", value);
   EXPECT_FALSE(tree.unprefixed->GetAttributeByQName(QName("urn:outer", "attr"), value));
}

TEST(ElementNodeTest, NilElementsCountAsAbsent) {
   auto nil = [](const char* name, const char* value) {
      Ref<ElementNode> element = Element("e");
      element->DefineAttribute(name, value);
      return IsNil(element.Get());
   };
   EXPECT_TRUE(nil("xsi:nil", "true"));
   EXPECT_TRUE(nil("xsi:nil", "1"));
   EXPECT_TRUE(nil("xsi:null", "1"));
   EXPECT_FALSE(nil("xsi:nil", "false"));
   EXPECT_FALSE(nil("xsi:nil", "0"));
   EXPECT_FALSE(nil("xsi:nil", "TRUE"));
   EXPECT_FALSE(nil("xsi:nil", " true"));
   EXPECT_FALSE(nil("xs:nil", "true"));  // names are matched literally
   Ref<ElementNode> both = Element("e");
   both->DefineAttribute("xsi:nil", "false");
   both->DefineAttribute("xsi:null", "true");
   EXPECT_TRUE(IsNil(both.Get()));

   Ref<ElementNode> parent = Element("p"), skipped = Element("a"), wanted = Element("b");
   skipped->DefineAttribute("xsi:null", "1");
   parent->AppendChild(Text("lead").Get());
   parent->AppendChild(skipped.Get());
   parent->AppendChild(wanted.Get());
   parent->AppendChild(Element("c").Get());
   EXPECT_EQ(wanted.Get(), GetFirstChildElement(parent.Get()));
   EXPECT_EQ(wanted.Get(), GetFirstSiblingElement(wanted.Get()));
   EXPECT_EQ("c", GetNextSiblingElement(wanted.Get())->GetTag());
   EXPECT_EQ(nullptr, GetNextSiblingElement(parent->GetLastChild()));
   EXPECT_EQ(nullptr, GetFirstChildElement(wanted.Get()));
   EXPECT_EQ(nullptr, GetFirstSiblingElement(nullptr));
}

// <config><log level="x"><level>debug</level></log><server enabled="yes"><!--c-->text</server>
//   <empty/></config>
struct PathTree {
   PathTree() {
      Ref<ElementNode> log = Element("log"), level = Element("level"), server = Element("server");
      Ref<CommentNode> comment;
      CreateCommentNode("c", comment);
      log->DefineAttribute("level", "x");
      level->AppendChild(Text("debug").Get());
      log->AppendChild(level.Get());
      server->DefineAttribute("enabled", "yes");
      server->AppendChild(comment.Get());
      server->AppendChild(Text("text").Get());
      config->AppendChild(Text("own").Get());
      config->AppendChild(log.Get());
      config->AppendChild(server.Get());
      config->AppendChild(Element("empty").Get());
   }
   std::string Eval(const std::string& path) {
      std::string result = "untouched";
      if (!EvaluateSimplePath(config.Get(), path, result)) return "false:" + result;
      return result;
   }
   Ref<ElementNode> config = Element("config");
};

TEST(SimplePathTest, WalksChildElementsAndEndsAtTheFirstAttributeStep) {
   PathTree tree;
   EXPECT_EQ("debug", tree.Eval("config/log/level"));
   EXPECT_EQ("debug", tree.Eval("//config//log/level/"));
   EXPECT_EQ("own", tree.Eval("config"));
   EXPECT_EQ("yes", tree.Eval("*/server/@enabled"));
   EXPECT_EQ("x", tree.Eval("config/log/@level/ignored/rest"));
   EXPECT_EQ("debug", tree.Eval("config/*/*"));
   EXPECT_EQ("false:untouched", tree.Eval("other/log"));
   EXPECT_EQ("false:untouched", tree.Eval("config/missing"));
   EXPECT_EQ("false:untouched", tree.Eval("config/log/@absent"));
   EXPECT_EQ("false:untouched", tree.Eval("config/server"));  // first child is a comment
   EXPECT_EQ("false:untouched", tree.Eval("config/log"));     // first child is an element
   EXPECT_EQ("false:untouched", tree.Eval("config/empty"));
   EXPECT_EQ("false:untouched", tree.Eval(""));

   Ref<Document> document;
   CreateDocument(document);
   std::string result;
   try {
      EvaluateSimplePath(document.Get(), "config", result);
      ADD_FAILURE() << "a rootless document answered";
   } catch (const InvalidArgumentException& e) {
      EXPECT_EQ("Invalid argument : Document has no root.", e.GetMessage());
   }
   document->AppendChild(tree.config.Get());
   EXPECT_TRUE(EvaluateSimplePath(document.Get(), "config/log/level", result));
   EXPECT_EQ("debug", result);
}

TEST(ValidateAnyURITest, AcceptsUsualNamespaceNamesAndRefusesMalformedOnes) {
   for (const char* good : {"http://schemas.xmlsoap.org/soap/envelope/", "urn:pelmora:config",
                            "relative/path", "a%20b", "x+y.z-1:rest", "http://h/\xc3\xa9"}) {
      EXPECT_TRUE(ValidateAnyURI(good)) << good;
   }
   for (const char* bad : {static_cast<const char*>(nullptr), "", "has space", "a<b", "q\"", "%2",
                           "%zz", "1http://x", ":nothing", "ht@p://x", "tab\there"}) {
      EXPECT_FALSE(ValidateAnyURI(bad)) << (bad ? bad : "(null)");
   }
}

}  // namespace
}  // namespace Pelmora::Xml
