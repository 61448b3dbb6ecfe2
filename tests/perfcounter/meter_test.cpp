#include <thread>

#include "tests/perfcounter/fixture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::ElementsAre;

Meter Sampled(std::initializer_list<long long> values) {
   Meter meter;
   for (long long v : values) meter.Sample(v);
   return meter;
}

TEST(MeterTest, SamplingMergingAndText) {
   const Meter negative(-3, 1, -3, -3, -3), merged(14, 4, -1, 8, 3);
   EXPECT_TRUE(Sampled({-3}).Equals(&negative));
   // The mean is recomputed from the total and truncates toward zero.
   EXPECT_EQ(-3, Sampled({-3, -4}).GetMean());
   EXPECT_EQ(3, Sampled({3, 4}).GetMean());
   EXPECT_EQ(1, Sampled({0, 1, 1, 2}).GetMean());
   Meter a = Sampled({5, 2}), b = Sampled({8, -1}), empty;
   a.Merge(&b);
   EXPECT_TRUE(a.Equals(&merged)) << a.ToString();
   empty.Merge(&b);
   EXPECT_TRUE(empty.Equals(&b));
   EXPECT_FALSE(empty.Equals(nullptr));
   EXPECT_EQ("Meter total=14 numSamples=4 min=-1 max=8 mean=3", a.ToString());
}

TEST(MeterDeathTest, MergingANegativeSampleCountPanics) {
   Meter bad(1, -1, 0, 0, 0);
   EXPECT_DEATH(Meter().Merge(&bad), "Assert Failed: \"src->_numSamples >= 0\"");
}

using MeterAccumulatorTest = RegistryFixture;

TEST_F(MeterAccumulatorTest, PublishesItsVisibleFieldsUntilUnpublishedOrDestroyed) {
   {
      MeterAccumulator meter(registry.Get(), "/Http/Latency", Meter(10, 1, 10, 10, 10));
      EXPECT_THROW(meter.Unpublish(), InvalidStateException);
      meter.Publish();
      EXPECT_THROW(meter.Publish(), InvalidStateException);
      meter.Sample(20);
      EXPECT_THAT(Match("Latency"),
                  ElementsAre("/Http/Latency/total = 30", "/Http/Latency/numSamples = 2",
                              "/Http/Latency/min = 10", "/Http/Latency/max = 20",
                              "/Http/Latency/mean = 15"));
      meter.Unpublish();
      EXPECT_EQ(0, registry->GetCounterCount());
      EXPECT_THROW(meter.SetCounterVisible(static_cast<Meter::Counter>(5), false),
                   InvalidArgumentException);
      meter.SetCounterVisible(Meter::COUNTER_MIN, false);
      meter.SetCounterVisible(Meter::COUNTER_MAX, false);
      meter.Publish();
      EXPECT_THROW(meter.SetCounterVisible(Meter::COUNTER_MIN, true), InvalidStateException);
      EXPECT_EQ(3u, Match("Latency").size());
   }
   EXPECT_EQ(0, registry->GetCounterCount());
   MeterAccumulator unregistered(nullptr, "/Nowhere"), bad(registry.Get(), "Latency");
   EXPECT_THROW(unregistered.Publish(), InvalidStateException);
   EXPECT_THROW(bad.Publish(), InvalidArgumentException);
   EXPECT_FALSE(bad.IsPublished());
}

TEST_F(MeterAccumulatorTest, AccessorReadsThePublishedMeterBack) {
   MeterAccumulator meter(registry.Get(), "/Db/Query"), longer(registry.Get(), "/Db/QueryPlan");
   MeterAccessor accessor(registry.Get(), "/Db/Query"), second(registry.Get(), "/Db/Query");
   EXPECT_EQ(0, accessor.Refresh());
   meter.Publish();
   for (long long v : {5, 2, 8}) meter.Sample(v);
   EXPECT_EQ(5, accessor.Refresh());
   const Meter expected(15, 3, 2, 8, 5);
   EXPECT_TRUE(accessor.GetMeter().Equals(&expected)) << accessor.GetMeter().ToString();

   // Consume ignores other meters, also one whose name extends this one's.
   longer.Publish();
   longer.Sample(100);
   Ref<Query> all;
   registry->CreateRegexQuery("^/Db/", true, all);
   QueryResults results;
   all->Execute(results);
   ASSERT_EQ(10u, results.size());
   meter.Sample(-10);
   EXPECT_EQ(5, second.Consume(results));
   EXPECT_TRUE(second.GetMeter().Equals(&expected));
}

TEST_F(MeterAccumulatorTest, ConcurrentSamplesAddUpExactly) {
   MeterAccumulator meter(registry.Get(), "/Hot");
   MeterAccessor accessor(registry.Get(), "/Hot");
   meter.Publish();
   constexpr int kThreads = 4, kSamples = 20000;
   std::vector<std::thread> threads;
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&meter, t] {
         for (int i = 1; i <= kSamples; ++i) meter.Sample(t % 2 ? i : -i);
      });
   }
   for (int i = 0; i < 200; ++i) {  // a reader alongside always sees a consistent meter
      accessor.Refresh();
      ASSERT_LE(accessor.GetMeter().GetMin(), accessor.GetMeter().GetMax());
   }
   Pelmora::Testing::JoinAll(threads, "threads to finish");
   const Meter expected(0, kThreads * kSamples, -kSamples, kSamples, 0);
   EXPECT_TRUE(meter.GetMeter().Equals(&expected)) << meter.GetMeter().ToString();
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
