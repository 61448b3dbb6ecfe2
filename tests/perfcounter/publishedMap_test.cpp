#include <chrono>
#include <condition_variable>
#include <mutex>
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

// Two threads' builders disagreeing on a key's kind: the entry is refused, the rest of
// the merge goes on, and the process too.
TEST_F(PublishedMapTest, AnotherKindUnderAKnownKeyIsRefusedAndCounted) {
   Ref<LwStatsBuilder> counts, meters;
   CreateLwStatsBuilder(counts);
   CreateLwStatsBuilder(meters);
   counts->Insert("Key", 1, CounterFactory());
   meters->Insert("Key", 1, MeterFactory());
   meters->Insert("Other", 5, CounterFactory());
   map->Merge(*counts);
   Pelmora::TestSupport::ScopedLogCapture log;
   map->Merge(*meters);
   EXPECT_THAT(log.Lines(),
               ElementsAre("4 Refused to merge Key: published as another kind of accumulator"));
   EXPECT_EQ(1, map->GetRefusedCount());
   EXPECT_THAT(All(), ElementsAre("/Key = 1", "/Other = 5"));
}

// New keys stop at the limit; the limit is logged once each time it is reached.
TEST_F(PublishedMapTest, NewKeysBeyondTheLimitAreRefusedCountedAndLoggedOnce) {
   EXPECT_EQ(kDefaultPublishedKeyLimit, map->GetKeyLimit());
   map->SetKeyLimit(2);
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   for (const char* key : {"A", "B", "C", "D"}) builder->Insert(key, 1, CounterFactory());
   Pelmora::TestSupport::ScopedLogCapture log;
   map->Merge(*builder);
   map->Merge(*builder);  // known keys still add up; the refusals are not logged again
   EXPECT_THAT(All(), ElementsAre("/A = 2", "/B = 2"));
   EXPECT_EQ(4, map->GetRefusedCount());
   const char* const reached =
       "8 Published statistics reached their limit of 2 keys; new keys are refused";
   EXPECT_THAT(log.Lines(), ElementsAre(reached));
   Ref<LwMeterAccumulator> meter = new LwMeterAccumulator("x");
   EXPECT_THROW(map->Add("E", meter.Get()), FullException);

   EXPECT_TRUE(map->Remove("A"));
   map->Merge(*builder);  // room for one: A comes back, C and D are refused, logged anew
   EXPECT_THAT(All(), ElementsAre("/A = 1", "/B = 3"));
   EXPECT_EQ(6, map->GetRefusedCount());
   EXPECT_THAT(log.Lines(), ElementsAre(reached, reached));
}

// A scrape holding the registry back must not stall merges: a new key waits for the
// registry outside the map's lock, and the map serves others meanwhile.
TEST_F(PublishedMapTest, PublishingANewKeyDoesNotHoldTheMapWhileTheRegistryIsBusy) {
   Ref<LwStatsBuilder> known, fresh;
   CreateLwStatsBuilder(known);
   CreateLwStatsBuilder(fresh);
   known->Insert("Known", 1, CounterFactory());
   fresh->Insert("Fresh", 1, CounterFactory());
   map->Merge(*known);
   registry->WriteLock();
   std::thread publishing([&] { map->Merge(*fresh); });
   std::mutex mutex;
   std::condition_variable changed;
   bool served = false;
   std::thread other([&] {
      Ref<PublishedAccumulator> found;
      while (!map->Find("Fresh", found)) std::this_thread::yield();
      map->Merge(*known);
      std::lock_guard<std::mutex> lock(mutex);
      served = true;
      changed.notify_all();
   });
   {
      std::unique_lock<std::mutex> lock(mutex);
      EXPECT_TRUE(changed.wait_for(lock, std::chrono::seconds(5), [&] { return served; }))
          << "the map waited for the registry";
   }
   registry->Unlock();
   Pelmora::Testing::Join(publishing, "the publishing merge");
   Pelmora::Testing::Join(other, "the other merge");
   EXPECT_THAT(All(), ElementsAre("/Fresh = 1", "/Known = 2"));
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
