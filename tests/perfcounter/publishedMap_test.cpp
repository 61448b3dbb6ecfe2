#include <thread>

#include "tests/perfcounter/fixture.h"
#include "tests/support/logCapture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::ElementsAre;

class PublishedMapTest : public RegistryFixture {
protected:
   void SetUp() override {
      RegistryFixture::SetUp();
      CreatePublishedAccumulatorMap(registry.Get(), map);
   }
   void TearDown() override {
      map->Clear();
      RegistryFixture::TearDown();
   }
   Ref<PublishedAccumulatorMap> map;
};

TEST_F(PublishedMapTest, MergeAddFindAndRemove) {
   Ref<LwStatsBuilder> builder;
   Ref<LwMeterAccumulator> meter = new LwMeterAccumulator("anything");
   CreateLwStatsBuilder(builder);
   builder->Push("Pool");
   builder->Insert("Jobs", 2, CounterFactory());
   builder->Insert("Wait", 7, MeterFactory());
   map->Merge(*builder);
   map->Merge(*builder);  // known keys add up
   EXPECT_THAT(All(), ElementsAre("/Pool/Jobs = 4", "/Pool/Wait/max = 7", "/Pool/Wait/mean = 7",
                                  "/Pool/Wait/min = 7", "/Pool/Wait/numSamples = 2",
                                  "/Pool/Wait/total = 14"));
   Ref<PublishedAccumulator> jobs;
   ASSERT_TRUE(map->Find("Pool/Jobs", jobs));
   EXPECT_EQ("/Pool/Jobs", jobs->GetName());
   jobs->Sample(10);
   EXPECT_EQ("/Pool/Jobs = 14", All()[0]);
   EXPECT_FALSE(map->Find("Pool/Nothing", jobs));
   EXPECT_TRUE(map->Remove("Pool/Wait"));
   EXPECT_FALSE(map->Remove("Pool/Wait"));
   EXPECT_THAT(All(), ElementsAre("/Pool/Jobs = 14"));

   meter->Sample(4);
   map->Add("Disk/Io", meter.Get());
   meter->Sample(100);  // the map holds its own copy
   EXPECT_EQ("/Disk/Io/total = 4", All()[4]);
   EXPECT_THROW(map->Add("Disk/Io", meter.Get()), AlreadyExistsException);
   Pelmora::TestSupport::ScopedLogCapture log;
   EXPECT_THROW(map->Add("disk", meter.Get()), InvalidArgumentException);
   EXPECT_EQ(1u, log.Lines().size());
   map->Clear();
   EXPECT_EQ(0, registry->GetCounterCount());
}

TEST_F(PublishedMapTest, AFailedPublicationIsLoggedAndTheMergeGoesOn) {
   Add({"/Taken"});  // someone else owns the path the key would publish under
   Pelmora::TestSupport::ScopedLogCapture log;
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   builder->Insert("Taken", 1, CounterFactory());
   builder->Insert("Free", 1, CounterFactory());
   map->Merge(*builder);
   EXPECT_EQ(1, map->GetSize());
   EXPECT_THAT(log.Lines(), ElementsAre("8 ValidateNewCounters: Counter /Taken exists.",
                                        "4 While publishing ctr Taken: Already exists: /Taken"));
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
   Pelmora::Testing::JoinAll(threads, "threads to finish");
   EXPECT_THAT(Match("^/Work/Done"),
               ElementsAre("/Work/Done = " + std::to_string(kThreads * kRounds)));
   MeterAccessor cost(registry.Get(), "/Work/Cost");
   EXPECT_EQ(5, cost.Refresh());
   const Meter expected(kRounds * (0 + 1 + 2 + 3), kThreads * kRounds, 0, 3, 1);
   EXPECT_TRUE(cost.GetMeter().Equals(&expected)) << cost.GetMeter().ToString();
   EXPECT_THAT(Match("^/Worker='2'/"),
               ElementsAre("/Worker='2'/Rounds = " + std::to_string(kRounds)));
   EXPECT_EQ(2 + kThreads, map->GetSize());
}

using PublishedMapDeathTest = PublishedMapTest;

TEST_F(PublishedMapDeathTest, MergingAnotherKindUnderAKnownKeyPanics) {
   Ref<LwStatsBuilder> counts, meters;
   CreateLwStatsBuilder(counts);
   CreateLwStatsBuilder(meters);
   counts->Insert("Key", 1, CounterFactory());
   meters->Insert("Key", 1, MeterFactory());
   map->Merge(*counts);
   EXPECT_DEATH(map->Merge(*meters),
                "Assert Failed: \"\\(\\*itr\\)->GetType\\(\\) == itr2->first->GetType\\(\\)\"");
}

TEST(PublishedMapProcessTest, TheProcessMapPublishesInTheProcessRegistry) {
   {
      TlsScope scope;
      scope.GetBuilder().Insert("ProcessMapTest", 3, CounterFactory());
   }
   QueryResults results;
   GetCounterRegistry()->CollectAll(results);
   EXPECT_THAT(Texts(results), testing::Contains("/ProcessMapTest = 3"));
   EXPECT_TRUE(GetPublishedAccumulatorMap()->Remove("ProcessMapTest"));
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
