#include <thread>

#include "tests/perfcounter/fixture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

using QueryTest = RegistryFixture;

TEST_F(QueryTest, RegexAndNamesQueriesSelect) {
   Add({"/Pool/Thread/Busy", "/Pool/Thread/Idle", "/Http/Requests"});
   Add({"/a/b", "/a/bc", "/a/b/c"}, 10);
   Ref<Query> ignoringCase, caseSensitive, anchored, byName;
   registry->CreateRegexQuery("thread", false, ignoringCase);
   registry->CreateRegexQuery("thread", true, caseSensitive);
   registry->CreateRegexQuery("^/Pool/.*Busy$", true, anchored);
   EXPECT_THAT(Run(ignoringCase.Get()),
               ElementsAre("/Pool/Thread/Busy = 0", "/Pool/Thread/Idle = 1"));
   EXPECT_THAT(Run(caseSensitive.Get()), IsEmpty());
   EXPECT_THAT(Run(anchored.Get()), ElementsAre("/Pool/Thread/Busy = 0"));
   EXPECT_THROW(registry->CreateRegexQuery("(unclosed", true, anchored), InvalidArgumentException);
   std::vector<std::string> names = {"/a/b/c", "/a/b", "/missing"};
   registry->CreateNamesQuery(names, byName);
   EXPECT_THAT(Run(byName.Get()), ElementsAre("/a/b = 10", "/a/b/c = 12"));
}

TEST_F(QueryTest, SelectionFollowsRegistrationAndRemoval) {
   Add({"/Pool/Thread/Busy"}, 1);
   Ref<Query> query, byName;
   registry->CreateRegexQuery("Pool", true, query);
   Ref<IndexPublisher> publisher;
   Ref<RegistryItem> later =
       Add({"/Other", "/Pool/Later/One", "/Pool/Later/Two"}, 5, Metadata::TYPE_GAUGE, &publisher);
   std::vector<std::string> names = {"/Pool/Later/Two"};
   registry->CreateNamesQuery(names, byName);

   EXPECT_THAT(Run(query.Get()),
               ElementsAre("/Pool/Thread/Busy = 1", "/Pool/Later/One = 6", "/Pool/Later/Two = 7"));
   EXPECT_EQ(1, publisher->calls);  // one call per group, not per counter
   EXPECT_THAT(Run(byName.Get()), ElementsAre("/Pool/Later/Two = 7"));
   later->Unregister();
   EXPECT_THAT(Run(query.Get()), ElementsAre("/Pool/Thread/Busy = 1"));
   EXPECT_THAT(Run(byName.Get()), IsEmpty());
   Add({"/Pool/Later/Two"}, 9);
   EXPECT_THAT(Run(byName.Get()), ElementsAre("/Pool/Later/Two = 9"));
}

TEST_F(QueryTest, OptionsSortAndFreezeTheSelectionAndExecuteAppends) {
   Add({"/z"}, 1);
   Add({"/a"}, 2);
   Ref<Query> query;
   registry->CreateRegexQuery(".", true, query);
   EXPECT_THAT(Run(query.Get()), ElementsAre("/z = 1", "/a = 2"));
   query->SetQueryOption(QUERY_OPTION_SORT_BY_NAME, true);
   EXPECT_THAT(Run(query.Get()), ElementsAre("/a = 2", "/z = 1"));
   query->SetQueryOption(QUERY_OPTION_TRACK_NEW_COUNTERS, false);
   Add({"/m"}, 3);
   EXPECT_THAT(Run(query.Get()), ElementsAre("/a = 2", "/z = 1"));
   query->Clear();  // compiled again from the tree at the next run
   EXPECT_THAT(Run(query.Get()), ElementsAre("/a = 2", "/m = 3", "/z = 1"));
   EXPECT_THROW(query->SetQueryOption(static_cast<QueryOption>(9), true), InvalidArgumentException);

   QueryResults results;  // runs under the caller's lock of either kind, and appends
   registry->WriteLock();
   query->Execute(results);
   registry->Unlock();
   registry->ReadLock();
   query->Execute(results);
   registry->Unlock();
   EXPECT_EQ(6u, results.size());
}

TEST_F(QueryTest, ManyThreadsExecuteWhileGroupsComeAndGo) {
   Ref<Query> query;
   registry->CreateRegexQuery("^/t/", true, query);
   std::atomic<bool> stop{false};
   std::vector<std::thread> readers;
   for (int t = 0; t < 2; ++t) {
      readers.emplace_back([&] {
         // Groups enter and leave whole: never half of one.
         while (!stop.load()) ASSERT_EQ(0u, Run(query.Get()).size() % 2);
      });
   }
   for (int i = 0; i < 200; ++i) {
      std::string base = "/t/" + std::to_string(i);
      Ref<RegistryItem> item = Add({base + "/a", base + "/b"});
      if (i % 2) item->Unregister();
   }
   stop = true;
   Pelmora::Testing::JoinAll(readers, "readers to finish");
   EXPECT_EQ(200u, Run(query.Get()).size());
}

// Regression: a query dropped on another thread must leave the registry's list of live
// queries before its matcher is gone, while new groups are being announced to that list.
TEST_F(QueryTest, QueriesDroppedWhileGroupsArrive) {
   std::atomic<bool> stop{false};
   std::vector<std::thread> droppers;
   for (int t = 0; t < 2; ++t) {
      droppers.emplace_back([&, t] {
         while (!stop.load()) {
            Ref<Query> query;
            std::vector<std::string> names = {"/d/0/a", "/d/1/a"};
            if (t == 0)
               registry->CreateRegexQuery("^/d/[0-9]+/a$", true, query);
            else
               registry->CreateNamesQuery(names, query);
            ASSERT_LE(Run(query.Get()).size(), 1u);  // one group at a time exists
         }
      });
   }
   for (int i = 0; i < 300; ++i) {
      std::string base = "/d/" + std::to_string(i % 4);
      AddGroup(registry.Get(), {base + "/a", base + "/b"})->Unregister();
   }
   stop = true;
   Pelmora::Testing::JoinAll(droppers, "droppers to finish");
   EXPECT_EQ(std::string::npos, registry->ToString().find("pattern="));  // none left behind
}

using QueryDeathTest = RegistryFixture;

TEST_F(QueryDeathTest, MisuseOfTheLifecyclePanics) {
   const std::string where = "\" @ src/perfcounter/queryImpl.cpp:[0-9]+";
   EXPECT_DEATH(
       {
          Ref<Query> query;
          registry->CreateRegexQuery("x", true, query);
          query->Uninitialize();
          QueryResults results;
          query->Execute(results);
       },
       "Assert Failed: \"_state == COMPILED" + where);
   EXPECT_DEATH(
       {
          Ref<Query> query;
          registry->WriteLock();
          registry->CreateRegexQuery("x", true, query);
       },
       "Assert Failed: \"!_registry->IsWriteLocked\\(\\)" + where);
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
