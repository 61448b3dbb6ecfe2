// Per-subsystem levels loaded from a configuration.

#include <gtest/gtest.h>

#include <string>

#include "pelmora/io/writers.h"
#include "pelmora/service.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

struct Loaded {
   explicit Loaded(const std::string& xml) : text(xml) {
      CreateXmlStringConfig(text, config);
      Ref<StringWriter> target;
      CreateStringWriter(target);
      CreateLogger(target.Get(), "app", "info", nullptr, root);
      manager = root->GetLogManager();
   }
   Ref<Logger> Child(const std::string& name) {
      Ref<Logger> logger;
      root->CreateLogger(name, logger);
      return logger;
   }
   std::string text;
   Ref<Config> config;
   Ref<Logger> root;
   LogManager* manager;
};

}  // namespace

TEST(LoadLogLevelsTest, EntriesSetTheNamedLoggersOnly) {
   Loaded t(
       "<config><level>"
       "<entry id='0000'><logName>http</logName><logLevel>error</logLevel>"
       "<memoryLevel>trivia</memoryLevel></entry>"
       "<entry id='0001'><logName>xml</logName><memoryLevel>warning</memoryLevel></entry>"
       "</level></config>");
   Ref<Logger> http = t.Child("http");  // exists before the load: changed in place
   t.manager->LoadLogLevels(t.config.Get());
   Ref<Logger> xml = t.Child("xml");  // made after the load
   Ref<Logger> httpServer = t.Child("httpServer");

   EXPECT_EQ("error", http->GetLevelByName());
   EXPECT_EQ("trivia", http->GetMemLevelByName());
   EXPECT_EQ("info", xml->GetLevelByName());
   EXPECT_EQ("warning", xml->GetMemLevelByName());
   EXPECT_EQ("info", httpServer->GetLevelByName());  // a name, not a prefix
   EXPECT_EQ("info", t.root->GetLevelByName());
}

TEST(LoadLogLevelsTest, PrefixEntriesCoverEveryNameThatBeginsWithTheirs) {
   Loaded t(
       "<config><level>"
       "<a><logName>http</logName><logLevel>verbose</logLevel><prefix>true</prefix></a>"
       "<b><logName>httpServer</logName><logLevel>error</logLevel></b>"
       "<c><logName>httpServ</logName><logLevel>warning</logLevel><prefix>TRUE</prefix></c>"
       "</level></config>");
   Ref<Logger> client = t.Child("httpClient");
   t.manager->LoadLogLevels(t.config.Get());
   EXPECT_EQ("verbose", client->GetLevelByName());
   EXPECT_EQ("verbose", t.Child("http")->GetLevelByName());
   // An exact name wins over every prefix; the longest prefix wins over shorter ones.
   EXPECT_EQ("error", t.Child("httpServer")->GetLevelByName());
   EXPECT_EQ("warning", t.Child("httpServlet")->GetLevelByName());
   EXPECT_EQ("info", t.Child("soap")->GetLevelByName());
}

TEST(LoadLogLevelsTest, BadEntriesAreSkippedAndTheRestApplied) {
   Loaded t(
       "<config><level>"
       "<a><logLevel>error</logLevel></a>"
       "<b><logName>x</logName><logLevel>loud</logLevel><memoryLevel>panic</memoryLevel></b>"
       "<c><logName>y</logName><prefix>maybe</prefix><logLevel>error</logLevel></c>"
       "<d><logName>z</logName><logLevel>quiet</logLevel></d>"
       "</level></config>");
   t.manager->LoadLogLevels(t.config.Get());
   Ref<Logger> x = t.Child("x");
   EXPECT_EQ("info", x->GetLevelByName());
   EXPECT_EQ("panic", x->GetMemLevelByName());
   EXPECT_EQ("info", t.Child("y")->GetLevelByName());
   EXPECT_EQ("quiet", t.Child("z")->GetLevelByName());

   // A configuration without entries changes nothing.
   Loaded empty("<config/>");
   empty.manager->LoadLogLevels(empty.config.Get());
   EXPECT_EQ("info", empty.Child("x")->GetLevelByName());
}
