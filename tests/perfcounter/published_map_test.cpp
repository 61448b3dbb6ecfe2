#include <gtest/gtest.h>
#include <gmock/gmock.h>

#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/perfCounter.h"
#include "tests/support/logCapture.h"

namespace Pelmora::PerfCounter {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

class PublishedMapTest : public testing::Test {
protected:
   void SetUp() override {
      CreateCounterRegistry(registry);
      CreatePublishedAccumulatorMap(registry.Get(), map);
   }
   void TearDown() override { map->Clear(); }

   std::vector<std::string> Values() {
      QueryResults results;
      registry->CollectAll(results);
      std::vector<std::string> texts;
      for (const QueryResult& r : results) texts.push_back(r.ToString());
      return texts;
   }

   Ref<Registry> registry;
   Ref<PublishedAccumulatorMap> map;
};

TEST_F(PublishedMapTest, MergePublishesNewKeysAndAddsToKnownOnes) {
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   builder->Push("Pool");
   builder->Insert("Jobs", 2, CounterFactory());
   builder->Insert("Wait", 7, MeterFactory());
   map->Merge(*builder);
   map->Merge(*builder);
   EXPECT_EQ(2, map->GetSize());
   EXPECT_THAT(Values(), ElementsAre("/Pool/Jobs = 4", "/Pool/Wait/max = 7", "/Pool/Wait/mean = 7",
                                     "/Pool/Wait/min = 7", "/Pool/Wait/numSamples = 2",
                                     "/Pool/Wait/total = 14"));

   Ref<PublishedAccumulator> jobs;
   ASSERT_TRUE(map->Find("Pool/Jobs", jobs));
   EXPECT_EQ("/Pool/Jobs", jobs->GetName());
   jobs->Sample(10);
   EXPECT_EQ("/Pool/Jobs = 14", Values()[0]);
   EXPECT_FALSE(map->Find("Pool/Nothing", jobs));

   EXPECT_TRUE(map->Remove("Pool/Wait"));
   EXPECT_FALSE(map->Remove("Pool/Wait"));
   EXPECT_THAT(Values(), ElementsAre("/Pool/Jobs = 14"));
   map->Clear();
   EXPECT_EQ(0, registry->GetCounterCount());
}

TEST_F(PublishedMapTest, AFailedPublicationIsLoggedAndTheMergeGoesOn) {
   // Someone else already owns the counter path the key would publish under.
   Ref<LwCounter> squatter = new LwCounter("/Taken");
   Ref<PublishedAccumulator> published;
   CreatePublishedAccumulator(registry.Get(), squatter.Get(), published);
   published->Publish();

   Pelmora::TestSupport::ScopedLogCapture log;
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   builder->Insert("Taken", 1, CounterFactory());
   builder->Insert("Free", 1, CounterFactory());
   map->Merge(*builder);
   EXPECT_EQ(1, map->GetSize());
   EXPECT_THAT(log.Lines(),
               ElementsAre("8 ValidateNewCounters: Counter /Taken exists.",
                           "4 While publishing ctr Taken: Already exists: /Taken"));
   published->Unpublish();
}

TEST_F(PublishedMapTest, AddChecksKeysAndRefusesKnownOnes) {
   Ref<LwMeterAccumulator> meter = new LwMeterAccumulator("anything");
   meter->Sample(4);
   map->Add("Disk/Io", meter.Get());
   meter->Sample(100);  // the map holds its own copy
   EXPECT_EQ("/Disk/Io/total = 4", Values()[4]);
   EXPECT_THROW(map->Add("Disk/Io", meter.Get()), AlreadyExistsException);
   Pelmora::TestSupport::ScopedLogCapture log;
   EXPECT_THROW(map->Add("disk", meter.Get()), InvalidArgumentException);
   EXPECT_EQ(1u, log.Lines().size());
}

TEST_F(PublishedMapTest, ThreadsMergeTheirOwnBuildersThroughScopes) {
   constexpr int kThreads = 4, kRounds = 50;
   std::vector<std::thread> threads;
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([this, t] {
         for (int round = 0; round < kRounds; ++round) {
            TlsScope scope(map.Get());
            {
               TlsScope nested(map.Get());  // only the outermost scope merges
               nested.GetBuilder().Push("Work");
               nested.GetBuilder().Insert("Done", 1, CounterFactory());
               nested.GetBuilder().Insert("Cost", t, MeterFactory());
               nested.GetBuilder().Pop();
            }
            EXPECT_EQ(2, GetTlsMapBuilder()->GetSize());
            scope.GetBuilder().Push("Worker", std::to_string(t));
            scope.GetBuilder().Insert("Rounds", 1, CounterFactory());
         }
         EXPECT_EQ(0, GetTlsMapBuilder()->GetSize());
      });
   }
   for (auto& thread : threads) thread.join();

   Ref<PublishedAccumulator> done;
   ASSERT_TRUE(map->Find("Work/Done", done));
   NamedValues values;
   done->GetValues(values);
   EXPECT_EQ(kThreads * kRounds, values[0].second.Get());
   MeterAccessor cost(registry.Get(), "/Work/Cost");
   EXPECT_EQ(5, cost.Refresh());
   const Meter expected(kRounds * (0 + 1 + 2 + 3), kThreads * kRounds, 0, 3, 1);
   EXPECT_TRUE(cost.GetMeter().Equals(&expected)) << cost.GetMeter().ToString();
   std::vector<std::string> workers;
   registry->EnumeratePath("/Worker='2'", workers);
   EXPECT_THAT(workers, ElementsAre("Rounds"));
   EXPECT_EQ(2 + kThreads, map->GetSize());
}

TEST(PublishedMapDeathTest, MergingAnotherKindUnderAKnownKeyPanics) {
   Ref<Registry> registry;
   CreateCounterRegistry(registry);
   Ref<PublishedAccumulatorMap> map;
   CreatePublishedAccumulatorMap(registry.Get(), map);
   Ref<LwStatsBuilder> counts, meters;
   CreateLwStatsBuilder(counts);
   CreateLwStatsBuilder(meters);
   counts->Insert("Key", 1, CounterFactory());
   meters->Insert("Key", 1, MeterFactory());
   map->Merge(*counts);
   EXPECT_DEATH(map->Merge(*meters),
                "Assert Failed: \"\\(\\*itr\\)->GetType\\(\\) == itr2->first->GetType\\(\\)\"");
   map->Clear();
}

TEST(PublishedMapProcessTest, TheProcessMapPublishesInTheProcessRegistry) {
   PublishedAccumulatorMap* map = GetPublishedAccumulatorMap();
   ASSERT_EQ(map, GetPublishedAccumulatorMap());
   {
      TlsScope scope;
      scope.GetBuilder().Insert("ProcessMapTest", 3, CounterFactory());
   }
   std::vector<std::string> names = {"/ProcessMapTest"};
   Ref<Query> query;
   GetCounterRegistry()->CreateNamesQuery(names, query);
   QueryResults results;
   query->Execute(results);
   ASSERT_EQ(1u, results.size());
   EXPECT_EQ(3, results[0].value.Get());
   EXPECT_TRUE(map->Remove("ProcessMapTest"));
}

}  // namespace
}  // namespace Pelmora::PerfCounter
