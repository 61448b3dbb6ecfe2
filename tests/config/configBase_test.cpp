// Views: paths, typed values, defaults, ids, and concurrent use.

#include <algorithm>
#include <atomic>
#include <chrono>
#include <climits>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "tests/support/watchdog.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

// The value at `path` read as a T; "<absent>" text or T{} when nothing answers.
template <class T = std::string>
T Get(Config::View* view, const std::string& path) {
   T value{};
   if constexpr (std::is_same_v<T, std::string>) value = "<absent>";
   view->Get(path, &value);
   return value;
}

// Writes `value` at "x" and reads it back as a T.
template <class T, class V>
T SetGet(Config::View* view, V value) {
   view->Set("x", value);
   return Get<T>(view, "x");
}

template <class T>
std::string ErrorText(Config::View* view, const char* text) {
   try {
      SetGet<T>(view, text);
   } catch (const NumberFormatException& e) {
      return e.what();
   }
   return "no exception";
}

class ConfigViewTest : public testing::Test {
protected:
   ConfigViewTest() {
      CreateScratchConfig(config);
      config->GetMainView(main);
      config->GetDefaultsMainView(defaults);
      v = main.Get();
   }
   static Ref<Config::View> View(Config* config, const std::string& path) {
      Ref<Config::View> out;
      config->GetView(path, out);
      return out;
   }
   Ref<Config> config;
   Ref<Config::View> main, defaults;
   Config::View* v;
};

}  // namespace

TEST_F(ConfigViewTest, EmptySegmentsAreSkippedAndIdsMatchExactly) {
   v->Set("a//b/", "1");
   EXPECT_EQ(Get(v, "/a/b//"), "1");
   v->Set("level[x]/name", "with id");
   v->Set("level/name", "without id");
   EXPECT_EQ(Get(v, "level[x]/name"), "with id");
   EXPECT_EQ(Get(v, "level/name"), "without id");
   EXPECT_EQ(Get(v, "level[y]/name"), "<absent>");
   EXPECT_EQ(Get(v, "level[]/name"), "<absent>");  // an empty id is an id
}

TEST_F(ConfigViewTest, UnclosedBracketThrowsEvenWhereNothingExists) {
   std::string value;
   std::vector<std::string> names;
   Ref<Config::View> sub;
   EXPECT_THROW(v->Get("log/level[x", &value), InvalidArgumentException);
   EXPECT_THROW(v->Get("missing/level[x/y", &value), InvalidArgumentException);
   EXPECT_THROW(v->Set("level[x/name", "v"), InvalidArgumentException);
   EXPECT_THROW(v->Set("a[b]c", "v"), InvalidArgumentException);
   EXPECT_THROW(v->GetChildNames("level[x", names), InvalidArgumentException);
   EXPECT_THROW(config->GetView("level[x", sub), InvalidArgumentException);
   EXPECT_FALSE(v->IsSet("level"));  // the failed Set left nothing behind
   EXPECT_FALSE(config->IsDirty());
}

TEST_F(ConfigViewTest, DefaultsAnswerOnlyWhenTheMainTreeIsSilent) {
   defaults->Set("log/level", "info");
   defaults->Set("log/maxFileNum", 10);
   EXPECT_FALSE(config->IsDirty());  // defaults never make the configuration dirty
   EXPECT_EQ(Get(v, "log/level"), "info");
   EXPECT_FALSE(v->IsSet("log/level"));  // defaults are not "set"
   v->Set("log/level", "trivia");
   EXPECT_EQ(Get(v, "log/level"), "trivia");
   EXPECT_EQ(Get<int>(v, "log/maxFileNum"), 10);
   v->Unset("log/level");
   EXPECT_EQ(Get(v, "log/level"), "info");
   // A sub-view sees the defaults at its own prefix.
   EXPECT_EQ(Get<int>(View(config.Get(), "log").Get(), "maxFileNum"), 10);

   // SetConfigDefaults copies another view's subtree; the main tree still wins.
   Ref<Config> source;
   CreateScratchConfig(source);
   Ref<Config::View> sourceView = View(source.Get(), "pelmora");
   sourceView->Set("log/maxFileNum", 5);
   sourceView->Set("http/port", 8080);
   SetConfigDefaults(config.Get(), sourceView.Get());
   EXPECT_EQ(Get<int>(v, "http/port"), 8080);
   EXPECT_EQ(Get<int>(v, "log/maxFileNum"), 5);  // values of the copied view win
   EXPECT_EQ(Get(v, "log/level"), "info");       // over what the defaults held
   EXPECT_FALSE(v->IsSet("http/port"));
   v->Set("http/port", 1);
   EXPECT_EQ(Get<int>(v, "http/port"), 1);
   sourceView->Set("log/maxFileNum", 9);  // a copy: later changes do not reach the defaults
   EXPECT_EQ(Get<int>(v, "log/maxFileNum"), 5);
}

