// Views: paths, typed values, defaults, ids, and concurrent use.

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

struct Scratch {
   Scratch() {
      CreateScratchConfig(config);
      config->GetMainView(view);
   }
   Ref<Config> config;
   Ref<Config::View> view;
};

template <class T>
std::string FailureText(Config::View* view, const std::string& path) {
   T value{};
   try {
      view->Get(path, &value);
   } catch (const NumberFormatException& e) {
      return e.what();
   }
   return "no exception";
}

}  // namespace

TEST(ConfigPathTest, EmptySegmentsAndIdsAddressTheSameNode) {
   Scratch s;
   s.view->Set("a//b/", "1");
   std::string value;
   ASSERT_TRUE(s.view->Get("a/b", &value));
   EXPECT_EQ(value, "1");
   ASSERT_TRUE(s.view->Get("/a/b//", &value));

   s.view->Set("level[x]/name", "with id");
   s.view->Set("level/name", "without id");
   ASSERT_TRUE(s.view->Get("level[x]/name", &value));
   EXPECT_EQ(value, "with id");
   ASSERT_TRUE(s.view->Get("level/name", &value));
   EXPECT_EQ(value, "without id");
   EXPECT_FALSE(s.view->Get("level[y]/name", &value));
   // An empty id is an id: it does not match the node without one.
   EXPECT_FALSE(s.view->Get("level[]/name", &value));
}

TEST(ConfigPathTest, UnclosedBracketThrowsEvenWhereNothingExists) {
   Scratch s;
   std::string value;
   EXPECT_THROW(s.view->Get("log/level[x", &value), InvalidArgumentException);
   EXPECT_THROW(s.view->Get("missing/level[x/y", &value), InvalidArgumentException);
   EXPECT_THROW(s.view->Set("level[x/name", "v"), InvalidArgumentException);
   EXPECT_THROW(s.view->Set("a[b]c", "v"), InvalidArgumentException);
   Ref<Config::View> sub;
   EXPECT_THROW(s.config->GetView("level[x", sub), InvalidArgumentException);
   // The failed Set left nothing behind.
   EXPECT_FALSE(s.view->IsSet("level"));
   EXPECT_FALSE(s.config->IsDirty());
}

TEST(ConfigViewTest, DefaultsAnswerOnlyWhenTheMainTreeIsSilent) {
   Scratch s;
   Ref<Config::View> defaults;
   s.config->GetDefaultsMainView(defaults);
   defaults->Set("log/level", "info");
   defaults->Set("log/maxFileNum", 10);

   std::string level;
   ASSERT_TRUE(s.view->Get("log/level", &level));
   EXPECT_EQ(level, "info");
   EXPECT_FALSE(s.view->IsSet("log/level"));  // defaults are not "set"

   s.view->Set("log/level", "trivia");
   ASSERT_TRUE(s.view->Get("log/level", &level));
   EXPECT_EQ(level, "trivia");
   int files = 0;
   ASSERT_TRUE(s.view->Get("log/maxFileNum", &files));
   EXPECT_EQ(files, 10);

   s.view->Unset("log/level");
   ASSERT_TRUE(s.view->Get("log/level", &level));
   EXPECT_EQ(level, "info");

   // A sub-view sees the defaults at its own prefix.
   Ref<Config::View> log;
   s.config->GetView("log", log);
   ASSERT_TRUE(log->Get("maxFileNum", &files));
   EXPECT_EQ(files, 10);
   // Filling the defaults never makes the configuration dirty.
   EXPECT_TRUE(s.config->IsDirty());  // from the Set and Unset above
}

