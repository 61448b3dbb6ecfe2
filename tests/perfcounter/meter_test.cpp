#include <gtest/gtest.h>
#include <gmock/gmock.h>

#include <thread>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/perfCounter.h"

namespace Pelmora::PerfCounter {
namespace {

using testing::ElementsAre;

Meter Sampled(std::initializer_list<long long> values) {
   Meter meter;
   for (long long v : values) meter.Sample(v);
   return meter;
}

TEST(MeterTest, SamplingKeepsTotalCountExtremesAndTruncatedMean) {
   Meter meter = Sampled({5, 2, 8});
   EXPECT_EQ(15, meter.GetTotal());
   EXPECT_EQ(3, meter.GetNumSamples());
   EXPECT_EQ(2, meter.GetMin());
   EXPECT_EQ(8, meter.GetMax());
   EXPECT_EQ(5, meter.GetMean());

   Meter negative = Sampled({-3});
   Meter expected(-3, 1, -3, -3, -3);
   EXPECT_TRUE(negative.Equals(&expected)) << negative.ToString();

   // The mean is recomputed from the total and truncates toward zero.
   EXPECT_EQ(-3, Sampled({-3, -4}).GetMean());
   EXPECT_EQ(3, Sampled({3, 4}).GetMean());
   EXPECT_EQ(1, Sampled({0, 1, 1, 2}).GetMean());
}

TEST(MeterTest, MergeIsSamplingBothAndTextNamesEveryField) {
   Meter a = Sampled({5, 2});
   Meter b = Sampled({8, -1});
   a.Merge(&b);
   Meter expected(14, 4, -1, 8, 3);
   EXPECT_TRUE(a.Equals(&expected)) << a.ToString();
   Meter empty;
   empty.Merge(&b);
   EXPECT_TRUE(empty.Equals(&b));
   EXPECT_FALSE(empty.Equals(nullptr));
   EXPECT_EQ("Meter total=14 numSamples=4 min=-1 max=8 mean=3", a.ToString());
}

TEST(MeterDeathTest, MergingANegativeSampleCountPanics) {
   Meter bad(1, -1, 0, 0, 0);
   EXPECT_DEATH(Meter().Merge(&bad), "Assert Failed: \"src->_numSamples >= 0\"");
}

class MeterAccumulatorTest : public testing::Test {
protected:
   void SetUp() override { CreateCounterRegistry(registry); }

   std::vector<std::string> Values(const std::string& pattern) {
      Ref<Query> query;
      registry->CreateRegexQuery(pattern, true, query);
      QueryResults results;
      query->Execute(results);
      std::vector<std::string> texts;
      for (const QueryResult& r : results) texts.push_back(r.ToString());
      return texts;
   }

   Ref<Registry> registry;
};

TEST_F(MeterAccumulatorTest, PublishesItsFieldsUntilUnpublishedOrDestroyed) {
   {
      MeterAccumulator meter(registry.Get(), "/Http/Latency", Meter(10, 1, 10, 10, 10));
      EXPECT_FALSE(meter.IsPublished());
      EXPECT_THROW(meter.Unpublish(), InvalidStateException);
      meter.Publish();
      EXPECT_TRUE(meter.IsPublished());
      EXPECT_THROW(meter.Publish(), InvalidStateException);
      meter.Sample(20);
      EXPECT_THAT(Values("Latency"),
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
      EXPECT_THAT(Values("Latency"),
                  ElementsAre("/Http/Latency/total = 30", "/Http/Latency/numSamples = 2",
                              "/Http/Latency/mean = 15"));
   }
   EXPECT_EQ(0, registry->GetCounterCount());

   MeterAccumulator unregistered(nullptr, "/Nowhere");
   EXPECT_THROW(unregistered.Publish(), InvalidStateException);
   MeterAccumulator bad(registry.Get(), "Latency");
   EXPECT_THROW(bad.Publish(), InvalidArgumentException);
   EXPECT_FALSE(bad.IsPublished());
}

TEST_F(MeterAccumulatorTest, AccessorReadsThePublishedMeterBack) {
   MeterAccumulator meter(registry.Get(), "/Db/Query");
   MeterAccessor accessor(registry.Get(), "/Db/Query");
   EXPECT_EQ(0, accessor.Refresh());
   meter.Publish();
   for (long long v : {5, 2, 8}) meter.Sample(v);
   EXPECT_EQ(5, accessor.Refresh());
   const Meter expected(15, 3, 2, 8, 5);
   EXPECT_TRUE(accessor.GetMeter().Equals(&expected)) << accessor.GetMeter().ToString();

   // Consume ignores other meters, also one whose name extends this one's.
   MeterAccumulator longer(registry.Get(), "/Db/QueryPlan");
   longer.Publish();
   longer.Sample(100);
   Ref<Query> all;
   registry->CreateRegexQuery("^/Db/", true, all);
   QueryResults results;
   all->Execute(results);
   ASSERT_EQ(10u, results.size());
   meter.Sample(-10);
   MeterAccessor second(registry.Get(), "/Db/Query");
   EXPECT_EQ(5, second.Consume(results));
   EXPECT_TRUE(second.GetMeter().Equals(&expected));
}

TEST_F(MeterAccumulatorTest, ConcurrentSamplesAddUpExactly) {
   MeterAccumulator meter(registry.Get(), "/Hot");
   meter.Publish();
   MeterAccessor accessor(registry.Get(), "/Hot");
   constexpr int kThreads = 4, kSamples = 20000;
   std::vector<std::thread> threads;
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&meter, t] {
         for (int i = 1; i <= kSamples; ++i) meter.Sample(t % 2 ? i : -i);
      });
   }
   // A reader runs alongside; it must always see a consistent meter.
   for (int i = 0; i < 200; ++i) {
      accessor.Refresh();
      const Meter& seen = accessor.GetMeter();
      ASSERT_LE(seen.GetMin(), seen.GetMax());
   }
   for (auto& thread : threads) thread.join();
   Meter result = meter.GetMeter();
   EXPECT_EQ(0, result.GetTotal());
   EXPECT_EQ(kThreads * kSamples, result.GetNumSamples());
   EXPECT_EQ(-kSamples, result.GetMin());
   EXPECT_EQ(kSamples, result.GetMax());
   EXPECT_EQ(0, result.GetMean());
}

}  // namespace
}  // namespace Pelmora::PerfCounter
