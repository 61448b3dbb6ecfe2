#pragma once
// Hooks through which a lower layer calls a higher one. The higher layer installs its hook
// once, when the library is loaded; until then the lower layer does without (see each).
// The report sink (exception dumps and panic reports, core -> log) is in report.h.
// Installing and reading a hook are thread-safe.

namespace Pelmora {
class Scoreboard;
namespace PerfCounter {
class LwStatsBuilder;
}
namespace Service {
class Config;
class LogManager;
}
}  // namespace Pelmora

namespace Pelmora::Internal {

// core -> perfcounter: writes the scoreboard's counts into a statistics builder. Without
// it Scoreboard::GetStats writes nothing. Defined in core.
using ScoreboardStatsWriter = void (*)(const Scoreboard& board, PerfCounter::LwStatsBuilder& builder);
void SetScoreboardStatsWriter(ScoreboardStatsWriter writer);
ScoreboardStatsWriter GetScoreboardStatsWriter();

// log -> config: applies a configuration's per-subsystem "level" entries to a log manager.
// Without it LogManager::LoadLogLevels throws InvalidStateException. Defined in log.
using LogLevelsLoader = void (*)(Service::LogManager& manager, Service::Config& config);
void SetLogLevelsLoader(LogLevelsLoader loader);
LogLevelsLoader GetLogLevelsLoader();

}  // namespace Pelmora::Internal
