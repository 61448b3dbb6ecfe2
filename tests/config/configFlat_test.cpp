// The flat syntax, and the rules every syntax shares checked against each: exact reading
// and writing, round trips, malformed input, trees a syntax cannot hold.

#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "tests/support/configViews.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;

TEST(ConfigSyntaxTest, OneTreeRoundTripsThroughEverySyntax) {
   // Ids, nesting, awkward values and many siblings.
   std::vector<std::pair<std::string, std::string>> sample = {
       {"log/level", "info"},           {"log/name", "daemon log"},
       {"level[0000]/logName", "http"}, {"level[0000]/logLevel", "trivia"},
       {"level[0001]/logName", "soap"}, {"text/quoted", "say \"hi\" = ok"},
       {"text/empty", ""},              {"text/symbols", "a<b & c>d 'e'"},
       {"text/utf8", "gr\xC3\xBC\xC3\x9F" "e"}};
   for (int i = 0; i < 20; ++i) sample.emplace_back("many/item[" + std::to_string(i) + "]", "v");
   for (StringFactory factory : {CreateXmlStringConfig, CreateFlatStringConfig}) {
      std::string text;
      Ref<Config> first, reread;
      factory(text, first);
      auto view = MainView(first.Get());
      for (auto& [path, value] : sample) view->Set(path, value);
      first->Flush();
      factory(text, reread);
      for (auto& [path, value] : sample) EXPECT_EQ(Text(reread.Get(), path), value) << text;
      EXPECT_FALSE(reread->IsDirty());
   }
}

TEST(ConfigSyntaxTest, FlatTextIsReadAndWrittenExactly) {
   std::string text;
   Ref<Config> config;
   CreateFlatStringConfig(text, config);
   auto view = MainView(config.Get());
   view->Set("a/b", "1");
   view->Set("a/c[x]/d", "two words");
   view->Set("e", "q\"uote");
   config->Flush();
   EXPECT_EQ(text, "a/b = \"1\"\na/c[x]/d = \"two words\"\ne = \"q\"uote\"\n");

   // Reading takes the outer quotes and skips empty lines.
   text = "\n  log/level\t= \"info\"  \r\na/b=x\"in \"the\" middle\"trailing\n\t\r\n"
          "odd[7]/key = \"\"\nsep[a/b]/c = \"id with slash\"\n";
   CreateFlatStringConfig(text, config);
   EXPECT_EQ(Text(config.Get(), "log/level"), "info");
   EXPECT_EQ(Text(config.Get(), "a/b"), "in \"the\" middle");
   EXPECT_EQ(Text(config.Get(), "odd[7]/key"), "");
   // A separator inside brackets belongs to the id, and is written back the same way.
   config->Flush();
   EXPECT_NE(text.find("\nsep[a/b]/c = \"id with slash\"\n"), std::string::npos) << text;
}

TEST(ConfigSyntaxTest, MalformedTextRaisesFileFormatException) {
   const std::string both = "Node has both value and children";
   const StringFactory flat = CreateFlatStringConfig, xml = CreateXmlStringConfig;
   const std::tuple<StringFactory, const char*, std::string> cases[] = {
       {flat, "a/b = \"1\"\nno equals sign\n", "Not a setting at line 2"},
       {flat, "= \"1\"\n", "Not a setting at line 1"},
       {flat, "a = \"1\n", "Not a setting at line 1"},
       {flat, "  = \"1\"\n", "Empty key at line 1"},
       {flat, "a[x = \"1\"\n", "Malformed key at line 1"},
       {flat, "a = \"1\"\na/b = \"2\"\n", both + " at line 2"},
       {flat, "a/b = \"2\"\na = \"1\"\n", both + " at line 2"},
       {xml, "<c><a>text<b>1</b></a></c>", both},
       {xml, "<c><a id=\"1\">x</a><a id=\"1\">y</a></c>", "Duplicate child: a[1]"},
       {xml, "<c><a>x</a><a>y</a></c>", "Duplicate child: a"}};
   for (auto& [factory, text, error] : cases) {
      EXPECT_EQ(ParseError(factory, text), "File Format Exception: " + error);
   }
   EXPECT_NE(ParseError(CreateXmlStringConfig, "<c><a>x</c>").find("at line 1"), std::string::npos);
   EXPECT_NE(ParseError(CreateXmlStringConfig, "<!DOCTYPE c [<!ENTITY e \"x\">]><c>&e;</c>"),
             "no exception");
   // Different ids, or an id and none, are different children.
   Ref<Config> config;
   std::string ok = "<c><a id=\"1\">x</a><a id=\"2\">y</a><a>z</a></c>";
   CreateXmlStringConfig(ok, config);
   EXPECT_EQ(Text(config.Get(), "a"), "z");
}

TEST(ConfigSyntaxTest, DeepNestingIsRefused) {
   std::string open, close, key;
   for (int i = 0; i <= kConfigMaxDepth + 1; ++i) open += "<a>", close += "</a>";
   EXPECT_NE(ParseError(CreateXmlStringConfig, open + "x" + close).find("nested deeper"),
             std::string::npos);
   for (int i = 0; i <= kConfigMaxDepth; ++i) key += "a/";
   EXPECT_NE(ParseError(CreateFlatStringConfig, key + "b = \"1\"\n").find("too deep"),
             std::string::npos);
}

TEST(ConfigSyntaxTest, TreesASyntaxCannotHoldAreRefusedAndTheTextKept) {
   const std::pair<StringFactory, std::pair<const char*, const char*>> refused[] = {
       {CreateXmlStringConfig, {"1bad", "tag is not an XML name"}},
       {CreateXmlStringConfig, {"ctl", "bell\x07"}},
       {CreateXmlStringConfig, {"ctl", "bad utf-8 \xC3"}},
       {CreateFlatStringConfig, {"a", "line\nfeed"}},
       {CreateFlatStringConfig, {"k=v", "x"}},
       {CreateFlatStringConfig, {"id[x]y]", "x"}}};  // an id with "]" would not read back
   for (auto& [factory, setting] : refused) {
      std::string text = factory == CreateXmlStringConfig ? "<config/>" : "a = \"ok\"\n";
      const std::string before = text;
      Ref<Config> config;
      factory(text, config);
      MainView(config.Get())->Set(setting.first, setting.second);
      EXPECT_THROW(config->Flush(), InvalidArgumentException) << setting.first;
      EXPECT_EQ(text, before);
      EXPECT_TRUE(config->IsDirty());
      MainView(config.Get())->Unset(setting.first);
      config->Flush();  // the rest of the tree still writes
   }
}