TEST_F(ConfigViewTest, TypedValuesReadBackAsSetAndLenientFormsParse) {
   EXPECT_EQ(SetGet<int>(v, INT_MIN), INT_MIN);
   EXPECT_EQ(SetGet<unsigned>(v, UINT_MAX), UINT_MAX);
   EXPECT_EQ(SetGet<long long>(v, LLONG_MIN), LLONG_MIN);
   EXPECT_EQ(SetGet<double>(v, 0.1), 0.1);
   EXPECT_EQ(Get(v, "x"), "0.1");
   EXPECT_TRUE(SetGet<bool>(v, true));
   EXPECT_EQ(Get(v, "x"), "true");
   EXPECT_EQ(SetGet<std::string>(v, false), "false");
   int untouched = 42;
   EXPECT_FALSE(v->Get("absent", &untouched));
   EXPECT_EQ(untouched, 42);

   EXPECT_EQ(SetGet<int>(v, " +17"), 17);
   EXPECT_TRUE(SetGet<bool>(v, "TRUE"));
   bool f = true;
   v->Set("f", "False");
   EXPECT_TRUE(v->Get("f", &f));
   EXPECT_FALSE(f);
   EXPECT_EQ(SetGet<double>(v, "1e3"), 1000.0);
   EXPECT_EQ(SetGet<long long>(v, "2147483648"), 2147483648LL);
}

TEST_F(ConfigViewTest, UnparsableValuesGiveTheExactTexts) {
   const std::string integer = "Config Value not an integer", dbl = "Config value not a double";
   const std::string boolean = "Config Value not a boolean";
   const struct {
      std::string (*parse)(Config::View*, const char*);
      const char* text;
      std::string error;
   } cases[] = {{ErrorText<int>, "12abc", integer},       {ErrorText<int>, "2147483648", integer},
                {ErrorText<int>, "+-3", integer},         {ErrorText<int>, "", integer},
                {ErrorText<long long>, "12abc", integer}, {ErrorText<unsigned>, "-1", integer},
                {ErrorText<double>, "12abc", dbl},        {ErrorText<double>, "", dbl},
                {ErrorText<bool>, "yes", boolean},        {ErrorText<bool>, "truex", boolean}};
   for (auto& c : cases) EXPECT_EQ(c.parse(v, c.text), c.error) << c.text;
}

TEST_F(ConfigViewTest, ValuesAndChildrenNeverShareANodeAndUnsetPrunes) {
   v->Set("a/b", "1");
   EXPECT_THROW(v->Set("a", "x"), InvalidArgumentException);
   v->Set("v", "value");
   EXPECT_THROW(v->Set("v/child", "x"), InvalidArgumentException);
   EXPECT_THROW(v->Set("", "root"), InvalidArgumentException);
   v->Set("e", "");  // an empty value gives way to children
   v->Set("e/child", "x");
   EXPECT_EQ(Get(v, "e/child"), "x");
   EXPECT_EQ(Get(v, "e"), "<absent>");

   // Unset removes the subtree and the ancestors it leaves empty.
   v->Set("a/x/c", "1");
   v->Unset("a/x/c");
   EXPECT_FALSE(v->IsSet("a/x"));
   EXPECT_TRUE(v->IsSet("a/b"));
   v->Unset("a/b");
   EXPECT_FALSE(v->IsSet("a"));
   v->Unset("never/there");  // no-op
   v->Set("t/one", "1");
   v->Set("t/two", "2");
   v->Unset("t");
   EXPECT_FALSE(v->IsSet("t/one") || v->IsSet("t/two"));
}

TEST_F(ConfigViewTest, SubViewsFollowTheirNodeThroughRemovalAndCreation) {
   Ref<Config::View> log = View(config.Get(), "log"), nested;  // the node does not exist yet
   log->Set("level", "info");
   EXPECT_EQ(Get(v, "log/level"), "info");
   v->Unset("log");
   EXPECT_EQ(Get(log.Get(), "level"), "<absent>");
   v->Set("log/level", "error");  // a new node at the same place
   EXPECT_EQ(Get(log.Get(), "level"), "error");
   log->GetView("sub[7]", nested);
   nested->Set("x", 1);
   EXPECT_EQ(Get(v, "log/sub[7]/x"), "1");
}

