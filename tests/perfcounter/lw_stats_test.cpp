#include <gtest/gtest.h>
#include <gmock/gmock.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"
#include "pelmora/object/scoreboard.h"
#include "pelmora/perfCounter.h"
#include "tests/support/logCapture.h"

namespace Pelmora::PerfCounter {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

TEST(ValidateStatsScopeTest, KeysFollowTheScopeGrammar) {
   for (const char* key : {"Pool/Thread='io'/Busy", "A", "A='x'", "A/B='1'/C", "Zed='a b'/Q"}) {
      EXPECT_TRUE(ValidateStatsScope(key)) << key;
   }
   Pelmora::TestSupport::ScopedLogCapture log;
   for (const char* key : {"", "pool/x", "A//B", "A/b", "A=x", "A/", "A=", "A='x'='y'", "A/='x'"}) {
      EXPECT_FALSE(ValidateStatsScope(key)) << key;
   }
   std::vector<std::string> lines = log.Lines();
   ASSERT_EQ(9u, lines.size());
   EXPECT_EQ("4 [ValidateStatsScope] Found an invalid key: pool/x", lines[1]);
}

std::string Serialized(const LwStatsBuilder& builder) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   builder.Serialize(writer.Get());
   return writer->GetString();
}

TEST(LwStatsBuilderTest, NamespacesMakeKeysAndAccumulatorsAccumulate) {
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   const CounterFactory counters;
   const MeterFactory meters;
   builder->Push("Pool");
   builder->Push("Thread", "io");
   builder->Insert("Busy", 2, counters);
   builder->Insert("Busy", 3, counters);
   builder->Insert("Wait", 40, meters);
   builder->Pop();
   builder->Insert("Size", 8, counters);
   Ref<LwMeterAccumulator> outside = new LwMeterAccumulator("x");
   outside->Sample(10);
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

   std::vector<std::pair<Ref<LwAccumulator>, std::string>> entries;
   builder->GetEntries(entries);
   ASSERT_EQ(3u, entries.size());
   EXPECT_EQ("Pool/Thread='io'/Wait", entries[2].first->GetName());
   EXPECT_EQ(LwAccumulator::TYPE_METER, entries[2].first->GetType());

   Ref<LwStatsBuilder> other;
   CreateLwStatsBuilder(other);
   other->Swap(*builder);
   EXPECT_EQ(0, builder->GetSize());
   EXPECT_EQ(3, other->GetSize());
   EXPECT_TRUE(other->GetTotalCount("Busy", total));  // the namespaces moved along
   other->Reset();
   EXPECT_EQ("", Serialized(*other));
   builder->Insert("Top", 1, counters);  // the swapped-in stack was empty
   EXPECT_EQ("Top count=1\n", Serialized(*builder));
}

TEST(LwStatsBuilderTest, AnInvalidKeyIsLoggedOnceAndDropped) {
   Pelmora::TestSupport::ScopedLogCapture log;
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   builder->Push("pool");
   for (int i = 0; i < 3; ++i) builder->Insert("Busy", 1, CounterFactory());
   EXPECT_EQ(0, builder->GetSize());
   EXPECT_THAT(log.Lines(), ElementsAre("4 [ValidateStatsScope] Found an invalid key: pool/Busy"));
}

TEST(LwStatsBuilderDeathTest, PoppingAnEmptyStackPanics) {
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   EXPECT_DEATH(builder->Pop(), "Assert Failed: \"!_namespaces.empty\\(\\)\"");
}

TEST(LwAccumulatorTest, KindsPublishTheirCountersUnderTheirName) {
   Ref<LwCounter> counter = new LwCounter("/C");
   counter->Sample(3);
   Ref<LwCounter> more = new LwCounter("/D");
   more->Sample(4);
   counter->Merge(more.Get());
   NamedValues values;
   counter->GetValues(values);
   Ref<LwMeterAccumulator> meter = new LwMeterAccumulator("/M");
   meter->Sample(-3);
   meter->GetValues(values);
   ASSERT_EQ(6u, values.size());
   EXPECT_EQ("/C", values[0].first->GetName());
   EXPECT_EQ(Metadata::TYPE_COUNTER, values[0].first->GetType());
   EXPECT_EQ(7, values[0].second.Get());
   EXPECT_EQ("/M/numSamples", values[2].first->GetName());
   EXPECT_EQ(Metadata::TYPE_METER_MEAN, values[5].first->GetType());
   EXPECT_EQ(-3, values[5].second.Get());
   std::vector<Value> plain;
   meter->ReadValues(plain);
   ASSERT_EQ(5u, plain.size());
   for (size_t i = 0; i < plain.size(); ++i) EXPECT_EQ(values[i + 1].second, plain[i]);
   EXPECT_THROW(counter->Merge(meter.Get()), InvalidArgumentException);
}

TEST(LwAccumulatorTest, HistoryKeepsTheNewestSamples) {
   EXPECT_THROW(LwHistoryMeterAccumulator("/H", 0), InvalidArgumentException);
   Ref<LwAccumulator> made;
   HistoryMeterFactory(3).Create("/H", made);
   auto* history = dynamic_cast<LwHistoryMeterAccumulator*>(made.Get());
   ASSERT_NE(nullptr, history);
   for (long long v : {1, 2, 3, 4}) history->Sample(v);
   std::vector<long long> kept;
   history->GetHistory(kept);
   EXPECT_THAT(kept, ElementsAre(2, 3, 4));
   EXPECT_EQ(10, history->GetTotal());

   Ref<LwAccumulator> empty;
   history->CreateEmpty("/Other", empty);
   auto* source = static_cast<LwHistoryMeterAccumulator*>(empty.Get());
   EXPECT_EQ(3, source->GetHistorySize());
   source->Sample(9);
   history->Merge(source);
   kept.clear();
   history->GetHistory(kept);
   EXPECT_THAT(kept, ElementsAre(3, 4, 9));
   EXPECT_EQ("total=19 numSamples=5 min=1 max=9 mean=3 history=[3,4,9]", history->Describe());
   Ref<LwMeterAccumulator> plainMeter = new LwMeterAccumulator("/P");
   EXPECT_THROW(history->Merge(plainMeter.Get()), InvalidArgumentException);
   history->Reset();
   kept.clear();
   history->GetHistory(kept);
   EXPECT_TRUE(kept.empty());
}

class Tracked : public ObjectImpl {};

TEST(ScoreboardStatsTest, LiveObjectsAreReportedPerClass) {
   Ref<Tracked> a = new Tracked(), b = new Tracked();
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   ASSERT_NE(nullptr, GetScoreboard());
   GetScoreboard()->GetStats(*builder);
   builder->Push("Scoreboard");
   builder->Push("Class", typeid(Tracked).name());
   long long live = 0;
   ASSERT_TRUE(builder->GetTotalCount("Instances", live));
   EXPECT_EQ(2, live);
   EXPECT_THAT(Serialized(*builder),
               HasSubstr("Scoreboard/Class='" + std::string(typeid(Tracked).name()) +
                         "'/Instances count=2\n"));
}

}  // namespace
}  // namespace Pelmora::PerfCounter
