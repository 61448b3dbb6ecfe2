#include "tests/perfcounter/fixture.h"
#include "pelmora/object/scoreboard.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::HasSubstr;

class Tracked : public ObjectImpl {};

TEST(ScoreboardStatsTest, LiveObjectsAreReportedPerClass) {
   Ref<Tracked> a = new Tracked(), b = new Tracked();
   Ref<LwStatsBuilder> builder;
   CreateLwStatsBuilder(builder);
   GetScoreboard()->GetStats(*builder);
   EXPECT_THAT(Serialized(*builder),
               HasSubstr("Scoreboard/Class='" + std::string(typeid(Tracked).name()) +
                         "'/Instances count=2\n"));
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
