// The per-class live-instance table behind GetScoreboard().

#include "src/core/scoreboardHash2D.h"

#include <cstdlib>

#include "pelmora/formatter/messageFormatter.h"
#include "src/internal/hooks.h"

namespace Pelmora {

namespace Internal {

namespace {
std::atomic<ScoreboardStatsWriter> g_statsWriter{nullptr};
}

void SetScoreboardStatsWriter(ScoreboardStatsWriter writer) { g_statsWriter.store(writer); }
ScoreboardStatsWriter GetScoreboardStatsWriter() { return g_statsWriter.load(); }

}  // namespace Internal

int ScoreboardHash2D::RowOf(const void* key) {
   uint32_t k = static_cast<uint32_t>(reinterpret_cast<uintptr_t>(key));
   k = ~(k << 15) + k;
   k = k ^ (k >> 10);
   k = k * 9;
   k = k ^ (k >> 6);
   k = k + ~(k << 11);
   k = k ^ (k >> 16);
   int64_t signedK = static_cast<int32_t>(k);
   return static_cast<int>(std::llabs(signedK) % kRows);
}

void ScoreboardHash2D::Add(const char* name, int delta) {
   Row& row = _rows[RowOf(name)];
   int used = row.fill.Read();
   if (used > kCells) used = kCells;
   for (int i = 0; i < used; ++i) {
      if (row.cells[i].key.load(std::memory_order_acquire) == name) {
         row.cells[i].count.ReadAdd(delta);
         return;
      }
   }
   // The fill counter stops short of overflow; past 8 claims the row is simply full.
   if (row.fill.Read() >= kRows - 1) return;
   int index = row.fill.ReadInc();
   if (index >= kCells) return;
   row.cells[index].count.ReadAdd(delta);
   row.cells[index].key.store(name, std::memory_order_release);
}

void ScoreboardHash2D::Serialize(std::string& out) const {
   for (int r = 0; r < kRows; ++r) {
      for (int c = 0; c < kCells; ++c) {
         const Cell& cell = _rows[r].cells[c];
         const char* key = cell.key.load(std::memory_order_acquire);
         if (!key) continue;
         out += MessageFormatter::ASPrint("(%1, %2) => %3 - %4", r, c, key, cell.count.Read());
         out += "\n";
      }
   }
}

void ScoreboardHash2D::GetStats(PerfCounter::LwStatsBuilder& builder) {
   // The counters layer writes the statistics; without it there is nothing to write to.
   if (Internal::ScoreboardStatsWriter writer = Internal::GetScoreboardStatsWriter()) {
      writer(*this, builder);
   }
}

void ScoreboardHash2D::VisitClasses(ClassVisitor visitor, void* context) const {
   for (const Row& row : _rows) {
      for (const Cell& cell : row.cells) {
         const char* key = cell.key.load(std::memory_order_acquire);
         if (key) visitor(context, key, cell.count.Read());
      }
   }
}

int ScoreboardHash2D::GetSize() const {
   int size = 0;
   for (const Row& row : _rows) {
      for (const Cell& cell : row.cells) {
         if (cell.key.load(std::memory_order_relaxed)) ++size;
      }
   }
   return size;
}

namespace {
std::atomic<Scoreboard*> g_scoreboard{nullptr};
}

Scoreboard* GetScoreboard() { return g_scoreboard.load(std::memory_order_acquire); }

namespace Internal {
Scoreboard* GetOrCreateScoreboard() {
   Scoreboard* scoreboard = g_scoreboard.load(std::memory_order_acquire);
   if (scoreboard) return scoreboard;
   // Never freed: objects may be released during static destruction.
   static Scoreboard* const created = new ScoreboardHash2D();
   g_scoreboard.store(created, std::memory_order_release);
   return created;
}
}  // namespace Internal

}  // namespace Pelmora
