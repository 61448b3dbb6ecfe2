// The three syntaxes: exact reading and writing rules, round trips, malformed input.

#include <string>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

Ref<Config::View> MainView(Config* config) {
   Ref<Config::View> view;
   config->GetMainView(view);
   return view;
}

std::string GetText(Config* config, const std::string& path) {
   std::string value;
   if (!MainView(config)->Get(path, &value)) return "<absent>";
   return value;
}

// A tree with ids, nesting, awkward values and many siblings.
void FillSample(Config::View* view) {
   view->Set("log/level", "info");
   view->Set("log/name", "daemon log");
   view->Set("level[0000]/logName", "http");
   view->Set("level[0000]/logLevel", "trivia");
   view->Set("level[0001]/logName", "soap");
   view->Set("pelmora/threadPool/maxThreads", 16);
   view->Set("pelmora/ratio", 0.25);
   view->Set("text/quoted", "say \"hi\" = ok");
   view->Set("text/symbols", "a<b & c>d 'e'");
   view->Set("text/utf8", "gr\xC3\xBC\xC3\x9F" "e");
   view->Set("text/empty", "");
   for (int i = 0; i < 20; ++i) view->Set("many/item[" + std::to_string(i) + "]", i * i);
}

void ExpectSample(Config* config) {
   EXPECT_EQ(GetText(config, "log/level"), "info");
   EXPECT_EQ(GetText(config, "log/name"), "daemon log");
   EXPECT_EQ(GetText(config, "level[0000]/logName"), "http");
   EXPECT_EQ(GetText(config, "level[0000]/logLevel"), "trivia");
   EXPECT_EQ(GetText(config, "level[0001]/logName"), "soap");
   EXPECT_EQ(GetText(config, "pelmora/threadPool/maxThreads"), "16");
   EXPECT_EQ(GetText(config, "pelmora/ratio"), "0.25");
   EXPECT_EQ(GetText(config, "text/quoted"), "say \"hi\" = ok");
   EXPECT_EQ(GetText(config, "text/symbols"), "a<b & c>d 'e'");
   EXPECT_EQ(GetText(config, "text/utf8"), "gr\xC3\xBC\xC3\x9F" "e");
   EXPECT_EQ(GetText(config, "text/empty"), "");
   for (int i = 0; i < 20; ++i) {
      EXPECT_EQ(GetText(config, "many/item[" + std::to_string(i) + "]"), std::to_string(i * i));
   }
}

using StringFactory = void (*)(std::string&, Ref<Config>&);

std::string ParseError(StringFactory factory, std::string text) {
   Ref<Config> config;
   try {
      factory(text, config);
   } catch (const FileFormatException& e) {
      return e.what();
   }
   return "no exception";
}

}  // namespace

TEST(ConfigSyntaxTest, OneTreeRoundTripsThroughEverySyntax) {
   std::string xml, flat;
   Ref<Config> first;
   CreateXmlStringConfig(xml, first);
   FillSample(MainView(first.Get()).Get());
   first->Flush();

   // XML text -> a fresh XML configuration -> flat text -> flat configuration.
   Ref<Config> fromXml;
   CreateXmlStringConfig(xml, fromXml);
   ExpectSample(fromXml.Get());

   CreateFlatStringConfig(flat, first);
   FillSample(MainView(first.Get()).Get());
   first->Flush();
   Ref<Config> fromFlat;
   CreateFlatStringConfig(flat, fromFlat);
   ExpectSample(fromFlat.Get());
   EXPECT_FALSE(fromFlat->IsDirty());
}

TEST(ConfigSyntaxTest, FlatLinesAreWrittenExactly) {
   std::string text;
   Ref<Config> config;
   CreateFlatStringConfig(text, config);
   auto view = MainView(config.Get());
   view->Set("a/b", "1");
   view->Set("a/c[x]/d", "two words");
   view->Set("e", "q\"uote");
   config->Flush();
   EXPECT_EQ(text, "a/b = \"1\"\na/c[x]/d = \"two words\"\ne = \"q\"uote\"\n");
}

TEST(ConfigSyntaxTest, FlatReadingTakesTheOuterQuotesAndSkipsEmptyLines) {
   std::string text =
       "\n"
       "  log/level\t= \"info\"  \r\n"
       "a/b=x\"in \"the\" middle\"trailing\n"
       "\t\r\n"
       "odd[7]/key = \"\"\n"
       "sep[a/b]/c = \"id with slash\"\n";
   Ref<Config> config;
   CreateFlatStringConfig(text, config);
   EXPECT_EQ(GetText(config.Get(), "log/level"), "info");
   EXPECT_EQ(GetText(config.Get(), "a/b"), "in \"the\" middle");
   EXPECT_EQ(GetText(config.Get(), "odd[7]/key"), "");
   // A separator inside brackets belongs to the id, and is written back the same way.
   config->Flush();
   EXPECT_NE(text.find("\nsep[a/b]/c = \"id with slash\"\n"), std::string::npos) << text;
}