TEST_F(ConfigViewTest, ManyChildrenStayReachableThroughTheIndex) {
   auto item = [](int i) { return "list/item[" + std::to_string(i) + "]"; };
   for (int i = 0; i < 100; ++i) v->Set(item(i), i);
   for (int i = 0; i < 100; i += 2) v->Unset(item(i));
   for (int i = 0; i < 100; ++i) EXPECT_EQ(Get(v, item(i)), i % 2 ? std::to_string(i) : "<absent>");
   v->Set(item(0), 1000);
   EXPECT_EQ(Get(v, item(0)), "1000");
}

TEST_F(ConfigViewTest, ChildNamesListTheMainTreeThenDefaultsOnly) {
   v->Set("level/entry[0001]/logName", "xml");
   v->Set("level/entry[0000]/logName", "http");
   v->Set("level/plain", "1");
   defaults->Set("level/entry[0000]/logName", "soap");
   defaults->Set("level/entry[0009]/logName", "journal");
   std::vector<std::string> names;
   v->GetChildNames("/level//", names);
   EXPECT_EQ(names,
             (std::vector<std::string>{"entry[0001]", "entry[0000]", "plain", "entry[0009]"}));
   EXPECT_EQ(Get(v, "level/" + names[3] + "/logName"), "journal");  // each name is a segment
   v->GetChildNames("level/entry[0001]", names);
   EXPECT_EQ(names, std::vector<std::string>{"logName"});
   v->GetChildNames("absent", names);
   EXPECT_TRUE(names.empty());
}

TEST_F(ConfigViewTest, GenerateIdFollowsTheLastChildWithTheTag) {
   // Each case: children set in order under a fresh parent, then the id for "item".
   const std::pair<std::vector<std::string>, std::string> cases[] = {
       {{}, "0000"},
       {{"other"}, "0000"},
       {{"item[0000]", "item[0001]"}, "0002"},
       // The last child counts, not the largest id; setting an existing one keeps the order.
       {{"item[0000]", "item[0041]", "item[0007]", "item[0000]"}, "0008"},
       {{"item[abc]"}, "abc0000"},     {{"item[12]"}, "120000"},
       {{"item[x9999]"}, "x99990000"}, {{"item[ab0099]"}, "ab0100"}};
   int parent = 0;
   std::string id;
   for (auto& [children, expected] : cases) {
      std::string prefix = "p" + std::to_string(parent++) + "/";
      for (auto& child : children) v->Set(prefix + child, "x");
      v->GenerateId(prefix + (parent % 2 ? "item" : "item[ignored]"), &id);
      EXPECT_EQ(id, expected) << prefix;
   }
   v->Set("plain/item", "no id");
   EXPECT_THROW(v->GenerateId("plain/item", &id), InvalidArgumentException);
}

// Readers see whole values, and a writer is not starved by readers that never pause: each
// change waits at most for the reads already running.
TEST_F(ConfigViewTest, ConcurrentReadersAndWritersSeeWholeValues) {
   auto key = [](int i) { return "v" + std::to_string(i); };
   for (int i = 0; i < 50; ++i) v->Set("k/" + key(i), "aaaa");
   std::atomic<bool> stop{false};
   std::atomic<int> bad{0};
   std::atomic<int> readersRunning{0};
   std::vector<std::thread> readers;
   for (int t = 0; t < 3; ++t) {
      readers.emplace_back([&] {
         Ref<Config::View> view = View(config.Get(), "k");
         std::string value;
         ++readersRunning;
         while (!stop.load()) {
            for (int i = 0; i < 50; ++i) {
               if (view->Get(key(i), &value) && value != "aaaa" && value != "bbbbbbbb") ++bad;
            }
         }
      });
   }
   {
      Pelmora::Testing::Watchdog watchdog("the readers to start");
      while (readersRunning.load() < 3) std::this_thread::yield();
   }
   std::chrono::steady_clock::duration slowest{};
   for (int round = 0; round < 100; ++round) {
      for (int i = 0; i <= 50; ++i) {
         auto start = std::chrono::steady_clock::now();
         if (i < 50) {
            v->Set("k/" + key(i), round % 2 ? "aaaa" : "bbbbbbbb");
         } else {
            v->Unset("k/" + key(round % 50));
         }
         slowest = std::max(slowest, std::chrono::steady_clock::now() - start);
      }
   }
   stop = true;
   Pelmora::Testing::JoinAll(readers, "readers to finish");
   EXPECT_EQ(bad.load(), 0);
   EXPECT_LT(slowest, std::chrono::milliseconds(500));
}
