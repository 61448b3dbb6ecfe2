#pragma once
// A source of light-weight statistics: something that, when asked, writes its current
// numbers into a statistics builder. The builder belongs to the counters layer; the
// interface sits in the core so that the core's scoreboard can be a provider.

#include "pelmora/object/export.h"

namespace Pelmora::PerfCounter {

class LwStatsBuilder;

class PELMORA_EXPORT LwStatsProvider {
public:
   virtual void GetStats(LwStatsBuilder& builder) = 0;

protected:
   // Providers are owned and destroyed through their own types.
   ~LwStatsProvider() = default;
};

}  // namespace Pelmora::PerfCounter
