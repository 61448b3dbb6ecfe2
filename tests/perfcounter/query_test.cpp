#include <gtest/gtest.h>
#include <gmock/gmock.h>

#include <atomic>
#include <thread>

#include "pelmora/exception/exceptions.h"
#include "pelmora/perfCounter.h"

namespace Pelmora::PerfCounter {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

// Values are the counter's position in its group plus a base; counts its calls.
class CountingPublisher : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit CountingPublisher(long long base) : _base(base) {}
   void CollectValues(RefVector<Metadata>& metadata, std::vector<Value>& values) override {
      ++calls;
      for (size_t i = 0; i < metadata.size(); ++i) values.emplace_back(_base + static_cast<long long>(i));
   }
   std::atomic<int> calls{0};

private:
   long long _base;
};

class QueryTest : public testing::Test {
protected:
   void SetUp() override { CreateCounterRegistry(registry); }
   void TearDown() override {
      for (auto& item : items) item->Unregister();
   }

   Ref<RegistryItem> Add(std::initializer_list<const char*> names, long long base = 0,
                         Ref<CountingPublisher>* publisherOut = nullptr) {
      RefVector<Metadata> metadata;
      for (const char* name : names) metadata.push_back(new Metadata(name, Metadata::TYPE_GAUGE));
      Ref<CountingPublisher> publisher = new CountingPublisher(base);
      Ref<RegistryItem> item;
      registry->RegisterGroup(metadata, publisher.Get(), item);
      items.push_back(item);
      if (publisherOut) *publisherOut = publisher;
      return item;
   }

   static std::vector<std::string> Run(Query* query) {
      QueryResults results;
      query->Execute(results);
      std::vector<std::string> texts;
      for (const QueryResult& r : results) texts.push_back(r.ToString());
      return texts;
   }

   Ref<Registry> registry;
   RefVector<RegistryItem> items;
};

TEST_F(QueryTest, RegexSearchesAndHonoursTheCaseFlag) {
   Add({"/Pool/Thread/Busy", "/Pool/Thread/Idle", "/Http/Requests"});
   Ref<Query> ignoringCase, caseSensitive, anchored;
   registry->CreateRegexQuery("thread", false, ignoringCase);
   registry->CreateRegexQuery("thread", true, caseSensitive);
   registry->CreateRegexQuery("^/Pool/.*Busy$", true, anchored);
   EXPECT_THAT(Run(ignoringCase.Get()), ElementsAre("/Pool/Thread/Busy = 0", "/Pool/Thread/Idle = 1"));
   EXPECT_THAT(Run(caseSensitive.Get()), IsEmpty());
   EXPECT_THAT(Run(anchored.Get()), ElementsAre("/Pool/Thread/Busy = 0"));
   EXPECT_THROW(registry->CreateRegexQuery("(unclosed", true, anchored), InvalidArgumentException);
}

TEST_F(QueryTest, NamesQuerySelectsExactNamesOnly) {
   Add({"/a/b", "/a/bc", "/a/b/c"}, 10);
   std::vector<std::string> names = {"/a/b/c", "/a/b", "/missing"};
   Ref<Query> query;
   registry->CreateNamesQuery(names, query);
   EXPECT_THAT(Run(query.Get()), ElementsAre("/a/b = 10", "/a/b/c = 12"));
}

TEST_F(QueryTest, SelectionFollowsRegistrationAndRemoval) {
   Add({"/Pool/Thread/Busy"}, 1);
   Ref<Query> query;
   registry->CreateRegexQuery("Pool", true, query);
   Ref<CountingPublisher> publisher;
   Ref<RegistryItem> later = Add({"/Other", "/Pool/Later/One", "/Pool/Later/Two"}, 5, &publisher);
   std::vector<std::string> names = {"/Pool/Later/Two"};
   Ref<Query> byName;
   registry->CreateNamesQuery(names, byName);

   EXPECT_THAT(Run(query.Get()),
               ElementsAre("/Pool/Thread/Busy = 1", "/Pool/Later/One = 6", "/Pool/Later/Two = 7"));
   EXPECT_EQ(1, publisher->calls);  // one call for the group, not one per counter
   EXPECT_THAT(Run(byName.Get()), ElementsAre("/Pool/Later/Two = 7"));

   later->Unregister();
   EXPECT_THAT(Run(query.Get()), ElementsAre("/Pool/Thread/Busy = 1"));
   EXPECT_THAT(Run(byName.Get()), IsEmpty());
   Add({"/Pool/Later/Two"}, 9);
   EXPECT_THAT(Run(byName.Get()), ElementsAre("/Pool/Later/Two = 9"));
}

