#include "tests/perfcounter/fixture.h"
#include "tests/support/logCapture.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::ElementsAre;

TEST(ValidateStatsScopeTest, KeysFollowTheScopeGrammar) {
   for (const char* key : {"Pool/Thread='io'/Busy", "A", "A='x'", "A/B='1'/C", "Zed='a b'/Q"}) {
      EXPECT_TRUE(ValidateStatsScope(key)) << key;
   }
   Pelmora::TestSupport::ScopedLogCapture log;
   for (const char* key : {"", "pool/x", "A//B", "A/b", "A=x", "A/", "A=", "A='x'='y'", "A/='x'"}) {
      EXPECT_FALSE(ValidateStatsScope(key)) << key;
   }
   ASSERT_EQ(9u, log.Lines().size());  // each refusal is logged
   EXPECT_EQ("4 [ValidateStatsScope] Found an invalid key: pool/x", log.Lines()[1]);
}

TEST(LwAccumulatorTest, CountersAndMetersMergeAndPublishUnderTheirName) {
   Ref<LwCounter> counter = new LwCounter("/C"), more = new LwCounter("/D");
   counter->Sample(3);
   more->Sample(4);
   counter->Merge(more.Get());
   NamedValues values;
   counter->GetValues(values);
   Ref<LwMeterAccumulator> meter = new LwMeterAccumulator("/M");
   meter->Sample(-3);
   meter->GetValues(values);
   ASSERT_EQ(6u, values.size());
   EXPECT_EQ(Metadata::TYPE_COUNTER, values[0].first->GetType());
   EXPECT_EQ("/C = 7", values[0].first->GetName() + " = " + std::to_string(values[0].second.Get()));
   EXPECT_EQ("/M/numSamples", values[2].first->GetName());
   EXPECT_EQ(Metadata::TYPE_METER_MEAN, values[5].first->GetType());
   std::vector<Value> plain;
   meter->ReadValues(plain);
   ASSERT_EQ(5u, plain.size());
   for (size_t i = 0; i < plain.size(); ++i) EXPECT_EQ(values[i + 1].second, plain[i]);
   EXPECT_THROW(counter->Merge(meter.Get()), InvalidArgumentException);
}

TEST(LwAccumulatorTest, HistoryKeepsTheNewestSamples) {
   EXPECT_THROW(LwHistoryMeterAccumulator("/H", 0), InvalidArgumentException);
   Ref<LwAccumulator> made, empty;
   HistoryMeterFactory(3).Create("/H", made);
   auto* history = dynamic_cast<LwHistoryMeterAccumulator*>(made.Get());
   ASSERT_NE(nullptr, history);
   auto kept = [&](std::vector<long long> out = {}) { return history->GetHistory(out), out; };
   for (long long v : {1, 2, 3, 4}) history->Sample(v);
   EXPECT_THAT(kept(), ElementsAre(2, 3, 4));
   history->CreateEmpty("/Other", empty);
   auto* source = static_cast<LwHistoryMeterAccumulator*>(empty.Get());
   EXPECT_EQ(3, source->GetHistorySize());
   source->Sample(9);
   history->Merge(source);
   EXPECT_EQ("total=19 numSamples=5 min=1 max=9 mean=3 history=[3,4,9]", history->Describe());
   EXPECT_THROW(history->Merge(Ref<LwMeterAccumulator>(new LwMeterAccumulator("/P")).Get()),
                InvalidArgumentException);
   history->Reset();
   EXPECT_TRUE(kept().empty());
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