TEST(ConfigSyntaxTest, MalformedFlatTextRaisesFileFormatException) {
   EXPECT_EQ(ParseError(CreateFlatStringConfig, "a/b = \"1\"\nno equals sign\n"),
             "File Format Exception: Not a setting at line 2");
   EXPECT_EQ(ParseError(CreateFlatStringConfig, "= \"1\"\n"), "File Format Exception: Not a setting at line 1");
   EXPECT_EQ(ParseError(CreateFlatStringConfig, "a = \"1\n"), "File Format Exception: Not a setting at line 1");
   EXPECT_EQ(ParseError(CreateFlatStringConfig, "  = \"1\"\n"), "File Format Exception: Empty key at line 1");
   EXPECT_EQ(ParseError(CreateFlatStringConfig, "a[x = \"1\"\n"), "File Format Exception: Malformed key at line 1");
   EXPECT_EQ(ParseError(CreateFlatStringConfig, "a = \"1\"\na/b = \"2\"\n"),
             "File Format Exception: Node has both value and children at line 2");
   EXPECT_EQ(ParseError(CreateFlatStringConfig, "a/b = \"2\"\na = \"1\"\n"),
             "File Format Exception: Node has both value and children at line 2");
}

TEST(ConfigSyntaxTest, XmlQuotesValuesThatTrimmingWouldChange) {
   std::string xml;
   Ref<Config> config;
   CreateXmlStringConfig(xml, config);
   auto view = MainView(config.Get());
   const std::string values[] = {"  two leading, one trailing ", "\"wrapped\"", "\"", "\tx\n",
                                 "inner \"quotes\" stay", "\r\n", "line\r\nbreaks"};
   for (size_t i = 0; i < std::size(values); ++i) view->Set("v[" + std::to_string(i) + "]", values[i].c_str());
   config->Flush();
   EXPECT_NE(xml.find("<v id=\"0\">\"  two leading, one trailing \"</v>"), std::string::npos) << xml;
   EXPECT_NE(xml.find("<v id=\"1\">\"\"wrapped\"\"</v>"), std::string::npos) << xml;
   EXPECT_NE(xml.find("<v id=\"4\">inner \"quotes\" stay</v>"), std::string::npos) << xml;

   Ref<Config> reread;
   CreateXmlStringConfig(xml, reread);
   for (size_t i = 0; i < std::size(values); ++i) {
      EXPECT_EQ(GetText(reread.Get(), "v[" + std::to_string(i) + "]"), values[i]) << i;
   }
}

TEST(ConfigSyntaxTest, XmlReadingTrimsUnquotesAndUsesTheRootAsTheTree) {
   std::string xml =
       "<?xml version=\"1.0\"?>\n"
       "<settings>\n"
       "  <!-- comment -->\n"
       "  <log>\n    <level>\n      info\n    </level>\n    <name>\"  spaced  \"</name>\n"
       "    <one>\"</one>\n    <cdata><![CDATA[ <raw> ]]></cdata>\n  </log>\n"
       "  <level id=\"0001\"><logName>http</logName></level>\n"
       "  <empty/>\n"
       "</settings>\n";
   Ref<Config> config;
   CreateXmlStringConfig(xml, config);
   EXPECT_EQ(GetText(config.Get(), "log/level"), "info");
   EXPECT_EQ(GetText(config.Get(), "log/name"), "  spaced  ");
   EXPECT_EQ(GetText(config.Get(), "log/one"), "\"");
   EXPECT_EQ(GetText(config.Get(), "log/cdata"), "<raw>");
   EXPECT_EQ(GetText(config.Get(), "level[0001]/logName"), "http");
   EXPECT_EQ(GetText(config.Get(), "empty"), "");

   // The root keeps its tag when written back.
   config->Flush();
   EXPECT_NE(xml.find("<settings>"), std::string::npos);
   EXPECT_NE(xml.find("<level id=\"0001\">"), std::string::npos);
}

