#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <memory>
#include <thread>
#include <vector>

#include "pelmora/object/scoreboard.h"
#include "src/core/scoreboardHash2D.h"
#include "tests/support/watchdog.h"

namespace Pelmora {
namespace {

// Nine type-name strings whose addresses hash to one row.
std::vector<const char*> KeysOfOneRow(const char* pool, size_t size, int wanted) {
   std::vector<const char*> keys;
   int row = ScoreboardHash2D::RowOf(pool);
   for (size_t i = 0; i < size && static_cast<int>(keys.size()) < wanted; ++i) {
      if (ScoreboardHash2D::RowOf(pool + i) == row) keys.push_back(pool + i);
   }
   return keys;
}

TEST(ScoreboardHash2DTest, RowHashFollowsTheMixingSteps) {
   // Worked out once from the shifts, additions and multiplication of the row hash.
   EXPECT_EQ(837, ScoreboardHash2D::RowOf(reinterpret_cast<const void*>(0x1)));
   EXPECT_EQ(1955, ScoreboardHash2D::RowOf(reinterpret_cast<const void*>(0x1000)));
   EXPECT_EQ(1396, ScoreboardHash2D::RowOf(reinterpret_cast<const void*>(0xdeadbeef)));
   for (uintptr_t a = 0; a < 100000; a += 97) {
      int row = ScoreboardHash2D::RowOf(reinterpret_cast<const void*>(a));
      ASSERT_GE(row, 0);
      ASSERT_LT(row, 2003);
   }
}

TEST(ScoreboardHash2DTest, KeysCompareByAddressAndTheNinthInARowIsDropped) {
   auto board = std::make_unique<ScoreboardHash2D>();
   static char pool[1 << 20];
   std::vector<const char*> keys = KeysOfOneRow(pool, sizeof(pool), 9);
   ASSERT_EQ(9u, keys.size());
   for (const char* key : keys) board->Increment(key);
   board->Increment(keys[0]);
   board->Decrement(keys[1]);
   EXPECT_EQ(8, board->GetSize());

   std::string text;
   board->Serialize(text);
   int row = ScoreboardHash2D::RowOf(keys[0]);
   EXPECT_NE(std::string::npos, text.find("(" + std::to_string(row) + ", 0) =>  - 2\n")) << text;
   EXPECT_NE(std::string::npos, text.find("(" + std::to_string(row) + ", 1) =>  - 0\n")) << text;
   EXPECT_EQ(8, std::count(text.begin(), text.end(), '\n'));

   // Same text at another address is another key.
   static const char a[] = "N3Foo";
   static const char b[] = "N3Foo";
   auto fresh = std::make_unique<ScoreboardHash2D>();
   fresh->Increment(a);
   fresh->Increment(b);
   EXPECT_EQ(2, fresh->GetSize());
}

TEST(ScoreboardHash2DTest, ConcurrentClaimsLoseNoCountOfAClaimedKey) {
   auto board = std::make_unique<ScoreboardHash2D>();
   static char own[4][8];  // each thread claims a key of its own while the others run
   static const char key[] = "N7Pelmora5ThingE";
   board->Increment(key);  // claimed before the race
   std::vector<std::thread> threads;
   for (int t = 0; t < 4; ++t) {
      threads.emplace_back([&, t] {
         for (int i = 0; i < 10000; ++i) {
            board->Increment(key);
            board->Decrement(key);
         }
         board->Increment(key);
         board->Increment(own[t]);
      });
   }
   Pelmora::Testing::JoinAll(threads, "threads to finish");
   std::string text;
   board->Serialize(text);
   EXPECT_NE(std::string::npos, text.find("N7Pelmora5ThingE - 5\n")) << text;
   EXPECT_EQ(5, board->GetSize());  // no row holds more than five of these
}

// Code built apart from the library (plugins) reaches the scoreboard through its table of
// virtual operations, so the order Increment, Decrement, Serialize, GetSize is fixed and
// new operations go after them.
TEST(ScoreboardTest, VirtualOperationsKeepTheirSlotOrder) {
   // A pointer to a virtual member holds one plus the operation's offset in the table.
   auto slot = [](auto member) {
      static_assert(sizeof(member) == 2 * sizeof(uintptr_t));
      uintptr_t words[2];
      std::memcpy(words, &member, sizeof(words));
      EXPECT_EQ(1u, words[0] % sizeof(void*)) << "not a virtual operation";
      return (words[0] - 1) / sizeof(void*);
   };
   size_t increment = slot(&Scoreboard::Increment);
   EXPECT_EQ(increment + 1, slot(&Scoreboard::Decrement));
   EXPECT_EQ(increment + 2, slot(&Scoreboard::Serialize));
   EXPECT_EQ(increment + 3, slot(&Scoreboard::GetSize));
}

}  // namespace
}  // namespace Pelmora