TEST(ConfigViewTest, SetConfigDefaultsCopiesAViewsSubtree) {
   Scratch target;
   Scratch source;
   source.view->Set("pelmora/threadPool/maxThreads", 8);
   source.view->Set("pelmora/http/port", 8080);
   Ref<Config::View> pelmora;
   source.config->GetView("pelmora", pelmora);

   target.view->Set("threadPool/maxThreads", 2);
   SetConfigDefaults(target.config.Get(), pelmora.Get());
   int value = 0;
   ASSERT_TRUE(target.view->Get("http/port", &value));
   EXPECT_EQ(value, 8080);
   ASSERT_TRUE(target.view->Get("threadPool/maxThreads", &value));
   EXPECT_EQ(value, 2);  // the main tree still wins
   EXPECT_FALSE(target.view->IsSet("http/port"));

   // A copy: later changes of the source do not reach the defaults.
   source.view->Set("pelmora/http/port", 9090);
   ASSERT_TRUE(target.view->Get("http/port", &value));
   EXPECT_EQ(value, 8080);
}

TEST(ConfigViewTest, TypedValuesReadBackAsSet) {
   Scratch s;
   s.view->Set("i", -2147483647 - 1);
   s.view->Set("u", 4294967295u);
   s.view->Set("ll", -9223372036854775807LL - 1);
   s.view->Set("d", 0.1);
   s.view->Set("b", true);
   s.view->Set("s", std::string("text"));
   int i = 0;
   unsigned u = 0;
   long long ll = 0;
   double d = 0;
   bool b = false;
   std::string text;
   ASSERT_TRUE(s.view->Get("i", &i));
   ASSERT_TRUE(s.view->Get("u", &u));
   ASSERT_TRUE(s.view->Get("ll", &ll));
   ASSERT_TRUE(s.view->Get("d", &d));
   ASSERT_TRUE(s.view->Get("b", &b));
   EXPECT_EQ(i, -2147483647 - 1);
   EXPECT_EQ(u, 4294967295u);
   EXPECT_EQ(ll, -9223372036854775807LL - 1);
   EXPECT_EQ(d, 0.1);
   EXPECT_TRUE(b);
   ASSERT_TRUE(s.view->Get("b", &text));
   EXPECT_EQ(text, "true");
   ASSERT_TRUE(s.view->Get("d", &text));
   EXPECT_EQ(text, "0.1");
   s.view->Set("b", false);
   ASSERT_TRUE(s.view->Get("b", &text));
   EXPECT_EQ(text, "false");

   // Absent values leave the target alone.
   i = 42;
   EXPECT_FALSE(s.view->Get("absent", &i));
   EXPECT_EQ(i, 42);
}

TEST(ConfigViewTest, LenientNumberAndBooleanForms) {
   Scratch s;
   s.view->Set("n", " +17");
   s.view->Set("t", "TRUE");
   s.view->Set("f", "False");
   s.view->Set("e", "1e3");
   int n = 0;
   bool t = false, f = true;
   double e = 0;
   ASSERT_TRUE(s.view->Get("n", &n));
   EXPECT_EQ(n, 17);
   ASSERT_TRUE(s.view->Get("t", &t));
   EXPECT_TRUE(t);
   ASSERT_TRUE(s.view->Get("f", &f));
   EXPECT_FALSE(f);
   ASSERT_TRUE(s.view->Get("e", &e));
   EXPECT_EQ(e, 1000.0);
}

TEST(ConfigViewTest, UnparsableValuesGiveTheExactTexts) {
   Scratch s;
   s.view->Set("junk", "12abc");
   s.view->Set("big", "2147483648");
   s.view->Set("negative", "-1");
   s.view->Set("empty", "");
   s.view->Set("yes", "yes");
   s.view->Set("truex", "truex");
   s.view->Set("plusminus", "+-3");
   const std::string integer = "Config Value not an integer";
   EXPECT_EQ(FailureText<int>(s.view.Get(), "junk"), integer);
   EXPECT_EQ(FailureText<int>(s.view.Get(), "big"), integer);
   EXPECT_EQ(FailureText<int>(s.view.Get(), "plusminus"), integer);
   EXPECT_EQ(FailureText<long long>(s.view.Get(), "junk"), integer);
   EXPECT_EQ(FailureText<unsigned>(s.view.Get(), "negative"), integer);
   EXPECT_EQ(FailureText<int>(s.view.Get(), "empty"), integer);
   EXPECT_EQ(FailureText<double>(s.view.Get(), "junk"), "Config value not a double");
   EXPECT_EQ(FailureText<double>(s.view.Get(), "empty"), "Config value not a double");
   EXPECT_EQ(FailureText<bool>(s.view.Get(), "yes"), "Config Value not a boolean");
   EXPECT_EQ(FailureText<bool>(s.view.Get(), "truex"), "Config Value not a boolean");
   long long big = 0;
   ASSERT_TRUE(s.view->Get("big", &big));
   EXPECT_EQ(big, 2147483648LL);
}

