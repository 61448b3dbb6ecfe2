// Reports the core's per-class instance counts as Scoreboard/Class='<name>'/Instances.
// Installed as the scoreboard's statistics writer when the library is loaded.

#include "pelmora/object/scoreboard.h"
#include "pelmora/perfCounter/lwStats.h"
#include "src/internal/hooks.h"

namespace Pelmora::PerfCounter {

namespace {

void WriteScoreboardStats(const Scoreboard& board, LwStatsBuilder& builder) {
   static const CounterFactory factory;
   builder.Push("Scoreboard");
   board.VisitClasses(
      [](void* context, const char* name, int count) {
         auto& out = *static_cast<LwStatsBuilder*>(context);
         out.Push("Class", name);
         out.Insert("Instances", count, factory);
         out.Pop();
      },
      &builder);
   builder.Pop();
}

[[maybe_unused]] const bool g_installed =
   (Internal::SetScoreboardStatsWriter(&WriteScoreboardStats), true);

}  // namespace

}  // namespace Pelmora::PerfCounter
