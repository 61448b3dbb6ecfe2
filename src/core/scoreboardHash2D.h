#pragma once
// ScoreboardHash2D: 2003 rows of 8 cells, each cell a type-name address and a count.
// Allocated once, never resized, updated without locks; a class whose row is full is
// not counted.

#include <atomic>
#include <cstdint>

#include "pelmora/object/atomic.h"
#include "pelmora/object/scoreboard.h"

namespace Pelmora {

class ScoreboardHash2D : public Scoreboard {
public:
   static constexpr int kRows = 2003;
   static constexpr int kCells = 8;

   void GetStats(PerfCounter::LwStatsBuilder& builder) override;
   void Increment(const char* name) override { Add(name, 1); }
   void Decrement(const char* name) override { Add(name, -1); }
   void Add(const char* name, int delta) override;
   void Serialize(std::string& out) const override;
   int GetSize() const override;
   void VisitClasses(ClassVisitor visitor, void* context) const override;

   static int RowOf(const void* key);

private:
   struct Cell {
      std::atomic<const char*> key{nullptr};
      Atomic<int32_t> count{0};
   };
   struct Row {
      Atomic<int32_t> fill{0};
      Cell cells[kCells];
   };
   Row _rows[kRows];
};

namespace Internal {
// The process-wide scoreboard, created on first use and kept until exit.
Scoreboard* GetOrCreateScoreboard();
}  // namespace Internal

}  // namespace Pelmora