TEST(ConfigViewTest, ValuesAndChildrenNeverShareANode) {
   Scratch s;
   s.view->Set("a/b", "1");
   EXPECT_THROW(s.view->Set("a", "x"), InvalidArgumentException);
   s.view->Set("v", "value");
   EXPECT_THROW(s.view->Set("v/child", "x"), InvalidArgumentException);
   // An empty value gives way to children.
   s.view->Set("e", "");
   s.view->Set("e/child", "x");
   std::string value;
   ASSERT_TRUE(s.view->Get("e/child", &value));
   EXPECT_FALSE(s.view->Get("e", &value));
   EXPECT_THROW(s.view->Set("", "root"), InvalidArgumentException);
}

TEST(ConfigViewTest, UnsetRemovesTheSubtreeAndEmptiedAncestors) {
   Scratch s;
   s.view->Set("a/b/c", "1");
   s.view->Set("a/x", "2");
   s.view->Unset("a/b/c");
   EXPECT_FALSE(s.view->IsSet("a/b"));
   EXPECT_TRUE(s.view->IsSet("a/x"));
   s.view->Unset("a/x");
   EXPECT_FALSE(s.view->IsSet("a"));
   s.view->Unset("never/there");  // no-op

   s.view->Set("t/one", "1");
   s.view->Set("t/two", "2");
   s.view->Unset("t");
   EXPECT_FALSE(s.view->IsSet("t/one"));
   EXPECT_FALSE(s.view->IsSet("t/two"));
}

TEST(ConfigViewTest, SubViewsFollowTheirNodeThroughRemovalAndCreation) {
   Scratch s;
   Ref<Config::View> log;
   s.config->GetView("log", log);  // the node does not exist yet
   log->Set("level", "info");
   std::string value;
   ASSERT_TRUE(s.view->Get("log/level", &value));
   EXPECT_EQ(value, "info");

   s.view->Unset("log");
   EXPECT_FALSE(log->Get("level", &value));
   s.view->Set("log/level", "error");  // a new node at the same place
   ASSERT_TRUE(log->Get("level", &value));
   EXPECT_EQ(value, "error");

   Ref<Config::View> nested;
   log->GetView("sub[7]", nested);
   nested->Set("x", 1);
   ASSERT_TRUE(s.view->Get("log/sub[7]/x", &value));
   EXPECT_EQ(value, "1");
}

TEST(ConfigViewTest, ManyChildrenStayReachableThroughTheIndex) {
   Scratch s;
   for (int i = 0; i < 100; ++i) s.view->Set("list/item[" + std::to_string(i) + "]", i);
   for (int i = 0; i < 100; i += 2) s.view->Unset("list/item[" + std::to_string(i) + "]");
   for (int i = 0; i < 100; ++i) {
      int value = -1;
      bool found = s.view->Get("list/item[" + std::to_string(i) + "]", &value);
      ASSERT_EQ(found, i % 2 == 1) << i;
      if (found) {
         EXPECT_EQ(value, i);
      }
   }
   s.view->Set("list/item[0]", 1000);
   int value = 0;
   ASSERT_TRUE(s.view->Get("list/item[0]", &value));
   EXPECT_EQ(value, 1000);
}

