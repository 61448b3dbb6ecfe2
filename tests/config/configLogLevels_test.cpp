// Per-subsystem levels loaded from a configuration.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "pelmora/service.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

// Loads `entries` into a fresh manager after making the loggers in `before`.
struct Loaded {
   explicit Loaded(const std::string& entries, std::initializer_list<const char*> before = {}) {
      std::string text =
          entries.empty() ? "<config/>" : "<config><level>" + entries + "</level></config>";
      Ref<Config> config;
      CreateXmlStringConfig(text, config);
      CreateLogger(nullptr, "app", "info", nullptr, root);
      for (const char* name : before) early.push_back(Child(name));
      root->GetLogManager()->LoadLogLevels(config.Get());
   }
   Ref<Logger> Child(const std::string& name) {
      Ref<Logger> logger;
      root->CreateLogger(name, logger);
      return logger;
   }
   std::string Level(const std::string& name) { return Child(name)->GetLevelByName(); }
   Ref<Logger> root;
   std::vector<Ref<Logger>> early;
};

}  // namespace

TEST(LoadLogLevelsTest, EntriesSetTheNamedLoggersOnlyAndPrefixesCoverLongerNames) {
   Loaded t(
       "<entry id='0000'><logName>http</logName><logLevel>error</logLevel>"
       "<memoryLevel>trivia</memoryLevel></entry>"
       "<entry id='0001'><logName>xml</logName><memoryLevel>warning</memoryLevel></entry>",
       {"http"});  // exists before the load: changed in place
   EXPECT_EQ("error", t.early[0]->GetLevelByName());
   EXPECT_EQ("trivia", t.early[0]->GetMemLevelByName());
   EXPECT_EQ("info", t.Level("xml"));
   EXPECT_EQ("warning", t.Child("xml")->GetMemLevelByName());
   EXPECT_EQ("info", t.Level("httpServer"));  // a name, not a prefix
   EXPECT_EQ("info", t.root->GetLevelByName());

   Loaded p(
       "<a><logName>http</logName><logLevel>verbose</logLevel><prefix>true</prefix></a>"
       "<b><logName>httpServer</logName><logLevel>error</logLevel></b>"
       "<c><logName>httpServ</logName><logLevel>warning</logLevel><prefix>TRUE</prefix></c>",
       {"httpClient"});
   EXPECT_EQ("verbose", p.early[0]->GetLevelByName());
   EXPECT_EQ("verbose", p.Level("http"));
   // An exact name wins over every prefix; the longest prefix wins over shorter ones.
   EXPECT_EQ("error", p.Level("httpServer"));
   EXPECT_EQ("warning", p.Level("httpServlet"));
   EXPECT_EQ("info", p.Level("soap"));
}

TEST(LoadLogLevelsTest, BadEntriesAreSkippedAndTheRestApplied) {
   Loaded t(
       "<a><logLevel>error</logLevel></a>"
       "<b><logName>x</logName><logLevel>loud</logLevel><memoryLevel>panic</memoryLevel></b>"
       "<c><logName>y</logName><prefix>maybe</prefix><logLevel>error</logLevel></c>"
       "<d><logName>z</logName><logLevel>quiet</logLevel></d>");
   EXPECT_EQ("info", t.Level("x"));
   EXPECT_EQ("panic", t.Child("x")->GetMemLevelByName());
   EXPECT_EQ("info", t.Level("y"));
   EXPECT_EQ("quiet", t.Level("z"));
   EXPECT_EQ("info", Loaded("").Level("x"));  // no entries, no change
}
