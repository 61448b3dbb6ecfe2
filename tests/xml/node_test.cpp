#include <gtest/gtest.h>

#include <cstdlib>
#include <initializer_list>
#include <map>
#include <string>
#include <typeinfo>

#include "pelmora/exception.h"
#include "pelmora/object/scoreboard.h"
#include "src/xml/nodeImpl.h"
#include "tests/xml/nodeBuilders.h"

namespace Pelmora::Xml {
namespace {

using Testing::Comment;
using Testing::Element;
using Testing::Text;

// The children's tags (or "#" + type), checked to read the same walked both ways.
std::string Children(Node* parent) {
   auto label = [](Node* n) {
      auto* e = dynamic_cast<ElementNode*>(n);
      return (e ? e->GetTag() : "#" + std::to_string(n->GetNodeType())) + " ";
   };
   std::string forward, backward;
   for (Node* child = parent->GetFirstChild(); child; child = child->GetNextSibling()) {
      EXPECT_EQ(parent, child->GetParent());
      forward += label(child);
   }
   for (Node* child = parent->GetLastChild(); child; child = child->GetPrevSibling())
      backward.insert(0, label(child));
   EXPECT_EQ(forward, backward);
   return forward;
}

TEST(NodeTest, InsertionAndRemovalKeepLinksAndOneReferencePerParent) {
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
   parent->AppendChild(b.Get());  // a removed node is free again
   EXPECT_EQ("c b ", Children(parent.Get()));

   Ref<ElementNode> kept = Element("kept");
   kept->AppendChild(Text("inner").Get());
   parent->AppendChild(kept.Get());
   parent.Reset();  // releases its children but not nodes held elsewhere
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
   std::string written = Testing::Write(top.Get());
   EXPECT_EQ(static_cast<size_t>(kDepth) * 7 + 1, written.size());
   EXPECT_EQ(0u, written.find("<e><e><e>"));
   top.Reset();  // would overflow the stack if each level took a frame
}

// The live instances of each node class, as the scoreboard counts them.
std::map<std::string, int> NodeCounts() {
   std::map<std::string, int> counts;
   for (int type = kDocumentNode; type <= kProcessingInstructionNode; ++type)
      counts[NodeImpl::ScoreboardName(type)] = 0;
   if (Scoreboard* scoreboard = GetScoreboard()) {
      scoreboard->VisitClasses(
          [](void* context, const char* name, int count) {
             auto* counts = static_cast<std::map<std::string, int>*>(context);
             if (auto found = counts->find(name); found != counts->end()) found->second = count;
          },
          &counts);
   }
   return counts;
}

// Dropping a parsed tree frees its nodes in bulk; every node still referenced from outside
// must survive with its subtree, whichever arena or heap it and its parent came from.
TEST(NodeTest, DroppingATreeKeepsEveryNodeHeldElsewhere) {
   Ref<Document> other = Testing::Parse("<o><moved>m<i/></moved></o>");
   Ref<ElementNode> moved = dynamic_cast<ElementNode*>(other->GetRoot()->GetFirstChild());
   Ref<ElementNode> deep, middle;
   Ref<TextNode> text;
   Ref<CommentNode> comment;
   {
      Ref<Document> document = Testing::Parse(
          "<r><a><b><c x='1'>deep text</c><d/></b>tail<!--note--></a><e>gone</e></r>");
      auto* a = dynamic_cast<ElementNode*>(document->GetRoot()->GetFirstChild());
      auto* b = dynamic_cast<ElementNode*>(a->GetFirstChild());
      middle = b;
      deep = dynamic_cast<ElementNode*>(b->GetFirstChild());  // held inside a held node
      text = dynamic_cast<TextNode*>(b->GetNextSibling());
      comment = dynamic_cast<CommentNode*>(text->GetNextSibling());
      // Nodes of another document and of the heap, mixed into this tree, go with it.
      other->GetRoot()->RemoveChild(moved.Get());
      a->AppendChild(moved.Get());
      moved.Reset();
      document->GetRoot()->AppendChild(Element("built").Get());
      dynamic_cast<ElementNode*>(document->GetRoot()->GetLastChild())
          ->AppendChild(Text("heap").Get());
   }
   EXPECT_EQ(nullptr, middle->GetParent());
   EXPECT_EQ(nullptr, text->GetParent());
   EXPECT_EQ(nullptr, text->GetNextSibling());
   EXPECT_EQ(nullptr, comment->GetPrevSibling());
   EXPECT_EQ(middle.Get(), deep->GetParent());
   EXPECT_EQ("<b><c x=\"1\">deep text</c><d/></b>", Testing::Write(middle.Get()));
   EXPECT_EQ("tail", text->GetText());
   EXPECT_EQ("note", comment->GetComment());
   middle.Reset();
   EXPECT_EQ(nullptr, deep->GetParent());
   EXPECT_EQ("<c x=\"1\">deep text</c>", Testing::Write(deep.Get()));
   // The document the moved node came from is untouched by its loss.
   EXPECT_EQ("<o/>", Testing::Write(other->GetRoot()));
}

// Drops a parsed tree holding a node with a subtree and one leaf from different levels:
// every other node must go, the held ones keep what is theirs.
void DropATreeThatHasHeldNodes() {
   std::map<std::string, int> before = NodeCounts();
   auto delta = [&before](int type) {
      const char* name = NodeImpl::ScoreboardName(type);
      return NodeCounts()[name] - before[name];
   };
   Ref<ElementNode> held;
   Ref<TextNode> leaf;
   {
      Ref<Document> document =
          Testing::Parse("<r><a><b/>t1</a><held><x/>in</held><c><d>t2</d></c>t3<!--z--></r>");
      held = dynamic_cast<ElementNode*>(document->GetRoot()->GetFirstChild()->GetNextSibling());
      leaf = dynamic_cast<TextNode*>(document->GetRoot()->GetLastChild()->GetPrevSibling());
   }
   EXPECT_EQ(0, delta(kDocumentNode));
   EXPECT_EQ(2, delta(kElementNode));
   EXPECT_EQ(2, delta(kTextNode));
   EXPECT_EQ(0, delta(kCommentNode));
   EXPECT_EQ(nullptr, held->GetParent());
   EXPECT_EQ(nullptr, held->GetNextSibling());
   EXPECT_EQ("<held><x/>in</held>", Testing::Write(held.Get()));
   EXPECT_EQ(nullptr, leaf->GetPrevSibling());
   EXPECT_EQ("t3", leaf->GetText());
   held.Reset();
   leaf.Reset();
   EXPECT_EQ(0, delta(kElementNode));
   EXPECT_EQ(0, delta(kTextNode));
}

// Without a reference tracker the nodes go in bulk, with one each through its own last
// release; the tracker, once installed, stays for the process, hence the child process.
TEST(NodeTest, DroppingATreeFreesWhatNobodyElseHoldsWithOrWithoutATracker) {
   DropATreeThatHasHeldNodes();
   EXPECT_EXIT(
       {
          Ref<RefTracker> tracker;
          CreateRefTracker({TypeName(typeid(ElementNodeImpl))}, tracker);
          DropATreeThatHasHeldNodes();
          std::_Exit(testing::Test::HasFailure() ? 1 : 0);
       },
       testing::ExitedWithCode(0), "");
}

// The parser counts its nodes on the scoreboard a document at a time, and a tree dropped
// in bulk counts them down the same way: the counts come back to where they were.
TEST(NodeTest, TheScoreboardCountsParsedNodesUntilTheyGo) {
   std::map<std::string, int> before = NodeCounts();
   auto delta = [&before](int type) {
      const char* name = NodeImpl::ScoreboardName(type);
      return NodeCounts()[name] - before[name];
   };
   Ref<TextNode> kept;
   {
      Ref<Document> document =
          Testing::Parse("<r><!--c--><a>x&amp;y</a><a/><![CDATA[z]]>w</r>");
      EXPECT_EQ(1, delta(kDocumentNode));
      EXPECT_EQ(3, delta(kElementNode));
      EXPECT_EQ(3, delta(kTextNode));
      EXPECT_EQ(1, delta(kCDataNode));
      EXPECT_EQ(1, delta(kCommentNode));
      kept = dynamic_cast<TextNode*>(document->GetRoot()->GetLastChild());
      document->GetRoot()->AppendChild(Element("built").Get());
      EXPECT_EQ(4, delta(kElementNode));
   }
   EXPECT_EQ("w", kept->GetText());
   EXPECT_EQ(0, delta(kDocumentNode));
   EXPECT_EQ(0, delta(kElementNode));
   EXPECT_EQ(1, delta(kTextNode));
   EXPECT_EQ(0, delta(kCDataNode));
   EXPECT_EQ(0, delta(kCommentNode));
   kept.Reset();
   EXPECT_EQ(0, delta(kTextNode));
}

TEST(NodeTest, EachKindRefusesTheChildrenItCannotHold) {
   Ref<Document> document, other;
   CreateDocument(document);
   CreateDocument(other);
   Ref<CDataNode> cdata;
   CreateCDataNode(cdata);
   Ref<ProcessingInstructionNode> pi;
   CreateProcessingInstructionNode("t", "d", pi);
   Ref<CommentNode> comment = Comment("c");
   Ref<TextNode> text = Text("t");
   Ref<ElementNode> element = Element("e");
   document->AppendChild(Element("root").Get());

   struct {
      Node* parent;
      Ref<Node> child;
      const char* message;
   } cases[] = {
       {document.Get(), element, "Document's Root Element Node already set"},
       {document.Get(), cdata, "DocumentNode cannot have CData node children"},
       {document.Get(), text, "DocumentNode cannot have text node children"},
       {document.Get(), other, "DocumentNode cannot have document node as child"},
       {element.Get(), other, "Elements cannot have document or PI children."},
       {element.Get(), pi, "Elements cannot have document or PI children."},
       {cdata.Get(), Element("x"), "Cannot add non-text child to CData node."},
       {text.Get(), Text("x"), "Cannot add child to text node."},
       {comment.Get(), Text("x"), "Cannot add child to Comment node."},
       {pi.Get(), Text("x"), "Cannot add child to PI node."},
   };
   for (const auto& c : cases) {
      try {
         c.parent->AppendChild(c.child.Get());
         ADD_FAILURE() << "accepted: " << c.message;
      } catch (const InvalidArgumentException& e) {
         EXPECT_EQ(std::string("Invalid argument : ") + c.message, e.GetMessage());
      }
      EXPECT_EQ(nullptr, c.child->GetParent());
   }
   // The kinds that take no children show none.
   for (Node* leaf : std::initializer_list<Node*>{text.Get(), comment.Get(), pi.Get()}) {
      EXPECT_EQ(nullptr, leaf->GetFirstChild());
      EXPECT_EQ(nullptr, leaf->GetLastChild());
      EXPECT_EQ(nullptr, leaf->GetChildElementByTag("x"));
   }
   cdata->AppendChild(text.Get());  // what a CDATA node does accept
   EXPECT_EQ("#1 ", Children(cdata.Get()));
}

TEST(NodeTest, TheDocumentTracksItsRootElement) {
   Ref<Document> document;
   CreateDocument(document);
   Ref<ElementNode> first = Element("first"), second = Element("second");
   document->AppendChild(Comment("before").Get());
   document->AppendChild(first.Get());
   document->AppendChild(Comment("after").Get());
   EXPECT_EQ(first.Get(), document->GetRoot());

   document->SetRoot(second.Get());  // replaces the root where it stood
   document->SetRoot(second.Get());  // the same root again changes nothing
   EXPECT_EQ(second.Get(), document->GetRoot());
   EXPECT_EQ("#3 second #3 ", Children(document.Get()));
   EXPECT_EQ(nullptr, first->GetParent());

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
   EXPECT_DEATH(Text("t")->RemoveChild(child.Get()), "\"node->GetParent\\(\\) == this\"");
   // A node inserted below itself would never be released.
   EXPECT_DEATH(child->AppendChild(parent.Get()), "Assert Failed");
}

TEST(ElementNodeTest, AQualifiedNameSplitsAtTheFirstColon) {
   Ref<ElementNode> element = Element("soap:Body:x");
   EXPECT_EQ("soap", element->GetPrefix());
   EXPECT_EQ("Body:x", element->GetTag());
   EXPECT_EQ("soap:Body:x", element->GetName());
   CreateElementNode(":odd", element);  // no prefix to split off: written back as read
   EXPECT_EQ("", element->GetPrefix());
   EXPECT_EQ(":odd", element->GetName());

   CreateElementNode("p", "t", element);
   EXPECT_EQ("p:t", element->GetName());
   element->SetPrefix("");
   EXPECT_EQ("t", element->GetName());
}

TEST(ElementNodeTest, AttributesAreKeptAndWrittenInByteOrderOfTheirNames) {
   Ref<ElementNode> element = Element("p:e");
   std::string value = "untouched";
   EXPECT_FALSE(element->GetAttribute("z", value));
   EXPECT_EQ("untouched", value);

   for (const char* name : {"z", "a", "\xc3\xa9", "Z", "xsi:nil"})
      element->DefineAttribute(name, "1");
   element->DefineAttribute("a", std::string("re<"));
   std::map<std::string, std::string> attributes{{"stale", "x"}};
   element->GetAttributes(attributes);
   std::string order;
   for (const auto& [name, _] : attributes) order += name + " ";
   EXPECT_EQ("Z a xsi:nil z \xc3\xa9 ", order);
   EXPECT_TRUE(element->GetAttribute("a", value));
   EXPECT_EQ("re<", value);
   EXPECT_FALSE(element->GetAttribute("nil", value));  // a qualified name is one key
   EXPECT_EQ("<p:e Z=\"1\" a=\"re&lt;\" xsi:nil=\"1\" z=\"1\" \xc3\xa9=\"1\"/>",
             Testing::Write(element.Get()));

   for (const char* name : {"a", "absent", "Z", "xsi:nil", "\xc3\xa9"})
      element->RemoveAttribute(name);
   EXPECT_FALSE(element->GetAttribute("a", value));
   element->AppendChild(Text("t").Get());
   EXPECT_EQ("<p:e z=\"1\">t</p:e>", Testing::Write(element.Get()));
}

TEST(ElementNodeTest, PrefixesResolveThroughAncestorsNearestFirst) {
   Ref<Document> document = Testing::Parse(
       "<r xmlns='urn:default' xmlns:p='urn:outer'><m "
       "xmlns:p='urn:inner'><p:x/><y/><q:z/></m></r>");
   ElementNode* root = document->GetRoot();
   ElementNode* middle = GetFirstChildElement(root);
   ElementNode* prefixed = GetFirstChildElement(middle);
   ElementNode* unprefixed = GetNextSiblingElement(prefixed);
   ElementNode* unbound = GetNextSiblingElement(unprefixed);
   auto resolve = [](ElementNode* element, const char* prefix) {
      std::string uri = "untouched";
      return (element->ResolvePrefix(prefix, uri) ? "" : "false:") + uri;
   };
   EXPECT_EQ("urn:inner", resolve(prefixed, "p"));
   EXPECT_EQ("urn:outer", resolve(root, "p"));
   EXPECT_EQ("urn:default", resolve(unprefixed, ""));
   EXPECT_EQ("false:untouched", resolve(unbound, "q"));
   std::string uri;
   EXPECT_TRUE(GetNamespace(unprefixed, uri));
   EXPECT_EQ("urn:default", uri);
   EXPECT_FALSE(GetNamespace(unbound, uri));
   EXPECT_EQ("", uri);

   // Lookups by qualified name compare the namespace in scope; by tag ignore the prefix.
   EXPECT_EQ(prefixed, middle->GetChildElementByQName(QName("urn:inner", "x")));
   EXPECT_EQ(nullptr, middle->GetChildElementByQName(QName("urn:outer", "x")));
   EXPECT_EQ(unprefixed, middle->GetChildElementByQName(QName("urn:default", "y")));
   EXPECT_EQ(unbound, prefixed->GetSiblingElementByQName(QName("", "z")));
   EXPECT_EQ(nullptr, unbound->GetSiblingElementByQName(QName("", "z")));
   EXPECT_EQ(prefixed, middle->GetChildElementByTag("x"));
   EXPECT_EQ(nullptr, middle->GetChildElementByTag("p:x"));
   EXPECT_EQ(unbound, prefixed->GetSiblingElementByTag("z"));

   unprefixed->DefineAttribute("p:attr", "inner value");
   unprefixed->DefineAttribute("attr", "plain value");
   std::string value;
   EXPECT_TRUE(unprefixed->GetAttributeByQName(QName("urn:inner", "attr"), value));
   EXPECT_EQ("inner value", value);
   EXPECT_TRUE(unprefixed->GetAttributeByQName(QName("", "attr"), value));
   EXPECT_EQ("plain value", value);
   EXPECT_FALSE(unprefixed->GetAttributeByQName(QName("urn:outer", "attr"), value));
}

TEST(ElementNodeTest, NilElementsCountAsAbsent) {
   // Names are matched literally; either attribute makes the element nil.
   const char* cases[][3] = {{"xsi:nil", "true", "1"}, {"xsi:nil", "1", "1"},
                             {"xsi:null", "1", "1"},   {"xsi:nil", "false", ""},
                             {"xsi:nil", "0", ""},     {"xsi:nil", "TRUE", ""},
                             {"xsi:nil", " true", ""}, {"xs:nil", "true", ""}};
   for (const auto& [name, value, nil] : cases) {
      Ref<ElementNode> element = Element("e");
      element->DefineAttribute("xsi:nil", "false");
      element->DefineAttribute(name, value);
      EXPECT_EQ(*nil != 0, IsNil(element.Get())) << name << "=" << value;
   }

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

TEST(SimplePathTest, WalksChildElementsAndEndsAtTheFirstAttributeStep) {
   Ref<Document> document = Testing::Parse(
       "<config>own<log level='x'><level>debug</level></log>"
       "<server enabled='yes'><!--c-->text</server><empty/></config>");
   // A step ends where the first child is not text: a comment (server), an element (log).
   const std::pair<const char*, const char*> cases[] = {{"config/log/level", "debug"},
                                                        {"//config//log/level/", "debug"},
                                                        {"config", "own"},
                                                        {"*/server/@enabled", "yes"},
                                                        {"config/log/@level/ignored/rest", "x"},
                                                        {"config/*/*", "debug"},
                                                        {"other/log", nullptr},
                                                        {"config/missing", nullptr},
                                                        {"config/log/@absent", nullptr},
                                                        {"config/server", nullptr},
                                                        {"config/log", nullptr},
                                                        {"config/empty", nullptr},
                                                        {"", nullptr}};
   for (const auto& [path, expected] : cases) {
      std::string fromDocument = "untouched", fromRoot = "untouched";
      EXPECT_EQ(expected != nullptr, EvaluateSimplePath(document.Get(), path, fromDocument))
          << path;
      EXPECT_EQ(expected != nullptr, EvaluateSimplePath(document->GetRoot(), path, fromRoot))
          << path;
      EXPECT_EQ(expected ? expected : "untouched", fromDocument) << path;
      EXPECT_EQ(fromDocument, fromRoot) << path;
   }
   std::string result;
   document->SetRoot(nullptr);
   try {
      EvaluateSimplePath(document.Get(), "config", result);
      ADD_FAILURE() << "a rootless document answered";
   } catch (const InvalidArgumentException& e) {
      EXPECT_EQ("Invalid argument : Document has no root.", e.GetMessage());
   }
}

TEST(TextContentTest, JoinsTextAndCDataButNotTheTextOfChildElements) {
   Ref<Document> document =
       Testing::Parse("<a>one &amp; <![CDATA[<two>]]><b>skipped</b> three<!-- not text --></a>");
   EXPECT_EQ("one & <two> three", GetTextContent(document->GetRoot()));
   EXPECT_EQ("", GetTextContent(Testing::Element("empty").Get()));
}

TEST(ValidateAnyURITest, AcceptsUsualNamespaceNamesAndRefusesMalformedOnes) {
   for (const char* good : {"http://schemas.xmlsoap.org/soap/envelope/", "urn:pelmora:config",
                            "relative/path", "a%20b", "x+y.z-1:rest", "http://h/\xc3\xa9"})
      EXPECT_TRUE(ValidateAnyURI(good)) << good;
   for (const char* bad : {static_cast<const char*>(nullptr), "", "has space", "a<b", "q\"", "%2",
                           "%zz", "1http://x", ":nothing", "ht@p://x", "tab\there"})
      EXPECT_FALSE(ValidateAnyURI(bad)) << (bad ? bad : "(null)");
}

}  // namespace
}  // namespace Pelmora::Xml