TEST(ConfigViewTest, ChildNamesListTheMainTreeThenDefaultsOnly) {
   Scratch s;
   s.view->Set("level/entry[0001]/logName", "xml");
   s.view->Set("level/entry[0000]/logName", "http");
   s.view->Set("level/plain", "1");
   Ref<Config::View> defaults;
   s.config->GetDefaultsMainView(defaults);
   defaults->Set("level/entry[0000]/logName", "soap");
   defaults->Set("level/entry[0009]/logName", "journal");

   std::vector<std::string> names;
   s.view->GetChildNames("/level//", names);
   EXPECT_EQ((std::vector<std::string>{"entry[0001]", "entry[0000]", "plain", "entry[0009]"}),
             names);
   // The names are segments: each addresses its child again.
   std::string value;
   ASSERT_TRUE(s.view->Get("level/" + names[3] + "/logName", &value));
   EXPECT_EQ("journal", value);

   s.view->GetChildNames("level/entry[0001]", names);
   EXPECT_EQ(std::vector<std::string>{"logName"}, names);
   s.view->GetChildNames("absent", names);
   EXPECT_TRUE(names.empty());
   EXPECT_THROW(s.view->GetChildNames("level[x", names), InvalidArgumentException);
}

TEST(ConfigGenerateIdTest, FollowsTheLastChildWithTheTag) {
   Scratch s;
   std::string id;
   s.view->GenerateId("missing/item", &id);
   EXPECT_EQ(id, "0000");
   s.view->Set("list/other", "1");
   s.view->GenerateId("list/item", &id);
   EXPECT_EQ(id, "0000");

   s.view->Set("list/item[0000]", "a");
   s.view->Set("list/item[0001]", "b");
   s.view->GenerateId("list/item", &id);
   EXPECT_EQ(id, "0002");
   // The last child counts, not the largest id.
   s.view->Set("list/item[0000]", "c");  // already there: order unchanged
   s.view->Set("list/item[0041]", "d");
   s.view->Set("list/item[0007]", "e");
   s.view->GenerateId("list/item", &id);
   EXPECT_EQ(id, "0008");

   s.view->Set("abc/item[abc]", "x");
   s.view->GenerateId("abc/item", &id);
   EXPECT_EQ(id, "abc0000");
   s.view->Set("short/item[12]", "x");
   s.view->GenerateId("short/item", &id);
   EXPECT_EQ(id, "120000");
   s.view->Set("nine/item[x9999]", "x");
   s.view->GenerateId("nine/item", &id);
   EXPECT_EQ(id, "x99990000");
   s.view->Set("mid/item[ab0099]", "x");
   s.view->GenerateId("mid/item[ignored]", &id);
   EXPECT_EQ(id, "ab0100");

   s.view->Set("plain/item", "no id");
   EXPECT_THROW(s.view->GenerateId("plain/item", &id), InvalidArgumentException);
}

TEST(ConfigViewTest, ConcurrentReadersAndWritersSeeWholeValues) {
   Scratch s;
   for (int i = 0; i < 50; ++i) s.view->Set("k/v" + std::to_string(i), "aaaa");
   std::atomic<bool> stop{false};
   std::atomic<int> bad{0};
   std::vector<std::thread> readers;
   for (int t = 0; t < 3; ++t) {
      readers.emplace_back([&] {
         Ref<Config::View> view;
         s.config->GetView("k", view);
         std::string value;
         while (!stop.load()) {
            for (int i = 0; i < 50; ++i) {
               if (view->Get("v" + std::to_string(i), &value) && value != "aaaa" && value != "bbbbbbbb") {
                  ++bad;
               }
            }
         }
      });
   }
   for (int round = 0; round < 200; ++round) {
      for (int i = 0; i < 50; ++i) s.view->Set("k/v" + std::to_string(i), round % 2 ? "aaaa" : "bbbbbbbb");
      s.view->Unset("k/v" + std::to_string(round % 50));
   }
   stop = true;
   for (auto& t : readers) t.join();
   EXPECT_EQ(bad.load(), 0);
}
