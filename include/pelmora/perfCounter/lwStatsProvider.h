#pragma once
// A source of light-weight statistics: something that, when asked, writes its current
// numbers into a statistics builder. Kept free of other includes so that the core's
// scoreboard can be one.

namespace Pelmora::PerfCounter {

class LwStatsBuilder;

class LwStatsProvider {
public:
   virtual void GetStats(LwStatsBuilder& builder) = 0;

protected:
   // Providers are owned and destroyed through their own types.
   ~LwStatsProvider() = default;
};

}  // namespace Pelmora::PerfCounter