TEST_F(QueryTest, OptionsSortAndFreezeTheSelection) {
   Add({"/z"}, 1);
   Add({"/a"}, 2);
   Ref<Query> query;
   registry->CreateRegexQuery(".", true, query);
   EXPECT_TRUE(query->GetQueryOption(QUERY_OPTION_TRACK_NEW_COUNTERS));
   EXPECT_FALSE(query->GetQueryOption(QUERY_OPTION_SORT_BY_NAME));
   EXPECT_THAT(Run(query.Get()), ElementsAre("/z = 1", "/a = 2"));
   query->SetQueryOption(QUERY_OPTION_SORT_BY_NAME, true);
   EXPECT_THAT(Run(query.Get()), ElementsAre("/a = 2", "/z = 1"));

   query->SetQueryOption(QUERY_OPTION_TRACK_NEW_COUNTERS, false);
   Add({"/m"}, 3);
   EXPECT_THAT(Run(query.Get()), ElementsAre("/a = 2", "/z = 1"));
   query->Clear();  // compiled again from the tree at the next run
   EXPECT_THAT(Run(query.Get()), ElementsAre("/a = 2", "/m = 3", "/z = 1"));
   EXPECT_THROW(query->SetQueryOption(static_cast<QueryOption>(9), true), InvalidArgumentException);
}

TEST_F(QueryTest, ExecuteAppendsAndRunsUnderTheCallersLock) {
   Add({"/x"}, 4);
   Ref<Query> query;
   registry->CreateRegexQuery("x", true, query);
   QueryResults results;
   registry->WriteLock();
   query->Execute(results);
   registry->Unlock();
   registry->ReadLock();
   query->Execute(results);
   registry->Unlock();
   ASSERT_EQ(2u, results.size());
   EXPECT_EQ("/x = 4", results[1].ToString());
}

TEST_F(QueryTest, ManyThreadsExecuteWhileGroupsComeAndGo) {
   Ref<Query> query;
   registry->CreateRegexQuery("^/t/", true, query);
   std::atomic<bool> stop{false};
   std::vector<std::thread> readers;
   for (int t = 0; t < 2; ++t) {
      readers.emplace_back([&] {
         while (!stop.load()) {
            QueryResults results;
            query->Execute(results);
            // Groups enter and leave whole: never half of one.
            ASSERT_EQ(0u, results.size() % 2);
         }
      });
   }
   for (int i = 0; i < 200; ++i) {
      std::string a = "/t/" + std::to_string(i) + "/a", b = "/t/" + std::to_string(i) + "/b";
      RefVector<Metadata> metadata = {new Metadata(a, Metadata::TYPE_GAUGE),
                                      new Metadata(b, Metadata::TYPE_GAUGE)};
      Ref<GroupPublisher> publisher = new CountingPublisher(0);
      Ref<RegistryItem> item;
      registry->RegisterGroup(metadata, publisher.Get(), item);
      if (i % 2) item->Unregister();
      items.push_back(item);
   }
   stop = true;
   for (auto& thread : readers) thread.join();
   EXPECT_EQ(200u, [&] {
      QueryResults results;
      query->Execute(results);
      return results.size();
   }());
}

// The registry tells live queries of new groups; a query being dropped on another thread
// must leave the list before its matcher is gone.
TEST_F(QueryTest, QueriesDroppedWhileGroupsArrive) {
   std::atomic<bool> stop{false};
   std::vector<std::thread> droppers;
   for (int t = 0; t < 2; ++t) {
      droppers.emplace_back([&, t] {
         while (!stop.load()) {
            Ref<Query> query;
            if (t == 0) {
               registry->CreateRegexQuery("^/d/[0-9]+/a$", true, query);
            } else {
               std::vector<std::string> names = {"/d/0/a", "/d/1/a"};
               registry->CreateNamesQuery(names, query);
            }
            QueryResults results;
            query->Execute(results);
            // One group at a time is registered, so at most its "a" counter.
            ASSERT_LE(results.size(), 1u);
         }
      });
   }
   for (int i = 0; i < 300; ++i) {
      std::string base = "/d/" + std::to_string(i % 4);
      RefVector<Metadata> metadata = {new Metadata(base + "/a", Metadata::TYPE_GAUGE),
                                      new Metadata(base + "/b", Metadata::TYPE_GAUGE)};
      Ref<GroupPublisher> publisher = new CountingPublisher(0);
      Ref<RegistryItem> item;
      registry->RegisterGroup(metadata, publisher.Get(), item);
      item->Unregister();
   }
   stop = true;
   for (auto& thread : droppers) thread.join();
   EXPECT_EQ(std::string::npos, registry->ToString().find("pattern="));  // none left behind
}

TEST(QueryDeathTest, MisuseOfTheLifecyclePanics) {
   Ref<Registry> registry;
   CreateCounterRegistry(registry);
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
}  // namespace Pelmora::PerfCounter
