#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "pelmora/system.h"
#include "src/internal/report.h"
#include "src/system/tls.h"

namespace Pelmora::System {
namespace {

// Collects what the library reports instead of writing it to standard error.
class CapturingSink : public Internal::ReportSink {
public:
   CapturingSink() { Internal::SetReportSink(this); }
   ~CapturingSink() { Internal::SetReportSink(nullptr); }
   bool IsLevelEnabled(int) override { return true; }
   void Log(int level, const std::string& text) override { lines.push_back({level, text}); }
   void LogMemoryBuffer(int, const std::string&, bool) override {}
   void Flush() override {}

   std::vector<std::pair<int, std::string>> lines;
};

class Counted : public ObjectImpl {
public:
   explicit Counted(int* alive) : _alive(alive) { ++*_alive; }
   ~Counted() override { --*_alive; }

private:
   int* _alive;
};

TEST(TlsKeyTableTest, ReleasedIndexesAreReusedNewestFirstWithNewVersions) {
   EXPECT_FALSE(TlsKeyTable::IsKey(TlsKeyTable::MakeKey(0, 5)));  // version 0 is no key
   TlsKeyTable table;
   std::vector<TlsKey> keys;
   for (int i = 0; i < 3; ++i) keys.push_back(table.Reserve());
   table.Release(keys[0]);
   table.Release(keys[2]);
   for (int i = 0; i < 3; ++i) keys.push_back(table.Reserve());
   std::vector<uint32_t> indexes;
   for (TlsKey key : keys) indexes.push_back(TlsKeyTable::GetIndex(key));
   EXPECT_EQ((std::vector<uint32_t>{0, 1, 2, 2, 0, 3}), indexes);
   EXPECT_NE(keys[2], keys[3]);
   EXPECT_NE(keys[0], keys[4]);
}

TEST(TlsKeyTableTest, TheVersionNeverWrapsToZero) {
   TlsKeyTable table;
   uint32_t previous = 0;
   for (int i = 0; i < 0x8001; ++i) {
      TlsKey key = table.Reserve();
      ASSERT_TRUE(TlsKeyTable::IsKey(key)) << i;
      ASSERT_EQ(0u, TlsKeyTable::GetIndex(key));
      ASSERT_NE(previous, TlsKeyTable::GetVersion(key));
      previous = TlsKeyTable::GetVersion(key);
      table.Release(key);
   }
   // 0x7FFF versions were used; the next one skips 0 and starts over at 1.
   EXPECT_EQ(2u, previous);
}

TEST(TlsKeyTableDeathTest, BadKeysAndAFullTablePanic) {
   TlsKeyTable table;
   TlsKey key = table.Reserve();
   const std::string badKey = "\"key == \\(TlsKey\\)_keys\\[index\\]\"";
   EXPECT_DEATH(table.Release(key + 1),
                "Assert Failed: " + badKey + " @ src/system/tls.cpp:[0-9]+");
   EXPECT_DEATH(table.Release(TlsKeyTable::MakeKey(1, 7)), badKey);
   EXPECT_DEATH((table.Release(key), table.Release(key)), badKey);
   EXPECT_DEATH(ReleaseTlsKey(0), badKey);
   EXPECT_DEATH(TlsKeyTable::MakeKey(1, TlsKeyTable::INVALID_INDEX),
                "\"index <= MAX_INDEX\" @ src/system/tls.cpp");
   EXPECT_DEATH(
       {
          TlsKeyTable full;
          for (uint32_t i = 0; i < TlsKeyTable::MAX_INDEX; ++i) full.Reserve();
          full.Reserve();
       },
       "\"_keys.size\\(\\) < MAX_INDEX\" @ src/system/tls.cpp");
}

TEST(TlsObjectsTest, SetGetAndClearReleaseTheObjects) {
   int alive = 0;
   TlsKeyTable table;
   TlsKey a = table.Reserve();
   TlsKey b = table.Reserve();
   {
      TlsObjects slots;
      EXPECT_EQ(nullptr, slots.Get(b));
      Ref<Counted> first = new Counted(&alive);
      slots.Set(b, first.Get());
      EXPECT_EQ(first.Get(), slots.Get(b));
      EXPECT_EQ(nullptr, slots.Get(a));
      slots.Set(b, new Counted(&alive));  // replacing releases `first`
      first.Reset();
      EXPECT_EQ(1, alive);
      slots.Set(b, nullptr);
      EXPECT_EQ(0, alive);
      slots.Set(a, new Counted(&alive));
      slots.Set(b, new Counted(&alive));
      slots.Clear();
      EXPECT_EQ(0, alive);
      EXPECT_EQ(nullptr, slots.Get(a));
      slots.Set(a, new Counted(&alive));
   }
   EXPECT_EQ(0, alive);  // and so does the destructor
}

// An object left under a released key whose index was reserved again.
class StaleTlsTest : public testing::Test {
protected:
   StaleTlsTest() {
      TlsKey old = table.Reserve();
      slots.Set(old, stale.Get());
      table.Release(old);
      reused = table.Reserve();
   }
   ~StaleTlsTest() override { slots.Clear(); }

   int alive = 0;
   TlsKeyTable table;
   TlsObjects slots;
   Ref<Counted> stale = new Counted(&alive);
   TlsKey reused;
};

TEST_F(StaleTlsTest, SettingReportsTheLeakAndReplacesIt) {
   const std::string staleText = stale->ToString();
   stale.Reset();
   CapturingSink sink;
   slots.Set(reused, new Counted(&alive));
   ASSERT_EQ(1u, sink.lines.size());
   EXPECT_EQ(Internal::kReportErrorLevel, sink.lines[0].first);
   EXPECT_EQ(
       "Found leaked TLS object at index 0. Expected version=2, found version=1, "
       "found object=" + staleText,
       sink.lines[0].second);
   EXPECT_EQ(1, alive);
}

using StaleTlsDeathTest = StaleTlsTest;

TEST_F(StaleTlsDeathTest, ReadingItOrUsingAnInvalidKeyEndsTheProcess) {
   EXPECT_DEATH(slots.Get(reused),
                "Found unexpected TLS object at index 0. Expected version=2, found version=1, "
                "found object=\\[[^]]*Counted[^]]*\\]\n\n\nPanic: Not Reached: @ "
                "src/system/tls.cpp");
   EXPECT_DEATH(slots.Set(TlsKeyTable::MakeKey(0, 1), stale.Get()),
                "\"TlsKeyTable::IsKey\\(key\\)\"");
}

TEST(TlsObjectsTest, AnObjectReleasedByClearMayStoreAnother) {
   static TlsKeyTable table;
   static TlsKey key = table.Reserve();
   class Reinstalling : public ObjectImpl {
   public:
      Reinstalling(TlsObjects* slots, int* alive) : _slots(slots), _alive(alive) {}
      ~Reinstalling() override { _slots->Set(key, new Counted(_alive)); }

   private:
      TlsObjects* _slots;
      int* _alive;
   };
   int alive = 0;
   TlsObjects slots;
   slots.Set(key, new Reinstalling(&slots, &alive));
   slots.Clear();
   EXPECT_EQ(0, alive);
   EXPECT_EQ(nullptr, slots.Get(key));
}

}  // namespace
}  // namespace Pelmora::System
