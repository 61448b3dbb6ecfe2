#include "tests/perfcounter/fixture.h"
#include "tests/support/logCapture.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::ElementsAre;

TEST(LwStatsBuilderTest, NamespacesMakeKeysAndAccumulatorsAccumulate) {
   Ref<LwStatsBuilder> builder, other;
   CreateLwStatsBuilder(builder);
   CreateLwStatsBuilder(other);
   const CounterFactory counters;
   const MeterFactory meters;
   Ref<LwMeterAccumulator> outside = new LwMeterAccumulator("x");
   outside->Sample(10);
   builder->Push("Pool");
   builder->Push("Thread", "io");
   builder->Insert("Busy", 2, counters);
   builder->Insert("Busy", 3, counters);
   builder->Insert("Wait", 40, meters);
   builder->Pop();
   builder->Insert("Size", 8, counters);
   builder->Push("Thread", "io");
   builder->Insert("Wait", outside.Get(), meters);

   long long total = 0;
   EXPECT_TRUE(builder->GetTotalCount("Busy", total));
   EXPECT_EQ(5, total);
   EXPECT_FALSE(builder->GetTotalCount("Size", total));  // it lives one namespace up
   EXPECT_THROW(builder->Insert("Busy", 1, meters), InvalidArgumentException);
   EXPECT_THROW(builder->Insert("Busy", outside.Get(), counters), InvalidArgumentException);
   EXPECT_EQ(
       "Pool/Size count=8\n"
       "Pool/Thread='io'/Busy count=5\n"
       "Pool/Thread='io'/Wait total=50 numSamples=2 min=10 max=40 mean=25\n",
       Serialized(*builder));
   other->Swap(*builder);
   EXPECT_EQ(0, builder->GetSize());
   EXPECT_TRUE(other->GetTotalCount("Busy", total));  // the namespaces moved along
   other->Reset();
   EXPECT_EQ("", Serialized(*other));
   builder->Insert("Top", 1, counters);  // the swapped-in stack was empty
   EXPECT_EQ("Top count=1\n", Serialized(*builder));
}

TEST(LwStatsBuilderTest, AnInvalidKeyIsLoggedOnceAndDroppedAndPoppingNothingPanics) {
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   EXPECT_DEATH(builder->Pop(), "Assert Failed: \"!_namespaces.empty\\(\\)\"");
   Pelmora::TestSupport::ScopedLogCapture log;
   builder->Push("pool");
   for (int i = 0; i < 3; ++i) builder->Insert("Busy", 1, CounterFactory());
   EXPECT_EQ(0, builder->GetSize());
   EXPECT_THAT(log.Lines(), ElementsAre("4 [ValidateStatsScope] Found an invalid key: pool/Busy"));
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
