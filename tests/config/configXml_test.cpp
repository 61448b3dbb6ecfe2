// The XML syntax: trimming, quoting, the root tag, empty text.

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

TEST(ConfigXmlTest, XmlValuesAreTrimmedUnlessQuotedAndTheRootKeepsItsTag) {
   std::string xml =
       "<?xml version=\"1.0\"?>\n<settings>\n  <!-- comment -->\n"
       "  <log>\n    <level>\n      info\n    </level>\n    <name>\"  spaced  \"</name>\n"
       "    <one>\"</one>\n    <cdata><![CDATA[ <raw> ]]></cdata>\n  </log>\n"
       "  <level id=\"0001\"><logName>http</logName></level>\n  <empty/>\n</settings>\n";
   Ref<Config> config, reread;
   CreateXmlStringConfig(xml, config);
   const std::pair<const char*, const char*> read[] = {
       {"log/level", "info"}, {"log/name", "  spaced  "},         {"log/one", "\""},
       {"log/cdata", "<raw>"}, {"level[0001]/logName", "http"}, {"empty", ""}};
   for (auto& [path, value] : read) EXPECT_EQ(Text(config.Get(), path), value) << path;

   // Values that trimming would change are written quoted, and read back whole.
   const std::string values[] = {"  two leading, one trailing ", "\"wrapped\"", "\"", "\tx\n",
                                 "inner \"quotes\" stay", "\r\n", "line\r\nbreaks"};
   for (size_t i = 0; i < std::size(values); ++i) {
      MainView(config.Get())->Set("v[" + std::to_string(i) + "]", values[i]);
   }
   config->Flush();
   for (const char* written :
        {"<settings>", "<level id=\"0001\">", "<v id=\"0\">\"  two leading, one trailing \"</v>",
         "<v id=\"1\">\"\"wrapped\"\"</v>", "<v id=\"4\">inner \"quotes\" stay</v>"}) {
      EXPECT_NE(xml.find(written), std::string::npos) << written << "\n" << xml;
   }
   CreateXmlStringConfig(xml, reread);
   for (size_t i = 0; i < std::size(values); ++i) {
      EXPECT_EQ(Text(reread.Get(), "v[" + std::to_string(i) + "]"), values[i]) << i;
   }
}

TEST(ConfigXmlTest, EmptyXmlTextIsAnEmptyConfiguration) {
   std::string xml = " \n";
   Ref<Config> config, reread;
   CreateXmlStringConfig(xml, config);
   config->Flush();
   EXPECT_EQ(xml, "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<config/>\n");
   std::string again = xml;
   CreateXmlStringConfig(again, reread);
   reread->Flush();
   EXPECT_EQ(again, xml);
   MainView(config.Get())->Set("a", "1");
   config->Flush();
   EXPECT_EQ(xml, "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<config>\n  <a>1</a>\n</config>\n");
}