TEST(ConfigSyntaxTest, MalformedXmlRaisesFileFormatException) {
   EXPECT_EQ(ParseError(CreateXmlStringConfig, "<c><a>text<b>1</b></a></c>"),
             "File Format Exception: Node has both value and children");
   EXPECT_EQ(ParseError(CreateXmlStringConfig, "<c><a id=\"1\">x</a><a id=\"1\">y</a></c>"),
             "File Format Exception: Duplicate child: a[1]");
   EXPECT_EQ(ParseError(CreateXmlStringConfig, "<c><a>x</a><a>y</a></c>"),
             "File Format Exception: Duplicate child: a");
   EXPECT_NE(ParseError(CreateXmlStringConfig, "<c><a>x</c>").find("at line 1"), std::string::npos);
   EXPECT_NE(ParseError(CreateXmlStringConfig, "<!DOCTYPE c [<!ENTITY e \"x\">]><c>&e;</c>"), "no exception");
   // Different ids, or an id and none, are different children.
   Ref<Config> config;
   std::string ok = "<c><a id=\"1\">x</a><a id=\"2\">y</a><a>z</a></c>";
   CreateXmlStringConfig(ok, config);
   EXPECT_EQ(GetText(config.Get(), "a"), "z");
}

TEST(ConfigSyntaxTest, DeepNestingIsRefused) {
   std::string deep;
   for (int i = 0; i <= kConfigMaxDepth + 1; ++i) deep += "<a>";
   deep += "x";
   for (int i = 0; i <= kConfigMaxDepth + 1; ++i) deep += "</a>";
   EXPECT_NE(ParseError(CreateXmlStringConfig, deep).find("nested deeper"), std::string::npos);
   std::string key;
   for (int i = 0; i <= kConfigMaxDepth; ++i) key += "a/";
   EXPECT_NE(ParseError(CreateFlatStringConfig, key + "b = \"1\"\n").find("too deep"), std::string::npos);
}

TEST(ConfigSyntaxTest, TreesASyntaxCannotHoldAreRefusedAndTheTextKept) {
   std::string xml = "<config/>";
   Ref<Config> config;
   CreateXmlStringConfig(xml, config);
   auto view = MainView(config.Get());
   view->Set("1bad", "tag is not an XML name");
   EXPECT_THROW(config->Flush(), InvalidArgumentException);
   view->Unset("1bad");
   view->Set("ctl", "bell\x07");
   EXPECT_THROW(config->Flush(), InvalidArgumentException);
   view->Set("ctl", "bad utf-8 \xC3");
   EXPECT_THROW(config->Flush(), InvalidArgumentException);
   EXPECT_EQ(xml, "<config/>");
   EXPECT_TRUE(config->IsDirty());

   std::string flat;
   CreateFlatStringConfig(flat, config);
   view = MainView(config.Get());
   view->Set("a", "line\nfeed");
   EXPECT_THROW(config->Flush(), InvalidArgumentException);
   view->Set("a", "ok");
   view->Set("k=v", "x");
   EXPECT_THROW(config->Flush(), InvalidArgumentException);
   view->Unset("k=v");
   view->Set("id[x]y]", "x");  // an id with "]" would not read back
   EXPECT_THROW(config->Flush(), InvalidArgumentException);
   view->Unset("id[x]y]");
   config->Flush();
   EXPECT_EQ(flat, "a = \"ok\"\n");
}

TEST(ConfigSyntaxTest, EmptyXmlTextIsAnEmptyConfiguration) {
   std::string xml = " \n";
   Ref<Config> config;
   CreateXmlStringConfig(xml, config);
   // Written and read again, it writes the same text (an empty root reads as an empty value).
   config->Flush();
   EXPECT_EQ(xml, "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<config/>\n");
   std::string again = xml;
   Ref<Config> reread;
   CreateXmlStringConfig(again, reread);
   reread->Flush();
   EXPECT_EQ(again, xml);
   MainView(config.Get())->Set("a", "1");
   config->Flush();
   EXPECT_EQ(xml, "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<config>\n  <a>1</a>\n</config>\n");
}

TEST(ConfigSyntaxTest, StringRefreshFollowsTheCallersText) {
   std::string text = "a = \"1\"\n";
   Ref<Config> config;
   CreateFlatStringConfig(text, config);
   EXPECT_FALSE(config->Refresh());
   MainView(config.Get())->Set("b", "2");
   EXPECT_TRUE(config->IsDirty());
   text = "a = \"3\"\n";
   EXPECT_TRUE(config->Refresh());
   EXPECT_EQ(GetText(config.Get(), "a"), "3");
   EXPECT_EQ(GetText(config.Get(), "b"), "<absent>");  // unsaved changes give way
   EXPECT_FALSE(config->IsDirty());
   EXPECT_FALSE(config->Refresh());
}

TEST(ConfigSyntaxTest, ScratchConfigurationsHaveNoSource) {
   Ref<Config> config;
   CreateScratchConfig(config);
   EXPECT_THROW(config->Load(), NotSupportedException);
   EXPECT_THROW(config->Flush(), NotSupportedException);
   EXPECT_FALSE(config->Refresh());
}
